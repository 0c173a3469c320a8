// Changes of the capabilities in force.
#pragma once

#include "TaggedSerializer.hpp"
#include "krutil.protobuf.CapabilitiesChanged.pb.h"
#include "krutil/capabilities_api/CapabilitiesChanged.hpp"

namespace krutil::protobuf_serializer {

class CapabilitiesChangedSerializer final
    : public TaggedSerializer<CapabilitiesChangedSerializer, EventFamily, capabilities_api::CapabilitiesChanged,
                              protobuf::CapabilitiesChanged> {
  public:
    CapabilitiesChangedSerializer();

    static void fill(const capabilities_api::CapabilitiesChanged& event, protobuf::CapabilitiesChanged& proto);
    static boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent> fromProtobuf(
        const protobuf::CapabilitiesChanged& proto);
};

}  // namespace krutil::protobuf_serializer
