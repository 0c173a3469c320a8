// The wish to cancel a request. Immutable.
#pragma once

#include "foundation/msg_svc/exchange/IDType.hpp"
#include "foundation/msg_svc/exchange/Message.hpp"

namespace cmddistributor {

class IIPCancelMessage : public foundation::msg_svc::exchange::Message {
  public:
    IIPCancelMessage(const foundation::msg_svc::exchange::IDType& id, bool evenIfRunning)
        : evenIfRunning_(evenIfRunning), id_(id) {}

    foundation::msg_svc::exchange::IDType getID() const { return id_; }
    bool getEvenIfRunning() const { return evenIfRunning_; }

  private:
    bool evenIfRunning_;
    foundation::msg_svc::exchange::IDType id_;
};

}  // namespace cmddistributor
