// Requests to call a function with arrays.
#pragma once

#include "TaggedSerializer.hpp"
#include "cmddistributor/FEvalIIP.hpp"
#include "krutil.protobuf.FEvalIIP.pb.h"

namespace krutil::protobuf_serializer {

/// The arguments are written first and referred to by frame index.
class FEvalIIPSerializer final
    : public TaggedSerializer<FEvalIIPSerializer, IIPFamily, ::cmddistributor::FEvalIIP, protobuf::FEvalIIP> {
  public:
    FEvalIIPSerializer();

    /// Ends the process when the arguments are not data arrays or cannot be had, for an unsupported stream number, and,
    /// while diagnostic assertions are enabled, for identifiers of 0. Throws as writeArrays() does.
    static void fill(const ::cmddistributor::FEvalIIP& request, protobuf::FEvalIIP& proto, NestedWriter& nested);

    /// Reads the arrays first, throwing as readArrays() does; then throws std::logic_error for an absent core, for what
    /// IIPSerializer refuses, for a client identifier of 0 and for a server identifier of 0, tested in this order.
    /// Arrays that were read are released then.
    static boost::shared_ptr<const ::cmddistributor::IIP> fromProtobuf(const protobuf::FEvalIIP& proto,
                                                                       const NestedReader& nested);
};

}  // namespace krutil::protobuf_serializer
