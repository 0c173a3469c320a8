// The engine at the other end: a child process, or a connection to one that listens.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <optional>
#include <string>
#include <vector>

#include "foundation/core/posix/OwnedDescriptor.hpp"

namespace krutil_client {

namespace posix = foundation::core::posix;

/// How a child process ended.
struct EngineEnd {
    bool signalled;  ///< killed by a signal, else exited
    int number;      ///< the signal or the exit code

    /// What happened, to follow "the engine": "was killed by signal 9 (Killed)", "exited with code 7".
    std::string text() const;
};

/// Owns the child and the stream to it. A child that still runs when the object goes is killed and reaped. Ctrl-C on a
/// terminal reaches a child's whole process group; children are started with SIGINT ignored, because it is this program
/// that decides what a Ctrl-C means. Main thread only.
class EngineProcess {
  public:
    /// Starts `arguments` (the first is the program, searched on PATH if it holds no slash) with one end of a socket
    /// pair as its standard input and output; it inherits standard error and nothing else. Throws Failure.
    static EngineProcess start(const std::vector<std::string>& arguments);

    /// Connects to the Unix socket `path`. The process behind it must be this user's. Throws Failure.
    static EngineProcess connect(const std::string& path);

    EngineProcess(EngineProcess&& other) noexcept;
    EngineProcess& operator=(EngineProcess&&) = delete;
    ~EngineProcess();

    /// The stream, which is the caller's from now on; once.
    int takeStream() noexcept { return stream_.release(); }

    /// The stream as long as it has not been taken.
    int stream() const noexcept { return stream_.get(); }

    bool isChild() const noexcept { return pid_ > 0; }

    /// Readable when the child has ended; -1 for a connection.
    int watch() const noexcept { return pidfd_.get(); }

    /// How the child ended, waiting for that up to `patience`; empty while it runs, and for a connection.
    std::optional<EngineEnd> waitForEnd(std::chrono::milliseconds patience);

    /// Kills a child that still runs, and reaps it.
    void kill() noexcept;

  private:
    EngineProcess(pid_t pid, posix::OwnedDescriptor pidfd, posix::OwnedDescriptor stream) noexcept;

    pid_t pid_;
    posix::OwnedDescriptor pidfd_;
    posix::OwnedDescriptor stream_;
    std::optional<EngineEnd> end_;
};

/// The command for the engine that comes with this program: krutil-qvm in the directory of this program if it is there,
/// otherwise the one on PATH; it serves one session on its standard input and output.
std::vector<std::string> defaultEngineCommand();

}  // namespace krutil_client
