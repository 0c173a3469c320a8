// Serves a Unix socket: one process a session.
#pragma once

#include <sys/types.h>

#include <set>
#include <string>

#include "qvm/Engine.hpp"
#include "qvm/Options.hpp"
#include "qvm/process/Log.hpp"

namespace qvm {

/// Owns the socket and its file from construction to destruction. The process that makes it must have one thread, since
/// it forks for every session.
class Listener {
  public:
    /// Creates the socket (mode 0600) at options.listen. Its directory is created, or must belong to this user and be
    /// closed to others; a socket that nobody answers on is replaced. Python is started before, for all sessions.
    /// `options` and `log` must outlive the object. Throws std::runtime_error with a sentence that says what is in the
    /// way.
    Listener(const Options& options, Log& log);

    /// Closes the socket and removes its file, in the process that made them.
    ~Listener();
    Listener(const Listener&) = delete;
    Listener& operator=(const Listener&) = delete;

    /// Accepts clients of the same user until SIGTERM, SIGINT or SIGHUP, as far as they are not ignored, then ends the
    /// sessions that are left. While the system has no descriptor for a client, clients wait. Returns how the process
    /// is to end: this one, or one that was forked for a session.
    ExitCode run();

  private:
    void bindSocket();
    void accept();
    void reap();
    void endSessions();

    const Options& options_;
    Log& log_;
    int socket_ = -1;
    int signals_ = -1;
    ino_t inode_ = 0;
    std::set<pid_t> sessions_;
    // Attempts since there was last a descriptor for a client.
    unsigned failedAccepts_ = 0;
    // Set in a process that was forked for a session.
    int connection_ = -1;
};

}  // namespace qvm
