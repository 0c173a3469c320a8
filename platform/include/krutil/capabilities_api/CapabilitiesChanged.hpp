// The capabilities in force have changed.
#pragma once

#include "capabilities/CapabilityList.hpp"
#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"

namespace krutil::capabilities_api {

/// Published by whichever side changed. Immutable.
class CapabilitiesChanged : public foundation::msg_svc::eventmgr::BaseEvent {
  public:
    /// The capabilities before the change; those of the engine and of the client now; and those that the running
    /// request asks for.
    CapabilitiesChanged(::capabilities::CapabilityList previous, ::capabilities::CapabilityList qvm,
                        ::capabilities::CapabilityList client, ::capabilities::CapabilityList request);
    ~CapabilitiesChanged() override;

    /// In force before the change.
    ::capabilities::CapabilityList getPreviousCapabilities() const noexcept { return previous_; }
    /// Of the engine.
    ::capabilities::CapabilityList getQvmCapabilities() const noexcept { return qvm_; }
    /// Of the client.
    ::capabilities::CapabilityList getClientCapabilities() const noexcept { return client_; }
    /// That the running request asks for.
    ::capabilities::CapabilityList getRequestCapabilities() const noexcept { return request_; }

  private:
    ::capabilities::CapabilityList previous_;
    ::capabilities::CapabilityList qvm_;
    ::capabilities::CapabilityList client_;
    ::capabilities::CapabilityList request_;
};

}  // namespace krutil::capabilities_api
