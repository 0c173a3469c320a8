// What all serializers of tagged frames have in common: the cast to the concrete type, the framing, the registered
// name, the version and the return value. A serializer adds its conversion pair and nothing else.
#pragma once

#include <google/protobuf/arena.h>

#include <array>
#include <cstddef>
#include <memory>
#include <string>

#include "Casts.hpp"
#include "Families.hpp"
#include "KeptMessage.hpp"
#include "NestedObjects.hpp"
#include "TaggedFraming.hpp"

namespace krutil::protobuf_serializer {

/// Base of the serializer class `Derived`, which handles objects of class `Object` of a family as messages of class
/// `ProtoMessage` in frames of type `Type`. `Derived` has two static conversions:
///
///     void fill(const Object&, ProtoMessage&)
///     Ret fromProtobuf(const ProtoMessage&)
///
/// Objects that refer to others take a `NestedWriter&` or a `const NestedReader&` as last parameter. fill() sets every
/// field of a message that may hold another object's values, because its thread keeps it. Objects without content have
/// a fill() without parameters. Where `Derived::manyParts` is true, messages consist of many others, and received ones
/// live on an arena for the time of the call.
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
        KeptMessage<ProtoMessage> proto;
        convert(object, *proto, nested);
        const FrameIndex next = writeTaggedFrame(*proto, this->name(), streamID, nested.next(), stream, Type);
        proto.keep();
        return next;
    }

    Ret deserialize(FrameIndex frameIndex, const std::unique_ptr<Message>& message,
                    const std::shared_ptr<const Registry>& registry, const SerializationContext& context) const final {
        if constexpr (requires { requires Derived::manyParts; }) {
            // The stack has room for what is usual, so that the arena seldom allocates.
            alignas(std::max_align_t) std::array<char, 12288> block;
            google::protobuf::ArenaOptions options;
            options.initial_block = block.data();
            options.initial_block_size = block.size();
            google::protobuf::Arena arena(options);
            return read(*google::protobuf::Arena::CreateMessage<ProtoMessage>(&arena), frameIndex, message, registry,
                        context);
        } else {
            ProtoMessage proto;
            return read(proto, frameIndex, message, registry, context);
        }
    }

    /// The message of an object that refers to no others.
    static ProtoMessage toProtobuf(const Object& object) {
        ProtoMessage proto;
        Derived::fill(object, proto);
        return proto;
    }

  protected:
    explicit TaggedSerializer(const std::string& name) : SerializerAPI<T, Ptr, Ret>(name, typeid(Object), {1U, 0U}) {}

  private:
    static Ret read(ProtoMessage& proto, FrameIndex frameIndex, const std::unique_ptr<Message>& message,
                    const std::shared_ptr<const Registry>& registry, const SerializationContext& context) {
        readTaggedFrame(frameIndex, message, proto, Type);
        if constexpr (requires(const NestedReader& nested) { Derived::fromProtobuf(proto, nested); }) {
            return Derived::fromProtobuf(proto, NestedReader(message, registry, context));
        } else {
            return Derived::fromProtobuf(proto);
        }
    }

    static void convert(const Ptr& object, ProtoMessage& proto, NestedWriter& nested) {
        if constexpr (!requires { Derived::fill(); }) {
            // A registry hands a serializer nothing but objects of its type, so the result is not tested.
            const auto* concrete = downcast<Object>(object.get());
            if constexpr (requires { Derived::fill(*concrete, proto, nested); }) {
                Derived::fill(*concrete, proto, nested);
            } else {
                Derived::fill(*concrete, proto);
            }
        }
    }
};

}  // namespace krutil::protobuf_serializer
