// The two directions of a session whose ends see memory of each other.
#pragma once

#include "foundation/msg_svc/transport/layers/session/lending/Borrower.hpp"
#include "foundation/msg_svc/transport/layers/session/lending/Lender.hpp"

namespace foundation::msg_svc::transport::layers::session::lending {

struct SharedMemory {
    SharedMemory(Role role, Outgoing& outgoing) : lender(role), borrower(outgoing) {}

    /// The session is over: nothing is lent any more, nothing given back. Any thread.
    void close() {
        borrower.close();
        lender.close();
    }

    Lender lender;
    Borrower borrower;
};

}  // namespace foundation::msg_svc::transport::layers::session::lending
