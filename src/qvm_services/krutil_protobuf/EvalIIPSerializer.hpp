// Requests to evaluate code text.
#pragma once

#include "TaggedSerializer.hpp"
#include "cmddistributor/EvalIIP.hpp"
#include "krutil.protobuf.EvalIIP.pb.h"

namespace krutil::protobuf_serializer {

class EvalIIPSerializer final
    : public TaggedSerializer<EvalIIPSerializer, IIPFamily, ::cmddistributor::EvalIIP, protobuf::EvalIIP> {
  public:
    EvalIIPSerializer();

    using TaggedSerializer::toProtobuf;

    /// Ends the process for a number other than 0 to 3.
    static protobuf::CodeType toProtobuf(::cmddistributor::CodeType codeType);

    /// Throws std::logic_error for a number other than 0 to 3.
    static ::cmddistributor::CodeType fromProtobuf(protobuf::CodeType codeType);

    /// Ends the process for a stream number or a code type outside its table.
    static void fill(const ::cmddistributor::EvalIIP& request, protobuf::EvalIIP& proto);

    /// Throws std::logic_error for an absent core, for what IIPSerializer refuses, and for a bad code type, tested in
    /// this order. The request has no workspace, whatever the message says.
    static boost::shared_ptr<const ::cmddistributor::IIP> fromProtobuf(const protobuf::EvalIIP& proto);
};

}  // namespace krutil::protobuf_serializer
