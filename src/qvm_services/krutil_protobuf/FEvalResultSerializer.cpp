#include "FEvalResultSerializer.hpp"

#include <boost/variant/get.hpp>

#include "FieldConversions.hpp"
#include "IIPResultSerializer.hpp"
#include "NestedArrays.hpp"

namespace krutil::protobuf_serializer {

using foundation::korveldata::Array;

namespace {

const std::string fEvalResultName = "krutil:FEvalResult";

}  // namespace

FEvalResultSerializer::FEvalResultSerializer() : TaggedSerializer(fEvalResultName) {}

void FEvalResultSerializer::fill(const ::cmddistributor::FEvalResult& result, protobuf::FEvalResult& proto,
                                 const WriteArrays& write) {
    IIPResultSerializer::fill(result, *proto.mutable_iipresult());
    proto.clear_dataids();
    if (write) {
        for (const DataID dataID : write(boost::get<std::vector<Array>>(result.getResults()))) {
            proto.add_dataids(dataID);
        }
    }
}

std::unique_ptr<::cmddistributor::IIPResult> FEvalResultSerializer::fromProtobuf(const protobuf::FEvalResult& proto,
                                                                                 const ReadArrays& read) {
    require(proto.has_iipresult(), "Required field is missing: protobuf::FEvalResult.iipResult");
    const auto result = IIPResultSerializer::fromProtobuf(proto.iipresult());
    if (!read) {
        return nullptr;
    }
    return std::make_unique<::cmddistributor::FEvalResult>(result->id, read(proto.dataids()));
}

void FEvalResultSerializer::fill(const ::cmddistributor::FEvalResult& result, protobuf::FEvalResult& proto,
                                 NestedWriter& nested) {
    fill(result, proto, [&nested](const std::vector<Array>& arrays) { return writeArrays(arrays, nested); });
}

std::unique_ptr<::cmddistributor::IIPResult> FEvalResultSerializer::fromProtobuf(const protobuf::FEvalResult& proto,
                                                                                 const NestedReader& nested) {
    return fromProtobuf(proto, [&nested](const google::protobuf::RepeatedField<std::uint64_t>& dataIDs) {
        return readArrays(dataIDs, nested);
    });
}

}  // namespace krutil::protobuf_serializer
