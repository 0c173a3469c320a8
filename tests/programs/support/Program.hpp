// A program under test, run as a user runs it.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <string>
#include <vector>

#include "programs/support/TracedSession.hpp"
#include "support/TemporaryDirectory.hpp"

namespace programs_test {

/// What a program left behind.
struct Ran {
    int exitCode = -1;  ///< 128 + the signal for one that was killed
    std::string out;
    std::string err;
};

/// A running child process with pipes as its standard input, output and error. Every wait has a deadline, after which
/// the test fails and the process is killed; nothing waits for a fixed time. An object that goes kills what still runs.
/// When the client has ended, the test fails if a request of its session had no legal life.
class Program {
  public:
    struct Options {
        std::string input{};                     ///< for its standard input, which ends then
        std::vector<std::string> environment{};  ///< "NAME=value", in addition to that of the test
        std::string directory{};                 ///< to run in; empty for that of the test
        bool terminal = false;  ///< a terminal instead of the first two pipes; the process leads a group of its own
    };

    explicit Program(const std::vector<std::string>& arguments) : Program(arguments, Options{}) {}
    Program(const std::vector<std::string>& arguments, const Options& options);
    ~Program();
    Program(const Program&) = delete;
    Program& operator=(const Program&) = delete;

    /// Reads until standard output (standard error) holds `text` after what the last call waited for; false if it ends
    /// without.
    bool waitForOut(const std::string& text);
    bool waitForErr(const std::string& text);

    /// Reads nothing more of its standard output, so that its next write there fails.
    void closeOut();

    void signal(int number);

    /// Types at its terminal, "\r" for Enter and "\x04" for Ctrl-D.
    void type(const std::string& keys);

    /// Does what its terminal does for Ctrl-C: signals the whole group. The test's terminal is not the one that
    /// controls the process, so that the signal has been sent when this returns.
    void pressCtrlC();

    /// Reads to the end, reaps the process and returns what it left.
    Ran finish();

    pid_t pid() const noexcept { return pid_; }

  private:
    bool pump();
    bool waitFor(const std::string& text, const std::string& where, std::size_t& seen);
    void giveUp(const std::string& what);
    void checkSession();

    std::vector<std::string> command_;
    TracedSession session_;
    pid_t pid_ = -1;
    int in_ = -1;
    int out_ = -1;
    int err_ = -1;
    std::string input_;
    Ran ran_;
    std::size_t seenOut_ = 0;
    std::size_t seenErr_ = 0;
    std::chrono::steady_clock::time_point deadline_;
};

/// Signals one process. Throws std::logic_error for a number that is none: the system takes those for groups, or for
/// all processes that there are.
void signalOne(pid_t pid, int number);

/// Whether the process `pid`, which may be nobody's child here, ends within `time`.
bool endsWithin(pid_t pid, std::chrono::milliseconds time);

/// The same within the patience of a test.
bool waitUntilGone(pid_t pid);

/// Runs a program to its end.
Ran run(const std::vector<std::string>& arguments, const Program::Options& options = {});

/// The client with these arguments.
Ran runClient(std::vector<std::string> arguments, const Program::Options& options = {});

/// Command lines of the programs of this build.
std::vector<std::string> clientCommand(std::vector<std::string> arguments);
std::string enginePath();

/// A value for --engine: the fake engine of these tests, playing `scene`.
std::string fakeEngine(const std::string& scene);

/// `text` as one word of a shell command.
std::string quotedForShell(const std::string& text);

}  // namespace programs_test
