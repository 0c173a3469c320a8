#include "NestedArrays.hpp"

namespace krutil::protobuf_serializer {

using foundation::korveldata::Array;

std::vector<DataID> writeArrays(const std::vector<Array>& arrays, NestedWriter& nested) {
    const auto& serializer = nested.find<ArrayFamily>(typeid(Array));
    std::vector<DataID> dataIDs;
    dataIDs.reserve(arrays.size());
    for (const Array& array : arrays) {
        dataIDs.push_back(nested.write(serializer, array));
    }
    return dataIDs;
}

std::vector<Array> readArrays(const google::protobuf::RepeatedField<std::uint64_t>& dataIDs,
                              const NestedReader& nested) {
    std::vector<Array> arrays;
    if (dataIDs.empty()) {
        return arrays;
    }
    const auto& serializer = nested.serializerAt<ArrayFamily>(dataIDs[0]);
    for (const DataID dataID : dataIDs) {
        arrays.push_back(nested.read(serializer, dataID));
    }
    return arrays;
}

}  // namespace krutil::protobuf_serializer
