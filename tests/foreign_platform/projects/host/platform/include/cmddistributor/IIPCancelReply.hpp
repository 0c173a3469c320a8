// What became of a cancel. Immutable.
#pragma once

#include "foundation/msg_svc/exchange/Reply.hpp"

namespace cmddistributor {

class IIPCancelReply : public foundation::msg_svc::exchange::Reply {
  public:
    enum class CancelStatus : int { tooLate, running, gone, soon };

    explicit IIPCancelReply(CancelStatus status) : status_(status) {}

    CancelStatus getStatus() const { return status_; }

  private:
    CancelStatus status_;
};

}  // namespace cmddistributor
