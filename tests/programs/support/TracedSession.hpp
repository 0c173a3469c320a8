// The lives of all requests of a client's session, checked after the program has ended.
//
//     std::vector<std::string> command{client, "eval", "1"};
//     const TracedSession session(command);
//     const Ran ran = ...;  // of the command, which is another one now
//     EXPECT_EQ(session.whatIsWrong(ran.exitCode, ran.err), "");
//
// Program and Terminal do this with every client that they run.
#pragma once

#include <istream>
#include <optional>
#include <string>
#include <vector>

#include "support/TemporaryDirectory.hpp"

namespace programs_test {

/// How a client's session came to its end.
enum class TraceEnd {
    InOrder,  ///< each request was answered
    Refused,  ///< the client refused the last message: it broke the protocol
    Early,    ///< at any point: one of the two ends was lost, killed or given up
};

/// What is wrong with the requests of a trace (lines as --trace writes them); a sentence for each, which begins with
/// its stream. Empty for nothing.
std::string wrongLives(std::istream& trace, TraceEnd end);

/// See the head of this file.
class TracedSession {
  public:
    /// Makes `command` trace itself to a file of this object's, if it is the client of this build with a subcommand
    /// that begins a session. Other commands, and those that have a --trace-to already, are left alone and not checked.
    explicit TracedSession(std::vector<std::string>& command);

    /// What is wrong in the session of the command, which has ended; `said` is what the program said for a person, its
    /// standard error or the screen.
    std::string whatIsWrong(int exitCode, const std::string& said) const;

  private:
    std::optional<test_support::TemporaryDirectory>
        directory_;  ///< holds the trace; none for a command that is left alone
};

}  // namespace programs_test
