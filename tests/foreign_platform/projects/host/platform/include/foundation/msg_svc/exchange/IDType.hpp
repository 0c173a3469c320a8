// Identifiers.
#pragma once

namespace foundation::msg_svc::exchange {

struct IDType {
    long number = 0;

    bool operator==(const IDType&) const = default;
};

}  // namespace foundation::msg_svc::exchange
