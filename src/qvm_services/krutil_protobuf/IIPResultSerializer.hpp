// Outcomes of requests.
#pragma once

#include "TaggedSerializer.hpp"
#include "cmddistributor/IIPResult.hpp"
#include "krutil.protobuf.IIPResult.pb.h"

namespace krutil::protobuf_serializer {

class IIPResultSerializer final
    : public TaggedSerializer<IIPResultSerializer, ResultFamily, ::cmddistributor::IIPResult, protobuf::IIPResult> {
  public:
    static constexpr bool manyParts = true;

    IIPResultSerializer();

    /// Ends the process for a status outside its table, at any level of the exception.
    static void fill(const ::cmddistributor::IIPResult& result, protobuf::IIPResult& proto);

    /// The exception is converted first, so its bad status ends the process even when the identifier is absent, for
    /// which std::logic_error is thrown.
    static std::unique_ptr<::cmddistributor::IIPResult> fromProtobuf(const protobuf::IIPResult& proto);
};

}  // namespace krutil::protobuf_serializer
