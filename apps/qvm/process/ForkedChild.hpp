// Processes that running code forks: they share nothing of the session.
#pragma once

#include "foundation/msg_svc/transport/layers/session/Session.hpp"

namespace qvm {

/// While an object lives, every child that this process forks closes its copies of the session's descriptors before it
/// runs anything else. One object at a time.
class ForkGuard {
  public:
    /// `session` must outlive the object. Throws std::system_error when the system refuses the handler.
    explicit ForkGuard(foundation::msg_svc::transport::layers::session::Session& session);
    ~ForkGuard();
    ForkGuard(const ForkGuard&) = delete;
    ForkGuard& operator=(const ForkGuard&) = delete;
};

/// Whether this process is a child that was forked while a ForkGuard lived. Such a process must not touch the session,
/// nor any lock that a thread of its parent may have held.
bool inForkedChild() noexcept;

}  // namespace qvm
