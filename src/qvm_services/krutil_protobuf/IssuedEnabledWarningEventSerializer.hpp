// Warnings that were issued and enabled.
#pragma once

#include "TaggedSerializer.hpp"
#include "WarningConversions.hpp"
#include "krutil.protobuf.IssuedEnabledWarningEvent.pb.h"

namespace krutil::protobuf_serializer {

/// The message wraps a complete issued-warning message; the frame type is not that event's.
class IssuedEnabledWarningEventSerializer final
    : public TaggedSerializer<IssuedEnabledWarningEventSerializer, EventFamily,
                              korvel::lang::diagnostic::IssuedEnabledWarningEvent, protobuf::IssuedEnabledWarningEvent,
                              controlFrame> {
  public:
    static constexpr bool manyParts = true;

    IssuedEnabledWarningEventSerializer();

    static void fill(const korvel::lang::diagnostic::IssuedEnabledWarningEvent& event,
                     protobuf::IssuedEnabledWarningEvent& proto);
    static boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent> fromProtobuf(
        const protobuf::IssuedEnabledWarningEvent& proto);
};

}  // namespace krutil::protobuf_serializer
