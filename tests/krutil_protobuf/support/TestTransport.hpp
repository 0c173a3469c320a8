// The least transport that serializers need in a test: streams that keep frames, messages made of frames or bytes, and
// a registry as a session has it. One thread uses an object at a time.
#pragma once

#include <memory>
#include <stdexcept>
#include <string>
#include <typeinfo>
#include <vector>

#include "foundation/msg_svc/transport/layers/message/Message.hpp"
#include "foundation/msg_svc/transport/layers/message/MessageStream.hpp"
#include "foundation/msg_svc/transport/layers/serialization/Registry.hpp"
#include "foundation/msg_svc/transport/layers/serialization/SerializationContext.hpp"
#include "foundation/vantor/carrier/framing/DataFrame.hpp"
#include "foundation/vantor/carrier/framing/TaggedFrame.hpp"
#include "samples/Samples.hpp"

namespace transport {

using foundation::msg_svc::transport::layers::message::Message;
using foundation::msg_svc::transport::layers::message::MessageStream;
using foundation::msg_svc::transport::layers::serialization::Registry;
using foundation::msg_svc::transport::layers::serialization::SerializationContext;
using foundation::msg_svc::transport::layers::serialization::SerializerAPI;
using foundation::msg_svc::transport::layers::serialization::SerializerBase;
using foundation::vantor::carrier::framing::DataFrame;
using foundation::vantor::carrier::framing::Frame;
using foundation::vantor::carrier::framing::FrameBuffer;
using foundation::vantor::carrier::framing::FrameIndex;
using foundation::vantor::carrier::framing::FrameType;
using foundation::vantor::carrier::framing::StreamID;
using foundation::vantor::carrier::framing::TaggedFrame;

using Frames = std::vector<std::unique_ptr<Frame>>;

/// Keeps every frame that is appended.
class RecordingStream : public MessageStream {
  public:
    void append(std::unique_ptr<Frame>& frame) override;

    Frames frames;
};

/// Refuses one frame, counted from 0, with std::runtime_error "stream is full", and keeps all others.
class ThrowingStream final : public RecordingStream {
  public:
    explicit ThrowingStream(int refused) : refused_(refused) {}

    void append(std::unique_ptr<Frame>& frame) override {
        if (refused_-- == 0) {
            throw std::runtime_error("stream is full");
        }
        RecordingStream::append(frame);
    }

  private:
    int refused_;
};

/// What a frame is and holds, as a value: tests copy it, change it and make frames of it again.
struct FrameContent {
    bool tagged = true;
    FrameType type = FrameType::Object;
    StreamID streamID = 0;
    FrameIndex index = 1;
    std::string tag;
    std::string bytes;

    bool operator==(const FrameContent&) const = default;
};

FrameContent contentOf(const Frame& frame);
std::vector<FrameContent> contentOf(const Frames& frames);

/// A buffer with a copy of `bytes`, from the allocator that a transport receives into.
FrameBuffer makeBuffer(const std::string& bytes);

std::unique_ptr<Frame> makeFrame(const FrameContent& content);

/// A received message: each frame stands at its own index, null everywhere else.
std::unique_ptr<Message> makeMessage(const std::vector<FrameContent>& frames);

/// A message of one tagged frame at index 1.
std::unique_ptr<Message> makeMessage(const std::string& tag, const std::string& bytes,
                                     FrameType type = FrameType::Object);

/// The registry of a session: filled by the protocol's initializer.
std::shared_ptr<Registry> sessionRegistry();

/// The frames that a sample becomes, the first at `firstIndex`, on stream 7.
std::vector<FrameContent> writtenFrames(const SerializerBase& serializer, const samples::Object& object,
                                        const std::shared_ptr<const Registry>& registry, FrameIndex firstIndex = 1);

/// What a fresh session reads from a message of one tagged frame at index 1; throws what the tag's serializer throws.
samples::Object readObject(const std::string& tag, const std::string& bytes, FrameType type = FrameType::Object);

/// The message in a frame, as far as its bytes parse.
template <class Proto>
Proto parsed(const Frame& frame) {
    Proto proto;
    proto.ParseFromArray(frame.data(), static_cast<int>(frame.size()));
    return proto;
}

/// The serializer of this name as a serializer of `Family`; throws std::bad_cast when it is of another.
template <class Family>
const Family& serializer(const Registry& registry, const std::string& name) {
    return dynamic_cast<const Family&>(*registry.find(name));
}

/// A serializer of `Family` that is registered for a class of another family. Whoever looks for a serializer of that
/// class finds it and can do nothing with it.
template <class Family>
class MisplacedSerializer;

template <class T, class Ptr, class Ret>
class MisplacedSerializer<SerializerAPI<T, Ptr, Ret>> final : public SerializerAPI<T, Ptr, Ret> {
  public:
    explicit MisplacedSerializer(const std::type_info& type)
        : SerializerAPI<T, Ptr, Ret>("test:Misplaced", type, {1U, 0U}) {}

    FrameIndex serialize(const Ptr& /*object*/, StreamID /*streamID*/, FrameIndex frameIndex,
                         const std::shared_ptr<MessageStream>& /*stream*/,
                         const std::shared_ptr<const Registry>& /*registry*/,
                         const SerializationContext& /*context*/) const override {
        return frameIndex;
    }

    Ret deserialize(FrameIndex /*frameIndex*/, const std::unique_ptr<Message>& /*message*/,
                    const std::shared_ptr<const Registry>& /*registry*/,
                    const SerializationContext& /*context*/) const override {
        return Ret();
    }
};

/// Text of the exception that `action` throws, if that is of exactly the class `Error`; otherwise a text that says what
/// happened instead.
template <class Error, class Action>
std::string errorText(const Action& action) {
    try {
        action();
    } catch (const std::exception& error) {
        if (typeid(error) == typeid(Error)) {
            return error.what();
        }
        return std::string("another exception: ") + typeid(error).name() + ": " + error.what();
    }
    return "no exception";
}

}  // namespace transport
