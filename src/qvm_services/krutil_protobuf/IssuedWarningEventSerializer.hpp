// Warnings that were issued.
#pragma once

#include "TaggedSerializer.hpp"
#include "WarningConversions.hpp"
#include "krutil.protobuf.IssuedWarningEvent.pb.h"

namespace krutil::protobuf_serializer {

/// The registered name is that of the event's type, not of the protocol.
class IssuedWarningEventSerializer final
    : public TaggedSerializer<IssuedWarningEventSerializer, EventFamily, korvel::lang::diagnostic::IssuedWarningEvent,
                              protobuf::IssuedWarningEvent> {
  public:
    static constexpr bool manyParts = true;

    IssuedWarningEventSerializer();

    static void fill(const korvel::lang::diagnostic::IssuedWarningEvent& event, protobuf::IssuedWarningEvent& proto);
    static boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent> fromProtobuf(
        const protobuf::IssuedWarningEvent& proto);
};

}  // namespace krutil::protobuf_serializer
