// What tests of nested arrays, calls and their results have in common.
#pragma once

#include <gtest/gtest.h>

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "NestedArrays.hpp"
#include "foundation/korveldata/ArrayFactory.hpp"
#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"
#include "krutil_protobuf/serializers/SerializerTest.hpp"

namespace arrays {

using foundation::korveldata::Array;
using foundation::korveldata::ArrayFactory;
using foundation::korveldata::ElementType;
using foundation::vantor::carrier::framing::BufferAllocator;
using krutil::protobuf_serializer::DataID;
using krutil::protobuf_serializer::NestedWriter;
using krutil::protobuf_serializer::writeArrays;
using transport::FrameContent;
using transport::FrameIndex;
using transport::FrameType;
using transport::Message;
using transport::MessageStream;
using transport::RecordingStream;
using transport::Registry;
using transport::SerializationContext;

/// Stays in its description.
inline Array small(double value) {
    return ArrayFactory().createScalar(value);
}

/// Goes out of line.
inline Array large(std::uint64_t size = 4096) {
    return ArrayFactory().createArray(ElementType::UInt8, {size});
}

template <class Proto>
std::vector<std::uint64_t> dataIDs(const Proto& proto) {
    return {proto.dataids().begin(), proto.dataids().end()};
}

inline std::vector<FrameIndex> indexes(const transport::Frames& frames) {
    std::vector<FrameIndex> result;
    for (const auto& frame : frames) {
        result.push_back(frame->index());
    }
    return result;
}

/// Frames of arrays to refer to. A test ends with as many buffers in use as it began with.
class ArraysTest : public transport::SerializerTest {
  protected:
    void TearDown() override {
        stream_->frames.clear();
        EXPECT_EQ(BufferAllocator::inUse(), before_);
    }

    std::size_t before() const { return before_; }

    /// Writes `arrays` with the serializers of `registry`, from index 1 on.
    static std::vector<DataID> writeTo(const std::shared_ptr<MessageStream>& stream,
                                       const std::shared_ptr<const Registry>& registry,
                                       const std::vector<Array>& arrays) {
        const SerializationContext context;
        NestedWriter nested(7, 1, stream, registry, context);
        return writeArrays(arrays, nested);
    }

    /// The frames of `arrays` from index 1 on.
    std::vector<FrameContent> framesOf(const std::vector<Array>& arrays) const {
        const auto stream = std::make_shared<RecordingStream>();
        writeTo(stream, registry_, arrays);
        return transport::contentOf(stream->frames);
    }

    /// `before`, and behind it a tagged frame of `proto`.
    template <class Proto>
    static std::unique_ptr<Message> messageOf(const Proto& proto, const std::string& tag,
                                              std::vector<FrameContent> before) {
        before.push_back({true, FrameType::Object, 7, before.size() + 1, tag, proto.SerializeAsString()});
        return transport::makeMessage(before);
    }

  private:
    std::size_t before_ = BufferAllocator::inUse();
};

}  // namespace arrays
