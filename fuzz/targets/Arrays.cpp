// Any description of an array over any elements: either it is refused, or every element can be used. The input is the
// type of the data frame, the size of the description (one byte), the description, the elements.

#include <algorithm>
#include <cstdint>
#include <optional>
#include <string>
#include <variant>

#include "foundation/korveldata/Array.hpp"
#include "input/FuzzInput.hpp"
#include "input/Reading.hpp"
#include "input/Require.hpp"
#include "krutil_protobuf/support/TestTransport.hpp"
#include "samples/Samples.hpp"

namespace {

using foundation::korveldata::Array;

// Position of the serializer of arrays among those of a session.
std::uint8_t arrayTag(const transport::Registry& registry) {
    const auto& all = registry.serializers();
    const auto found =
        std::find_if(all.begin(), all.end(), [](const auto& each) { return each->name() == "krutil:QDA"; });
    return static_cast<std::uint8_t>(found - all.begin());
}

// Of 8 bytes each, and what is left; so that all elements are read.
std::uint64_t sumOf(const Array& array) {
    std::uint64_t sum = 0;
    for (std::uint64_t i = 0; i < array.sizeInBytes(); ++i) {
        sum += static_cast<unsigned char>(array.data()[i]);
    }
    return sum;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const std::shared_ptr<const transport::Registry> registry = transport::sessionRegistry();
    static const std::uint8_t tag = arrayTag(*registry);
    if (size < 2) {
        return 0;
    }
    const std::string rest(data + 2, data + size);
    const std::string description = rest.substr(0, data[1]);
    const std::string elements = rest.substr(description.size());
    const auto message = fuzz::makeMessage({{0xFF, data[0], elements}, {tag, 29, description}}, *registry);
    const std::optional<samples::Object> object = fuzz::read(message, registry);
    if (!object) {
        return 0;
    }
    Array array = std::get<Array>(*object);
    const std::uint64_t sum = sumOf(array);
    const auto& extents = array.dimensions();
    // One extent of 0 is enough, whatever the product of the others would be.
    std::uint64_t count = std::find(extents.begin(), extents.end(), 0) == extents.end() ? 1 : 0;
    for (const std::uint64_t extent : extents) {
        fuzz::require(count == 0 || count <= UINT64_MAX / extent, "the number of elements is the dimensions' product");
        count *= extent;
    }
    fuzz::require(count == array.numberOfElements(), "the number of elements is the dimensions' product");
    fuzz::require(array == array, "an array equals itself");
    // With elements of its own it is still the same.
    const Array shared = array;
    array.mutableData();
    fuzz::require(array == shared && sumOf(array) == sum, "a copy has the same elements");
    return 0;
}
