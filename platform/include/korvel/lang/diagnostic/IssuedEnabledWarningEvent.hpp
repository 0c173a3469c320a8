// A warning was issued that no filter hides.
#pragma once

#include "cmddistributor/RequestIdAdapter.hpp"
#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"
#include "korvel/lang/diagnostic/Warning.hpp"

namespace korvel::lang::diagnostic {

/// Raised besides the issued-warning event, for warnings that are shown. Immutable.
class IssuedEnabledWarningEvent : public foundation::msg_svc::eventmgr::BaseEvent,
                                  public ::cmddistributor::RequestIdAdapter {
  public:
    /// `id` is that of the request that issued `warning`, which is copied.
    IssuedEnabledWarningEvent(foundation::msg_svc::exchange::IDType id, const Warning& warning);
    ~IssuedEnabledWarningEvent() override;

    /// The warning. Valid as long as the event.
    const Warning& getWarning() const noexcept { return warning_; }

  private:
    Warning warning_;
};

}  // namespace korvel::lang::diagnostic
