// Processes that a test looks at from outside, most of them nobody's child here: the engines of clients, the sessions
// of an engine that listens.
//
// Nothing here waits for a fixed time; every wait ends with a failure when the patience of a test is over. Numbers that
// are no process are refused as signalOne() refuses them.
#pragma once

#include <sys/types.h>

#include <map>
#include <string>
#include <vector>

namespace programs_test {

/// Makes this process the parent of every descendant whose own parent ends, so that none gets out of sight. Lasts.
void adoptOrphans();

/// Waits until this process has no child left. One that does not end fails the test, with its command line, and is
/// killed. To be called when all Program objects have gone.
void expectNoDescendants();

/// Children of a process, zombies included.
std::vector<pid_t> childrenOf(pid_t parent);

/// The only child of a process, which may be about to be made. Throws std::runtime_error when there is none, or more.
pid_t onlyChildOf(pid_t parent);

/// Waits for the end of a process that is a child of this one, perhaps an adopted one, and reaps it; returns its exit
/// code, 128 + the signal for one that was killed.
int exitCodeOf(pid_t pid);

/// Stops a process; returns when none of its threads runs any more.
void stop(pid_t pid);

/// Waits until a process is stopped, by whomever.
void awaitStopped(pid_t pid);

/// Lets a process go on if it is stopped.
void resume(pid_t pid);

/// Descriptors that a process has open, and what they lead to.
std::map<int, std::string> descriptorsOf(pid_t pid);

}  // namespace programs_test
