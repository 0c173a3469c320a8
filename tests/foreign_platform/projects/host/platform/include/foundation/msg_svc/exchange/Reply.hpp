// What ends an exchange.
#pragma once

namespace foundation::msg_svc::exchange {

struct Reply {
    virtual ~Reply() = default;
};

}  // namespace foundation::msg_svc::exchange
