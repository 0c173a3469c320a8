// The engine at the other end: a child process, or a connection to one that listens.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "krutil/session/TerminalLoan.hpp"
#include "krutil/session/TlsRelay.hpp"

namespace krutil_client {

namespace posix = foundation::core::posix;

/// How a child process ended.
struct EngineEnd {
    bool signalled;  ///< killed by a signal, else exited
    int number;      ///< the signal or the exit code

    /// What happened, to follow "the engine": "was killed by signal 9 (Killed)", "exited with code 7".
    std::string text() const;

    /// Whether a Ctrl-C has ended it; shells turn that into an exit code.
    bool wasInterrupted() const noexcept;
};

/// Owns the child and the stream to it. A child that still runs when the object goes is killed and reaped. It is this
/// program that decides what a Ctrl-C on its terminal means, so that of a session does not reach the child. Main thread
/// only.
class EngineProcess {
  public:
    /// Starts `arguments` (the first is the program, searched on PATH if it holds no slash) with one end of a socket
    /// pair as its standard input and output; it inherits standard error and nothing else. It stays in this program's
    /// process group, with SIGINT ignored. Throws Failure.
    static EngineProcess start(const std::vector<std::string>& arguments);

    /// The same for `command`, which the shell runs. That may start other programs, which may handle SIGINT as they
    /// like. So they have a process group of their own, which ends with the child. They have this program's terminal
    /// until takeTerminalBack(), and may ask a person for a password there. Throws Failure.
    static EngineProcess startCommand(const std::string& command);

    /// Connects to the Unix socket `path`. Who listens there must be this user, or root. Throws Failure.
    static EngineProcess connect(const std::string& path);

    /// Connects to the engine behind a TLS proxy. Returns at once: what is wrong shows as the end of the stream, and in
    /// connectionFailure(). Throws Failure for files that cannot be used.
    static EngineProcess connect(const TlsAddress& address);

    EngineProcess(EngineProcess&& other) noexcept;
    EngineProcess& operator=(EngineProcess&&) = delete;
    ~EngineProcess();

    /// The stream, which is the caller's from now on; once.
    int takeStream() noexcept { return stream_.release(); }

    /// The stream as long as it has not been taken.
    int stream() const noexcept { return stream_.get(); }

    bool isChild() const noexcept { return pid_ > 0; }

    /// Whether a Ctrl-C goes to the child at present.
    bool hasTerminal() const noexcept { return loan_ && loan_->isLent(); }

    /// From now on the terminal is this program's again. Happens by itself when the object goes.
    void takeTerminalBack() noexcept;

    /// Why a TLS connection was not made or has failed; empty otherwise.
    std::string connectionFailure() const { return relay_ ? relay_->failure() : std::string(); }

    /// Readable when the child has ended; -1 for a connection.
    int watch() const noexcept { return pidfd_.get(); }

    /// How the child ended, waiting for that up to `patience`; empty while it runs, and for a connection.
    std::optional<EngineEnd> waitForEnd(std::chrono::milliseconds patience);

    /// Kills a child that still runs, with its process group if it has one of its own, and reaps it.
    void kill() noexcept;

  private:
    EngineProcess(pid_t pid, posix::OwnedDescriptor pidfd, posix::OwnedDescriptor stream) noexcept;
    static EngineProcess start(const std::vector<std::string>& arguments, std::optional<TerminalLoan> loan);

    pid_t pid_;
    posix::OwnedDescriptor pidfd_;
    std::unique_ptr<TlsRelay> relay_;  ///< outlives the stream that it passes on
    posix::OwnedDescriptor stream_;
    std::optional<EngineEnd> end_;
    std::optional<TerminalLoan> loan_;  ///< of a child with a process group of its own
};

/// The command for the engine that comes with this program: krutil-qvm in the directory of this program if it is there,
/// otherwise the one on PATH; it serves one session on its standard input and output.
std::vector<std::string> defaultEngineCommand();

}  // namespace krutil_client
