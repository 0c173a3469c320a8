// How many processes the sessions of a listening engine may have: a control group for each of them.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <map>
#include <string>

namespace qvm {

/// A session has five threads, and starts some for its code.
inline constexpr std::uint64_t smallestProcessLimit = 16;

/// More the system does not count.
inline constexpr std::uint64_t largestProcessLimit = 4'194'304;

/// Divides the control group (version 2) in which the listener was started: one group below it for the listener,
/// because processes lie in the lowest groups only, and one for each session. The process that makes it must have one
/// thread.
///
/// What a session has left behind goes on in the session's group, within its bound. The group is removed when that has
/// ended, as far as the listener then still exists.
class SessionGroups {
  public:
    /// Moves this process into the listener's group. `limit` is how many processes and threads each session may have at
    /// a time. `self` tells of this process, as /proc/self does. Throws std::runtime_error with sentences that say what
    /// is missing, and what to do.
    explicit SessionGroups(std::uint64_t limit, const std::string& self = "/proc/self");

    /// Makes all as it was, in the process that the object was made in. Where a session's group is still in use, that
    /// one stays, and so does its bound.
    ~SessionGroups();
    SessionGroups(const SessionGroups&) = delete;
    SessionGroups& operator=(const SessionGroups&) = delete;

    /// In a process that was forked for a session, before it runs anybody's code: bounds it and what it will start.
    /// Throws std::system_error when the system refuses.
    void join() const;

    /// In the listener: such a process has been forked.
    void begun(pid_t process) { groups_[process] = false; }

    /// In the listener: it has been reaped. Removes its group, and those that could not be removed before.
    void ended(pid_t process);

  private:
    std::string groupOf(pid_t process) const;
    void remove(bool all) noexcept;
    void giveBack() noexcept;

    const std::uint64_t limit_;
    const pid_t owner_;
    std::string top_;               // the directory of the group that is divided
    std::map<pid_t, bool> groups_;  // of which process, and whether that has ended
};

}  // namespace qvm
