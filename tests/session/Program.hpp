// A program under test, run as a user runs it.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <string>
#include <vector>

namespace session_test {

/// What a program left behind.
struct Ran {
    int exitCode = -1;  ///< 128 + the signal for one that was killed
    std::string out;
    std::string err;
};

/// A running child process with pipes as its standard input, output and error. Every wait has a deadline of a minute,
/// after which the test fails and the process is killed; nothing waits for a fixed time. An object that goes kills what
/// still runs.
class Program {
  public:
    struct Options {
        std::string input{};                     ///< for its standard input, which ends then
        std::vector<std::string> environment{};  ///< "NAME=value", in addition to that of the test
        std::string directory{};                 ///< to run in; empty for that of the test
    };

    explicit Program(const std::vector<std::string>& arguments) : Program(arguments, Options{}) {}
    Program(const std::vector<std::string>& arguments, const Options& options);
    ~Program();
    Program(const Program&) = delete;
    Program& operator=(const Program&) = delete;

    /// Reads until standard output (standard error) holds `text`; false if it ends without.
    bool waitForOut(const std::string& text);
    bool waitForErr(const std::string& text);

    /// Reads nothing more of its standard output, so that its next write there fails.
    void closeOut();

    void signal(int number);

    /// Reads to the end, reaps the process and returns what it left.
    Ran finish();

    pid_t pid() const noexcept { return pid_; }

  private:
    bool pump();
    void giveUp(const std::string& what);

    pid_t pid_ = -1;
    int in_ = -1;
    int out_ = -1;
    int err_ = -1;
    std::string input_;
    Ran ran_;
    std::chrono::steady_clock::time_point deadline_;
};

/// Waits until the process `pid`, which may be nobody's child here, has ended; false if it outlives the deadline.
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

/// A private directory that goes, with all that is in it, when the object does.
class TemporaryDirectory {
  public:
    TemporaryDirectory();
    ~TemporaryDirectory();
    TemporaryDirectory(const TemporaryDirectory&) = delete;
    TemporaryDirectory& operator=(const TemporaryDirectory&) = delete;

    std::string file(const std::string& name) const { return path_ + "/" + name; }

  private:
    std::string path_;
};

}  // namespace session_test
