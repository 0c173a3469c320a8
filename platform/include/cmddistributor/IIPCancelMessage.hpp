// Asks an engine to cancel a request.
#pragma once

#include "foundation/msg_svc/exchange/IDType.hpp"
#include "foundation/msg_svc/exchange/Message.hpp"

namespace cmddistributor {

/// Begins an exchange of its own, which an IIPCancelReply ends. Immutable.
class IIPCancelMessage : public foundation::msg_svc::exchange::Message {
  public:
    /// `id` is that of the request to cancel; see getEvenIfRunning().
    IIPCancelMessage(const foundation::msg_svc::exchange::IDType& id, bool evenIfRunning);
    ~IIPCancelMessage() override;

    /// The request to cancel.
    const foundation::msg_svc::exchange::IDType& getID() const noexcept { return id_; }
    /// Whether the request is to be interrupted when it runs already.
    bool getEvenIfRunning() const noexcept { return evenIfRunning_; }

  private:
    foundation::msg_svc::exchange::IDType id_;
    bool evenIfRunning_;
};

}  // namespace cmddistributor
