// The arrays of a function call or of its result.
#pragma once

#include <google/protobuf/repeated_field.h>

#include <cstdint>
#include <vector>

#include "NestedObjects.hpp"
#include "QDASerializer.hpp"

namespace krutil::protobuf_serializer {

/// Writes the arrays in order and returns the data ID of each. Throws std::out_of_range when no serializer is
/// registered for arrays, std::bad_cast when it is of another family, both for no arrays too; and what that serializer
/// throws.
std::vector<DataID> writeArrays(const std::vector<foundation::korveldata::Array>& arrays, NestedWriter& nested);

/// Reads the arrays in order. The tag of the first one's frame selects the serializer for all. Throws std::bad_cast
/// when there is no tagged frame under an ID or the serializer is of another family, std::out_of_range for an unknown
/// tag, and what the serializer throws; memory grows with the arrays that are there, not with the number of IDs.
std::vector<foundation::korveldata::Array> readArrays(const google::protobuf::RepeatedField<std::uint64_t>& dataIDs,
                                                      const NestedReader& nested);

}  // namespace krutil::protobuf_serializer
