// Arrays for a person to read.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "foundation/korveldata/Array.hpp"

namespace krutil_client {

/// Most elements that are shown in full, to a person and as JSON.
inline constexpr std::uint64_t mostShownElements = 1000;

/// Whether the array is one text: UTF-16 code units in a single row, or a single one.
bool isText(const foundation::korveldata::Array& array);

/// What kind of array it is: "double, 2 x 3", "int64" for a scalar, "text of 5 characters" (UTF-16 code units count).
std::string arrayHeading(const foundation::korveldata::Array& array);

/// One element, in the shortest form that reads back as the same value: "0.1", "true", "1+2j", "'a'". `index` is its
/// position in memory.
std::string elementText(const foundation::korveldata::Array& array, std::uint64_t index);

/// Distance in memory, in elements, from one index to the next, for each dimension.
std::vector<std::uint64_t> stridesOf(const foundation::korveldata::Array& array);

/// The heading and the values, ending in a newline:
///
///     int64: 42
///     text of 5 characters: hello
///     double, 2 x 3:
///     [[1,   2, 3],
///      [4, 5.5, 6]]
///
/// Values of arrays have up to eight digits. Of more than mostShownElements elements the first and last three of each
/// dimension are shown, with ... between. Text of several lines begins on a line of its own.
std::string arrayText(const foundation::korveldata::Array& array);

}  // namespace krutil_client
