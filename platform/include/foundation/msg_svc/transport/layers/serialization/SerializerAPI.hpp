// The two operations of a serializer, for one family of in-process types.
#pragma once

#include <memory>
#include <string>
#include <typeinfo>
#include <utility>

#include "foundation/msg_svc/transport/layers/message/Message.hpp"
#include "foundation/msg_svc/transport/layers/message/MessageStream.hpp"
#include "foundation/msg_svc/transport/layers/serialization/Registry.hpp"
#include "foundation/msg_svc/transport/layers/serialization/SerializationContext.hpp"
#include "foundation/msg_svc/transport/layers/serialization/SerializerBase.hpp"

namespace foundation::msg_svc::transport::layers::serialization {

/// `T` is the family's base class, `Ptr` how an object of it is handed to serialize, `Ret` what deserialize returns.
/// Both operations are const and keep no state between calls, so transports call one object from several threads at
/// once.
template <class T, class Ptr, class Ret>
class SerializerAPI : public SerializerBase {
  public:
    /// `name` is copied; `type` is that of the concrete class whose objects the serializer handles.
    SerializerAPI(const std::string& name, const std::type_info& type,
                  const std::pair<unsigned int, unsigned int>& version)
        : SerializerBase(name, type, version, typeid(SerializerAPI)) {}
    ~SerializerAPI() override = default;

    /// Writes `object` as one or more frames, the first at `frameIndex`, and returns the next free index. Objects that
    /// it refers to are written before it, so its own tagged frame is the last. When it throws, frames that it already
    /// appended stay in `stream`; the transport is expected to drop the whole stream.
    virtual message::framing::FrameIndex serialize(const Ptr& object, message::framing::StreamID streamID,
                                                   message::framing::FrameIndex frameIndex,
                                                   const std::shared_ptr<message::MessageStream>& stream,
                                                   const std::shared_ptr<const Registry>& registry,
                                                   const SerializationContext& context) const = 0;

    /// Takes the tagged frame at `frameIndex` out of `message`, and the frames that it refers to, and returns a newly
    /// built object. Throws on input that the protocol refuses; frames already taken out are gone then.
    virtual Ret deserialize(message::framing::FrameIndex frameIndex, const std::unique_ptr<message::Message>& message,
                            const std::shared_ptr<const Registry>& registry,
                            const SerializationContext& context) const = 0;
};

/// The serializer as one of `Family`, which is a SerializerAPI; null when it is of another. Does what a dynamic cast
/// does, for the price of a comparison.
template <class Family>
const Family* asFamily(const SerializerBase& serializer) noexcept {
    return serializer.family() == typeid(Family) ? static_cast<const Family*>(&serializer) : nullptr;
}

}  // namespace foundation::msg_svc::transport::layers::serialization
