// Serves a Unix socket: one process a session.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <optional>
#include <string>

#include "common/RateLimit.hpp"
#include "qvm/Engine.hpp"
#include "qvm/Options.hpp"
#include "qvm/process/AdmittedUsers.hpp"
#include "qvm/process/Log.hpp"
#include "qvm/process/Seat.hpp"
#include "qvm/process/Seats.hpp"
#include "qvm/process/SessionGroups.hpp"

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

    /// Serves `socket` instead, which listens already and is taken over; its file stays whose it is. Throws as above.
    Listener(const Options& options, Log& log, int socket);

    /// Closes the socket and removes its file, in the process that made them.
    ~Listener();
    Listener(const Listener&) = delete;
    Listener& operator=(const Listener&) = delete;

    /// Accepts clients of the same user, and of options.allowUsers, until SIGTERM, SIGINT or SIGHUP, as far as they are
    /// not ignored, then ends the sessions that are left. Clients beyond options.maxSessions are told so, and so is the
    /// client of the oldest handshake when too many are unfinished. While the system has no descriptor for a client,
    /// clients wait. Returns how the process is to end: this one, or one that was forked for a session.
    ExitCode run();

  private:
    void bindSocket();
    bool awaitSomething();
    void acceptOrMakeRoom();
    void accept();
    void serve(int connection, foundation::core::posix::OwnedDescriptor ours,
               foundation::core::posix::OwnedDescriptor theirs);
    void refuse(int connection, const std::string& refusal);
    void sayRefused(const std::string& why);
    void countSilent();
    void reap();
    void endSessions();

    const Options& options_;
    Log& log_;
    const AdmittedUsers users_;
    int socket_ = -1;
    int signals_ = -1;
    ino_t inode_ = 0;
    Seats seats_;
    std::optional<SessionGroups> groups_;  // with --limit-processes
    // Anybody who may connect could fill the log with these.
    apps::RateLimit refusals_{10, std::chrono::minutes(1)};
    apps::RateLimit silent_{1, std::chrono::hours(1)};
    // Attempts since there was last a descriptor for a client.
    unsigned failedAccepts_ = 0;
    // Set in a process that was forked for a session.
    int connection_ = -1;
    std::optional<Seat> seat_;
};

}  // namespace qvm
