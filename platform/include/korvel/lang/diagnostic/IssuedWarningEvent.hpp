// A warning was issued.
#pragma once

#include "cmddistributor/RequestIdAdapter.hpp"
#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"
#include "korvel/lang/diagnostic/Warning.hpp"

namespace korvel::lang::diagnostic {

/// Raised for every warning, hidden ones included. Immutable.
class IssuedWarningEvent : public foundation::msg_svc::eventmgr::BaseEvent, public ::cmddistributor::RequestIdAdapter {
  public:
    /// `id` is that of the request that issued `warning`, which is copied.
    IssuedWarningEvent(foundation::msg_svc::exchange::IDType id, const Warning& warning);
    ~IssuedWarningEvent() override;

    /// The warning. Valid as long as the event.
    const Warning& getWarning() const noexcept { return warning_; }

  private:
    Warning warning_;
};

}  // namespace korvel::lang::diagnostic
