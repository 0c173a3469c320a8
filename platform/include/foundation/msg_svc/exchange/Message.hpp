// Base of the objects that begin an exchange.
#pragma once

namespace foundation::msg_svc::exchange {

/// An object that is sent to a peer and answered with exactly one Reply. Immutable once it is shared.
class Message {
  public:
    virtual ~Message();
};

}  // namespace foundation::msg_svc::exchange
