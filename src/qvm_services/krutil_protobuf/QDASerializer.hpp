// Data arrays: a tagged frame that describes the array, before it a data frame for each buffer that is not copied into
// it.
#pragma once

#include <string>
#include <unordered_map>

#include "Families.hpp"
#include "TaggedFraming.hpp"
#include "foundation/korveldata/Array.hpp"

namespace krutil::protobuf_serializer {

using ArrayFamily =
    SerializerAPI<foundation::korveldata::Array, foundation::korveldata::Array, foundation::korveldata::Array>;

/// Whether buffers travel in data frames is decided once for the process, when the first object of this class is built:
/// the environment variable QX_DISABLE_ZEROCOPY, set to anything but the empty string, keeps them inside the tagged
/// frame. Both peers must agree on it. Immutable after construction; any number of threads may use one object.
class QDASerializer final : public ArrayFamily {
  public:
    /// Copies the settled features, which nothing here consults. Throws std::system_error when the once mechanism
    /// fails.
    explicit QDASerializer(const std::unordered_map<std::string, std::string>& features);
    ~QDASerializer() override;

    /// Whether buffers travel in data frames. True until the first object of this class is built.
    static bool zeroCopy() noexcept;

    /// The settled features.
    const std::unordered_map<std::string, std::string>& features() const noexcept { return features_; }

    /// Writes the array's data frames from `frameIndex` on, then its tagged frame. Element bytes are shared with
    /// `array`, not copied, as far as the array library lends them. Throws std::length_error "Unsupported Protobuf
    /// buffer size." for a description of 2^31 bytes and more, and what the array library and the stream throw.
    FrameIndex serialize(const foundation::korveldata::Array& array, StreamID streamID, FrameIndex frameIndex,
                         const std::shared_ptr<MessageStream>& stream, const std::shared_ptr<const Registry>& registry,
                         const SerializationContext& context) const override;

    /// Throws std::bad_cast for a data ID without a data frame, and what the array library throws.
    foundation::korveldata::Array deserialize(FrameIndex frameIndex, const std::unique_ptr<Message>& message,
                                              const std::shared_ptr<const Registry>& registry,
                                              const SerializationContext& context) const override;

  private:
    std::unordered_map<std::string, std::string> features_;
};

}  // namespace krutil::protobuf_serializer
