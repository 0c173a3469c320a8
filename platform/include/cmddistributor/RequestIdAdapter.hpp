// Events that tell which request they belong to.
#pragma once

#include "foundation/msg_svc/exchange/IDType.hpp"

namespace cmddistributor {

/// Part of an event that carries the identifier of its request; the default identifier stands for no request.
class RequestIdAdapter {
  public:
    /// `id` is that of the request that the event belongs to.
    explicit RequestIdAdapter(const foundation::msg_svc::exchange::IDType& id) noexcept : requestId_(id) {}
    virtual ~RequestIdAdapter();

    /// Identifier of the request; the default one stands for no request.
    foundation::msg_svc::exchange::IDType getRequestId() const noexcept { return requestId_; }

  private:
    foundation::msg_svc::exchange::IDType requestId_;
};

}  // namespace cmddistributor
