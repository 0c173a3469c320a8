// Base of the objects that end an exchange.
#pragma once

namespace foundation::msg_svc::exchange {

/// The one answer to a Message. Immutable once it is shared.
class Reply {
  public:
    virtual ~Reply();
};

}  // namespace foundation::msg_svc::exchange
