// Objects that another object refers to: written before it into frames of their own, found again by frame index.
//
// Each class lives for one serialize or deserialize call, on one thread, and refers to that call's arguments.
#pragma once

#include <memory>
#include <typeindex>
#include <typeinfo>

#include "Casts.hpp"
#include "Families.hpp"
#include "TaggedFraming.hpp"
#include "foundation/vantor/carrier/framing/TaggedFrame.hpp"

namespace krutil::protobuf_serializer {

/// Index of the tagged frame of an object in its message.
using DataID = FrameIndex;

/// Writes the objects that the object being serialized refers to.
class NestedWriter {
  public:
    NestedWriter(StreamID streamID, FrameIndex frameIndex, const std::shared_ptr<MessageStream>& stream,
                 const std::shared_ptr<const Registry>& registry, const SerializationContext& context)
        : streamID_(streamID), next_(frameIndex), stream_(stream), registry_(registry), context_(context) {}

    /// The serializer registered for `type`, which the registry keeps. Throws std::out_of_range when there is none,
    /// std::bad_cast when it is not of `Family`.
    template <class Family>
    const Family& find(std::type_index type) const {
        return cast<Family>(*registry_->find(type));
    }

    /// Writes one object and returns its data ID. Frames that its serializer wrote besides lie before that index.
    template <class Family, class Object>
    DataID write(const Family& serializer, const Object& object) {
        next_ = serializer.serialize(object, streamID_, next_, stream_, registry_, context_);
        return next_ - 1;
    }

    /// Writes one object through the serializer of its dynamic type and returns its data ID. Throws std::bad_typeid for
    /// an empty pointer, and as find().
    template <class Family, class Ptr>
    DataID writeByDynamicType(const Ptr& object) {
        const auto* raw = object.get();
        return write(find<Family>(typeid(*raw)), object);
    }

    /// The next free frame index.
    FrameIndex next() const noexcept { return next_; }

    template <class Family>
    static const Family& cast(const SerializerBase& serializer) {
        const auto* const found = familyCast<Family>(serializer);
        if (found == nullptr) {
            throw std::bad_cast();
        }
        return *found;
    }

  private:
    StreamID streamID_;
    FrameIndex next_;
    const std::shared_ptr<MessageStream>& stream_;
    const std::shared_ptr<const Registry>& registry_;
    const SerializationContext& context_;
};

/// Reads the objects that the object being deserialized refers to.
class NestedReader {
  public:
    NestedReader(const std::unique_ptr<Message>& message, const std::shared_ptr<const Registry>& registry,
                 const SerializationContext& context)
        : message_(message), registry_(registry), context_(context) {}

    /// The serializer that the tag of the frame at `dataID` names, which the registry keeps. Throws std::bad_cast when
    /// no tagged frame is there (any more) or the serializer is not of `Family`, std::out_of_range for an unknown tag.
    template <class Family>
    const Family& serializerAt(DataID dataID) const {
        const auto* frame = downcast<foundation::vantor::carrier::framing::TaggedFrame>(message_->frame(dataID).get());
        if (frame == nullptr) {
            throw std::bad_cast();
        }
        return NestedWriter::cast<Family>(*registry_->find(frame->tag()));
    }

    /// Reads the object at `dataID` with a serializer found before.
    template <class Family>
    auto read(const Family& serializer, DataID dataID) const {
        return serializer.deserialize(dataID, message_, registry_, context_);
    }

    /// Reads the object at `dataID` with the serializer that its frame's tag names; throws as serializerAt().
    template <class Family>
    auto read(DataID dataID) const {
        return read(serializerAt<Family>(dataID), dataID);
    }

  private:
    const std::unique_ptr<Message>& message_;
    const std::shared_ptr<const Registry>& registry_;
    const SerializationContext& context_;
};

}  // namespace krutil::protobuf_serializer
