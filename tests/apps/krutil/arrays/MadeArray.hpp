// Arrays of given elements.
#pragma once

#include <cstdint>
#include <vector>

#include "foundation/korveldata/ArrayFactory.hpp"

namespace krutil_client {

template <class T>
foundation::korveldata::Array make(
    const std::vector<std::uint64_t>& dimensions, const std::vector<T>& elements,
    foundation::korveldata::MemoryOrder order = foundation::korveldata::MemoryOrder::RowMajor) {
    return foundation::korveldata::ArrayFactory().createArray(foundation::korveldata::ElementTypeOf<T>::value,
                                                              dimensions, order, elements.data());
}

}  // namespace krutil_client
