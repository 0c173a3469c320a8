// Malformed arrays.

#include "conformance/vectors/Vectors.hpp"
#include "foundation.korveldata.protobuf.KORVEL_Array.pb.h"

namespace conformance {
namespace {

using foundation::korveldata::protobuf::KORVEL_Array;

constexpr const char* array = "krutil:QDA";

// The 2 x 3 array of 32-bit integers, whose elements stand inside.
template <class Edit>
std::vector<FrameContent> withInside(const Edit& edit) {
    return edited<KORVEL_Array>(sampleFrames(array, "typical"), edit);
}

// The 400 x 3 array of doubles, whose elements stand in the data frame before it.
template <class Edit>
std::vector<FrameContent> withOutside(const Edit& edit) {
    return edited<KORVEL_Array>(sampleFrames(array, "extreme"), edit);
}

// One bool, with this byte.
void makeBool(KORVEL_Array& proto, const std::string& byte) {
    proto.set_elementtype(1);
    proto.clear_dimensions();
    proto.set_inlineelements(byte);
}

}  // namespace

void addMalformedArrays(std::vector<Vector>& vectors) {
    const auto refuse = [&](const std::string& name, std::vector<FrameContent> frames, const std::string& why) {
        vectors.push_back(refused(array, name, std::move(frames), why));
    };
    refuse("element_type_24", withInside([](auto& proto) { proto.set_elementtype(24); }),
           "Array: elements of type unknown (code 24) are not supported");
    refuse("container", withInside([](auto& proto) { proto.set_elementtype(3); }),
           "Array: elements of type container (code 3) are not supported");
    refuse("dimensions_33", withInside([](auto& proto) {
               proto.clear_dimensions();
               for (int i = 0; i < 33; ++i) {
                   proto.add_dimensions(1);
               }
           }),
           "Array: 33 dimensions; at most 32 are supported");
    refuse("dimension_too_large", withInside([](auto& proto) { proto.set_dimensions(0, ~std::uint64_t{0}); }),
           "Array: a dimension of 18446744073709551615; at most 9223372036854775807 is supported");
    refuse("product_too_large", withInside([](auto& proto) { proto.set_dimensions(0, std::uint64_t{1} << 62); }),
           "Array: 4611686018427387904 x 3 int32 is more than 9223372036854775807 bytes");
    refuse("order_absent", withInside([](auto& proto) { proto.clear_order(); }),
           "KORVEL_Array: memory order 0; expected 1 (row-major) or 2 (column-major)");
    refuse("order_3", withInside([](auto& proto) { proto.set_order(static_cast<KORVEL_Array::MemoryOrder>(3)); }),
           "KORVEL_Array: memory order 3; expected 1 (row-major) or 2 (column-major)");
    refuse("a_byte_too_few", withInside([](auto& proto) { proto.mutable_inlineelements()->pop_back(); }),
           "KORVEL_Array: 2 x 3 int32 needs 24 bytes; the message has 23");
    refuse("a_byte_too_many", withInside([](auto& proto) { proto.mutable_inlineelements()->push_back('x'); }),
           "KORVEL_Array: 2 x 3 int32 needs 24 bytes; the message has 25");
    refuse("terabytes_claimed", withInside([](auto& proto) { proto.set_dimensions(0, std::uint64_t{1} << 40); }),
           "KORVEL_Array: 1099511627776 x 3 int32 needs 13194139533312 bytes; the message has 24");
    refuse("elements_absent", withInside([](auto& proto) { proto.clear_elements(); }),
           "KORVEL_Array: 2 x 3 int32 without elements: neither bytes nor a data ID");
    refuse("bool_2", withInside([](auto& proto) { makeBool(proto, "\x02"); }),
           "KORVEL_Array: scalar bool with a byte that is neither 0 nor 1");

    refuse("data_frame_0", withOutside([](auto& proto) { proto.set_dataid(0); }),
           "frame 0: expected a frame, got none: the message has 2");
    refuse("data_frame_past_the_end", withOutside([](auto& proto) { proto.set_dataid(3); }),
           "frame 3: expected a frame, got none: the message has 2");
    refuse("data_frame_is_the_array", withOutside([](auto& proto) { proto.set_dataid(2); }),
           "frame 2: expected a frame, got none: it was read already");
    auto tagged = sampleFrames(array, "extreme");
    tagged.front().tagged = true;
    tagged.front().type = static_cast<transport::FrameType>(29);
    tagged.front().tag = array;
    tagged.front().bytes.clear();
    refuse("data_frame_is_tagged", std::move(tagged),
           "frame 1: expected a data frame, got a tagged frame with tag \"krutil:QDA\"");
    auto shorter = sampleFrames(array, "extreme");
    shorter.front().bytes.pop_back();
    refuse("data_frame_of_a_byte_too_few", std::move(shorter),
           "Array: 400 x 3 double needs 9600 bytes; the buffer has 9599");

    auto other = sampleFrames(array, "extreme");
    other.front().type = static_cast<transport::FrameType>(4);
    vectors.push_back(accepted(array, "data_frame_of_another_type", std::move(other), sampleReading(array, "extreme")));
    vectors.back().note = "The element type in the array's own frame counts; the type of a data frame is not read.";
}

}  // namespace conformance
