// What the program's exit code says, and the errors that lead to one.
#pragma once

#include <stdexcept>
#include <string>

namespace krutil_client {

/// The program's exit codes, as its --help lists them.
enum class ExitCode : int {
    Ok = 0,
    CodeError = 1,  ///< the code raised an error
    Usage = 2,      ///< the command line or the code text cannot be used
    Stream = 3,     ///< no engine could be started or reached, a stream was lost, or a file of the engine lacks text
    Violation = 4,  ///< the engine broke the protocol, or a recording that is checked does
    Refused = 5,    ///< the ends do not fit: version or features
    Cancelled = 6,  ///< cancelled, by Ctrl-C here or by the engine
};

/// Ends the program with `code` after one sentence, what(), on standard error.
class Failure : public std::runtime_error {
  public:
    Failure(ExitCode code, const std::string& sentence) : std::runtime_error(sentence), code_(code) {}
    ExitCode code() const noexcept { return code_; }

  private:
    ExitCode code_;
};

/// Ctrl-C, with nothing left to do but to end.
class Cancelled : public std::exception {
  public:
    const char* what() const noexcept override { return "cancelled"; }
};

/// Whoever read the program's output has gone, so there is nothing left to do and nobody to tell.
class OutputClosed : public std::exception {
  public:
    const char* what() const noexcept override { return "standard output was closed"; }
};

}  // namespace krutil_client
