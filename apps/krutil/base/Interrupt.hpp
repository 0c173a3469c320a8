// Ctrl-C.
#pragma once

#include <functional>
#include <utility>

#include "foundation/core/posix/EventDescriptor.hpp"
#include "foundation/core/posix/OwnedDescriptor.hpp"

namespace krutil_client {

namespace posix = foundation::core::posix;

/// Turns SIGINT into a readable descriptor and a call on the main thread. Everything that waits there watches fd() and
/// calls dispatch() when it is readable, so that Ctrl-C is answered at once, whatever the program waits for. One object
/// at a time; after it, Ctrl-C does nothing, so that a program ends with the exit code that it has decided on. Main
/// thread only.
class Interrupt {
  public:
    Interrupt();
    ~Interrupt();
    Interrupt(const Interrupt&) = delete;
    Interrupt& operator=(const Interrupt&) = delete;

    /// Readable while a Ctrl-C, or a wake(), has not been dispatched.
    int fd() const noexcept { return event_.get(); }

    /// Calls the action once if there was any Ctrl-C since the last call, and `before` ahead of it. Whatever they throw
    /// reaches the caller.
    void dispatch(const std::function<void()>& before = nullptr);

    /// Returns when `input` has bytes or has ended, however long that takes, and calls dispatch() until then and once
    /// before it returns. A call that reads after that does not wait.
    void waitForInput(int input);

    /// Makes fd() readable without a Ctrl-C, so that whatever waits looks around. For signal handlers.
    static void wake() noexcept;

    /// Replaces what a Ctrl-C does, and returns what it did before. The first action throws Cancelled.
    std::function<void()> setAction(std::function<void()> action) { return std::exchange(action_, std::move(action)); }

    /// While an object lives, Ctrl-C also shuts down a socket, at once and from the signal handler: for calls that
    /// block on the socket and do not know of fd(). dispatch() is due after such a call has failed.
    class ShutsDown {
      public:
        /// Keeps a duplicate of `socket`.
        explicit ShutsDown(int socket);
        ~ShutsDown();
        ShutsDown(const ShutsDown&) = delete;
        ShutsDown& operator=(const ShutsDown&) = delete;

      private:
        posix::OwnedDescriptor socket_;
    };

  private:
    posix::EventDescriptor event_;
    std::function<void()> action_;
};

}  // namespace krutil_client
