// What serializers of a family do.
#pragma once

#include <memory>

#include "foundation/msg_svc/transport/layers/message/Message.hpp"
#include "foundation/msg_svc/transport/layers/message/MessageStream.hpp"
#include "foundation/msg_svc/transport/layers/serialization/Registry.hpp"
#include "foundation/msg_svc/transport/layers/serialization/SerializerBase.hpp"

namespace foundation::msg_svc::transport::layers::serialization {

/// What the serializers of one message hand on to each other.
struct SerializationContext {
    int peer;
};

template <class T, class Ptr, class Ret>
class SerializerAPI : public SerializerBase {
  public:
    using FrameIndex = vantor::carrier::framing::FrameIndex;

    SerializerAPI(const std::string& name, const std::type_info& type, std::pair<unsigned int, unsigned int> version)
        : SerializerBase(name, type, version) {}

    virtual FrameIndex serialize(const Ptr& object, vantor::carrier::framing::StreamID streamID, FrameIndex frameIndex,
                                 const std::shared_ptr<message::MessageStream>& stream,
                                 const std::shared_ptr<const Registry>& registry,
                                 const SerializationContext& context) const = 0;

    virtual Ret deserialize(FrameIndex frameIndex, const std::unique_ptr<message::Message>& message,
                            const std::shared_ptr<const Registry>& registry,
                            const SerializationContext& context) const = 0;
};

}  // namespace foundation::msg_svc::transport::layers::serialization
