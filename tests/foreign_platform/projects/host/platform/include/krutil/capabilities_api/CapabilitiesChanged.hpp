// A change of capabilities. Immutable.
#pragma once

#include "capabilities/CapabilityList.hpp"
#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"

namespace krutil::capabilities_api {

class CapabilitiesChanged : public foundation::msg_svc::eventmgr::BaseEvent {
  public:
    using List = ::capabilities::CapabilityList;

    CapabilitiesChanged(List previous, List qvm, List client, List request) : lists_{previous, qvm, client, request} {}

    List getPreviousCapabilities() const { return lists_[0]; }
    List getQvmCapabilities() const { return lists_[1]; }
    List getClientCapabilities() const { return lists_[2]; }
    List getRequestCapabilities() const { return lists_[3]; }

  private:
    List lists_[4];
};

}  // namespace krutil::capabilities_api
