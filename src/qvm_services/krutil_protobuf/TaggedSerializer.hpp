// What all serializers of tagged frames have in common: the cast to the concrete type, the framing, the registered
// name, the version and the return value. A serializer adds its conversion pair and nothing else.
#pragma once

#include <memory>
#include <string>

#include "Families.hpp"
#include "NestedObjects.hpp"
#include "TaggedFraming.hpp"

namespace krutil::protobuf_serializer {

/// Base of the serializer class `Derived`, which handles objects of class `Object` of a family as messages of class
/// `ProtoMessage` in frames of type `Type`. `Derived` has two static conversions:
///
///     ProtoMessage toProtobuf(const Object&)
///     Ret fromProtobuf(const ProtoMessage&)
///
/// Objects that refer to others take a `NestedWriter&` or a `const NestedReader&` as second parameter; objects without
/// content take no parameter on the way out.
///
/// Immutable after construction; any number of threads may use one object.
template <class Derived, class Family, class Object, class ProtoMessage, FrameType Type = objectFrame>
class TaggedSerializer;

template <class Derived, class T, class Ptr, class Ret, class Object, class ProtoMessage, FrameType Type>
class TaggedSerializer<Derived, SerializerAPI<T, Ptr, Ret>, Object, ProtoMessage, Type>
    : public SerializerAPI<T, Ptr, Ret> {
  public:
    using Proto = ProtoMessage;
    static constexpr FrameType frameType = Type;

    /// `object` must point to an `Object`, but for conversions that need none.
    FrameIndex serialize(const Ptr& object, StreamID streamID, FrameIndex frameIndex,
                         const std::shared_ptr<MessageStream>& stream, const std::shared_ptr<const Registry>& registry,
                         const SerializationContext& context) const final {
        NestedWriter nested(streamID, frameIndex, stream, registry, context);
        const ProtoMessage proto = convert(object, nested);
        return writeTaggedFrame(proto, this->name(), streamID, nested.next(), stream, Type);
    }

    Ret deserialize(FrameIndex frameIndex, const std::unique_ptr<Message>& message,
                    const std::shared_ptr<const Registry>& registry, const SerializationContext& context) const final {
        ProtoMessage proto;
        readTaggedFrame(frameIndex, message, proto, Type);
        if constexpr (requires(const NestedReader& nested) { Derived::fromProtobuf(proto, nested); }) {
            return Derived::fromProtobuf(proto, NestedReader(message, registry, context));
        } else {
            return Derived::fromProtobuf(proto);
        }
    }

  protected:
    explicit TaggedSerializer(const std::string& name) : SerializerAPI<T, Ptr, Ret>(name, typeid(Object), {1U, 0U}) {}

  private:
    static ProtoMessage convert(const Ptr& object, NestedWriter& nested) {
        if constexpr (requires { Derived::toProtobuf(); }) {
            return Derived::toProtobuf();
        } else {
            // A registry hands a serializer nothing but objects of its type, so the result is not tested.
            const auto* concrete = dynamic_cast<const Object*>(object.get());
            if constexpr (requires { Derived::toProtobuf(*concrete, nested); }) {
                return Derived::toProtobuf(*concrete, nested);
            } else {
                return Derived::toProtobuf(*concrete);
            }
        }
    }
};

}  // namespace krutil::protobuf_serializer
