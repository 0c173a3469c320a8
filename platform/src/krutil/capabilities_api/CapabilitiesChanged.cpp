#include "krutil/capabilities_api/CapabilitiesChanged.hpp"

namespace krutil::capabilities_api {

CapabilitiesChanged::CapabilitiesChanged(::capabilities::CapabilityList previous, ::capabilities::CapabilityList qvm,
                                         ::capabilities::CapabilityList client, ::capabilities::CapabilityList request)
    : previous_(previous), qvm_(qvm), client_(client), request_(request) {}

CapabilitiesChanged::~CapabilitiesChanged() = default;

}  // namespace krutil::capabilities_api
