// A warning was issued. Immutable.
#pragma once

#include "cmddistributor/RequestIdAdapter.hpp"
#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"
#include "korvel/lang/diagnostic/Warning.hpp"

namespace korvel::lang::diagnostic {

class IssuedWarningEvent : public foundation::msg_svc::eventmgr::BaseEvent, public cmddistributor::RequestIdAdapter {
  public:
    IssuedWarningEvent(foundation::msg_svc::exchange::IDType of, const Warning& warning)
        : RequestIdAdapter(of), warning_(warning) {}

    Warning getWarning() const { return warning_; }

  private:
    Warning warning_;
};

}  // namespace korvel::lang::diagnostic
