// Sets of capabilities as repeated enum fields.
#pragma once

#include <google/protobuf/repeated_field.h>

#include "capabilities/CapabilityList.hpp"

namespace krutil::protobuf_serializer {

/// The set that the field names. Numbers without a capability are skipped.
::capabilities::CapabilityList fromProtobuf(const google::protobuf::RepeatedField<int>& repeatedField);

/// Appends the set to the field, in the set's own order, behind what is there. Capabilities without a wire value are
/// skipped. Throws std::invalid_argument for a null field.
void toProtobuf(const ::capabilities::CapabilityList& list, google::protobuf::RepeatedField<int>* repeatedField);

}  // namespace krutil::protobuf_serializer
