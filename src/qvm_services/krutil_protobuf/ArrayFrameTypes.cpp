#include "ArrayFrameTypes.hpp"

#include <array>
#include <cstddef>
#include <cstdint>

namespace krutil::protobuf_serializer::detail {

using foundation::vantor::carrier::framing::FrameType;

namespace {

// Indexed by element-type code. Settled numbers of the framing layer, in no order of their own.
constexpr std::array<std::uint8_t, 24> frameTypes{0, 13, 14, 0,  12, 11, 3,  4,  5,  6,  7,  8,
                                                  9, 10, 16, 15, 17, 18, 19, 20, 21, 22, 23, 24};

// Indexed by frame type.
constexpr std::array<std::uint8_t, 25> elementTypes{0, 0, 0,  6,  7,  8,  9,  10, 11, 12, 13, 5, 4,
                                                    1, 2, 15, 14, 16, 17, 18, 19, 20, 21, 22, 23};

// What leads there leads back, but for code 3 and the frame types below 3.
consteval bool tablesAgree() {
    for (std::size_t code = 1; code < frameTypes.size(); ++code) {
        if (code != 3 && elementTypes[frameTypes[code]] != code) {
            return false;
        }
    }
    return true;
}
static_assert(tablesAgree());

}  // namespace

FrameType frameTypeOfElements(int elementType) noexcept {
    const auto code = static_cast<unsigned int>(elementType);
    return static_cast<FrameType>(code < frameTypes.size() ? frameTypes[code] : 0);
}

int elementTypeOfFrames(FrameType frameType) noexcept {
    const auto number = static_cast<std::size_t>(frameType);
    return number < elementTypes.size() ? elementTypes[number] : 0;
}

}  // namespace krutil::protobuf_serializer::detail
