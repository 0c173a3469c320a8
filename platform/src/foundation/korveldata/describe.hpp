// Arrays in the words of an error message.
#pragma once

#include <cstdint>
#include <span>
#include <string>

#include "foundation/korveldata/ElementType.hpp"

namespace foundation::korveldata {

/// For example "1000 x 1000 double", or "scalar double" without dimensions.
std::string describe(ElementType type, std::span<const std::uint64_t> dimensions);

}  // namespace foundation::korveldata
