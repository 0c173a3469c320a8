// What tests have in common that write objects with a session's serializers and read them again.
#pragma once

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

#include "krutil_protobuf/support/TestTransport.hpp"

namespace transport {

/// A session's registry, and a stream that keeps what is written. Objects go to stream 7.
class SerializerTest : public testing::Test {
  protected:
    /// Writes `object` with the serializer of this name, from frame `first` on; returns the next index.
    template <class Family, class Object>
    FrameIndex writeAs(const std::string& name, const Object& object, FrameIndex first) const {
        return serializer<Family>(*registry_, name)
            .serialize(object, 7, first, stream_, registry_, SerializationContext());
    }

    /// Reads the object whose own frame is at `index` with the serializer of this name.
    template <class Family>
    auto readAs(const std::string& name, const std::unique_ptr<Message>& message, FrameIndex index) const {
        return serializer<Family>(*registry_, name).deserialize(index, message, registry_, SerializationContext());
    }

    const Frames& frames() const { return stream_->frames; }

    /// What has been written, as a peer receives it.
    std::unique_ptr<Message> received() const { return makeMessage(contentOf(frames())); }

    std::shared_ptr<Registry> registry_ = sessionRegistry();
    std::shared_ptr<RecordingStream> stream_ = std::make_shared<RecordingStream>();
};

}  // namespace transport
