// Events of a request. Immutable.
#pragma once

#include "foundation/msg_svc/exchange/IDType.hpp"

namespace cmddistributor {

class RequestIdAdapter {
  public:
    explicit RequestIdAdapter(foundation::msg_svc::exchange::IDType of) : of_(of) {}
    virtual ~RequestIdAdapter() = default;

    foundation::msg_svc::exchange::IDType getRequestId() const { return of_; }

  private:
    foundation::msg_svc::exchange::IDType of_;
};

}  // namespace cmddistributor
