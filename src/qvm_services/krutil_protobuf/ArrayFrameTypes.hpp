// Types of the data frames that carry elements of arrays.
#pragma once

#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace krutil::protobuf_serializer::detail {

/// Frame type for an element-type code of the array library (1 to 23); 0 for code 3, which has none, and for any other
/// number.
foundation::vantor::carrier::framing::FrameType frameTypeOfElements(int elementType) noexcept;

/// Element-type code for a frame type (3 to 24); 0 for any other. No frame type leads to code 3. Readers do not need
/// it: they find data frames by index, whatever type a peer gave them.
int elementTypeOfFrames(foundation::vantor::carrier::framing::FrameType frameType) noexcept;

}  // namespace krutil::protobuf_serializer::detail
