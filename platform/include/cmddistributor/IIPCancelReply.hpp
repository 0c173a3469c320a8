// What became of a cancel.
#pragma once

#include <cstdint>

#include "foundation/msg_svc/exchange/Reply.hpp"

namespace cmddistributor {

/// Immutable. The exchange that it ends tells which request is meant.
class IIPCancelReply : public foundation::msg_svc::exchange::Reply {
  public:
    /// Numbers are those of the wire. A reply received from a peer may hold any 32-bit number.
    enum CancelStatus : std::int32_t {
        UNABLE_TO_CANCEL_ALREADY_DONE = 0,     ///< the request had finished, or is not known
        UNABLE_TO_CANCEL_ALREADY_RUNNING = 1,  ///< it was running and goes on
        SUCCESSFUL_CANCEL = 2,                 ///< it will not run
        PENDING_CANCEL = 3,                    ///< it was told to stop and will end soon
    };

    /// An answer of that status.
    explicit IIPCancelReply(CancelStatus status);
    ~IIPCancelReply() override;

    /// What became of the cancel; from a peer, any number.
    CancelStatus getStatus() const noexcept { return status_; }

  private:
    CancelStatus status_;
};

}  // namespace cmddistributor
