// What begins an exchange.
#pragma once

namespace foundation::msg_svc::exchange {

struct Message {
    virtual ~Message() = default;
};

}  // namespace foundation::msg_svc::exchange
