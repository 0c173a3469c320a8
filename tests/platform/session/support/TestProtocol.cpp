#include "platform/session/support/TestProtocol.hpp"

#include <boost/make_shared.hpp>
#include <cstring>
#include <stdexcept>

#include "foundation/korveldata/Array.hpp"
#include "foundation/msg_svc/transport/layers/serialization/SerializerAPI.hpp"
#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"
#include "foundation/vantor/carrier/framing/DataFrame.hpp"
#include "foundation/vantor/carrier/framing/TaggedFrame.hpp"

namespace testing_protocol {
namespace {

namespace layers = foundation::msg_svc::transport::layers;
using framing::FrameBuffer;
using framing::FrameIndex;
using framing::StreamID;
using layers::message::Message;
using layers::message::MessageStream;
using layers::serialization::Registry;
using layers::serialization::SerializationContext;
using layers::serialization::SerializerAPI;

FrameIndex append(MessageStream& stream, const std::string& tag, StreamID streamID, FrameIndex index,
                  const std::string& text) {
    FrameBuffer buffer(
        std::unique_ptr<char[], std::function<void(char*)>>(new char[text.size()], std::default_delete<char[]>()),
        text.size());
    std::copy(text.begin(), text.end(), buffer.first.get());
    std::unique_ptr<framing::Frame> frame =
        std::make_unique<framing::TaggedFrame>(framing::FrameType::Object, streamID, tag, std::move(buffer), index);
    stream.append(frame);
    return index + 1;
}

std::string textOf(const Message& message, FrameIndex index) {
    const framing::Frame& frame = *message.frame(index);
    return std::string(frame.data(), frame.size());
}

// Serializer of an object that is one text, made and read by two functions.
template <class Family, class Type>
class TextSerializer : public SerializerAPI<Family, boost::shared_ptr<const Family>, boost::shared_ptr<const Family>> {
  public:
    using Ptr = boost::shared_ptr<const Family>;
    using Base = SerializerAPI<Family, Ptr, Ptr>;

    explicit TextSerializer(const std::string& tag) : Base(tag, typeid(Type), {1, 0}) {}

    FrameIndex serialize(const Ptr& object, StreamID streamID, FrameIndex index,
                         const std::shared_ptr<MessageStream>& stream, const std::shared_ptr<const Registry>&,
                         const SerializationContext&) const override {
        const auto& typed = dynamic_cast<const Type&>(*object);
        if constexpr (requires { typed.sent; }) {
            for (const auto& bulk : typed.sent) {
                appendBulk(*stream, bulk, streamID, index++);
            }
        }
        std::string text;
        if constexpr (requires { typed.text; }) {
            text = typed.text;
        }
        if (text == "fail to write") {
            throw std::runtime_error("this cannot be written");
        }
        return append(*stream, this->name(), streamID, index, text);
    }

    Ptr deserialize(FrameIndex index, const std::unique_ptr<Message>& message, const std::shared_ptr<const Registry>&,
                    const SerializationContext&) const override {
        const std::string text = textOf(*message, index);
        if (text == "fail to read") {
            throw std::runtime_error("this cannot be read");
        }
        if (text == "fail oddly") {
            throw 42;
        }
        if (text == "make nothing") {
            return nullptr;
        }
        if constexpr (std::is_default_constructible_v<Type>) {
            return boost::make_shared<const Type>();
        } else {
            const auto object = boost::make_shared<Type>(text);
            if constexpr (requires { object->received; }) {
                for (FrameIndex i = 1; i < index; ++i) {
                    object->received.push_back(message->release(i));
                }
            }
            return object;
        }
    }

  private:
    static void appendBulk(MessageStream& stream, const std::shared_ptr<Bulk>& bulk, StreamID streamID,
                           FrameIndex index) {
        auto share = std::make_unique<std::shared_ptr<Bulk>>(bulk);
        std::unique_ptr<char[], std::function<void(char*)>> bytes(nullptr, &framing::BufferAllocator::release);
        bytes.reset(framing::BufferAllocator::adopt(
            bulk->bytes.data(), bulk->bytes.size(),
            [](void* owner) {
                const std::unique_ptr<std::shared_ptr<Bulk>> last(static_cast<std::shared_ptr<Bulk>*>(owner));
                (*last)->dropped = true;
            },
            share.get()));
        share.release();
        FrameBuffer buffer(std::move(bytes), bulk->bytes.size());
        std::unique_ptr<framing::Frame> frame = std::make_unique<framing::DataFrame>(
            static_cast<framing::FrameType>(4), streamID, std::move(buffer), bulk->shareable, index);
        stream.append(frame);
    }
};

// Writes and reads nothing: tests only name its tag.
template <class T>
class ReferredSerializer : public SerializerAPI<T, T, T> {
  public:
    explicit ReferredSerializer(const std::string& tag) : SerializerAPI<T, T, T>(tag, typeid(T), {1, 0}) {}
    FrameIndex serialize(const T&, StreamID, FrameIndex index, const std::shared_ptr<MessageStream>&,
                         const std::shared_ptr<const Registry>&, const SerializationContext&) const override {
        return index;
    }
    T deserialize(FrameIndex, const std::unique_ptr<Message>&, const std::shared_ptr<const Registry>&,
                  const SerializationContext&) const override {
        return T();
    }
};

struct PartOfAQuestion {};

}  // namespace

session::ProtocolVersion initialize(const std::shared_ptr<Registry>& registry, const session::ProtocolVersion& version,
                                    const std::unordered_map<std::string, std::string>&) {
    registry->insert(std::make_shared<const TextSerializer<exchange::Message, Question>>(questionTag));
    registry->insert(std::make_shared<const TextSerializer<exchange::Reply, Answer>>(answerTag));
    registry->insert(std::make_shared<const TextSerializer<eventmgr::BaseEvent, Notice>>(noticeTag));
    registry->insert(std::make_shared<const TextSerializer<eventmgr::BaseEvent, Shutdown>>(shutdownTag));
    registry->insert(std::make_shared<const TextSerializer<eventmgr::BaseEvent, CapabilityNews>>(capabilitiesTag));
    registry->insert(std::make_shared<const ReferredSerializer<PartOfAQuestion>>(partTag));
    registry->insert(std::make_shared<const ReferredSerializer<foundation::korveldata::Array>>(arrayTag));
    return version;
}

Registered::Registered(const std::string& name, std::vector<session::FeatureRequest> features,
                       session::ProtocolInitializer initializer)
    : name_(name) {
    session::ProtocolRegistry::getRegistry()->registerProtocolInitializer(name, initializer,
                                                                          [features] { return features; });
}

Registered::~Registered() {
    session::ProtocolRegistry::getRegistry()->unregister(name_);
}

}  // namespace testing_protocol
