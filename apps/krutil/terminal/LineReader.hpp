// Lines that a person types while a session goes on.
#pragma once

#include <exception>
#include <functional>
#include <string>

#include "krutil/base/Output.hpp"
#include "krutil/session/Conversation.hpp"

namespace krutil_client {

/// Thrown by what Ctrl-C does, to drop the line that is being read. Passes through the readers of lines.
class LineDropped : public std::exception {
  public:
    const char* what() const noexcept override { return "the line was dropped"; }
};

/// Whether the exception, if there is one, is that.
bool isLineDropped(const std::exception_ptr& error);

/// What came of reading a line.
struct ReadLine {
    enum class End {
        Newline,     ///< `text` is the line, without its newline
        EndOfInput,  ///< there is no line any more; Ctrl-D on a terminal
        Done,        ///< the line is not wanted any more
    };
    End end;
    std::string text;
};

/// Throws Failure (Usage) for a read of standard input that has failed, with the reason in errno. An error is no end of
/// input: what comes behind it would be lost without a word.
[[noreturn]] void failReading();

/// Reads lines from a descriptor. What arrives in the session is delivered while it waits, and Ctrl-C is dispatched.
/// Main thread only.
class LineReader {
  public:
    /// `fd` is not owned. Prompts go to `out`. All must outlive the object.
    LineReader(int fd, Conversation& conversation, Output& out);

    /// Shows `prompt` and reads a line until `done` returns true. What a terminal holds of a line that is not wanted
    /// any more is dropped. Throws Failure (Usage) where it cannot be read, and what Conversation::run() and
    /// Output::write() throw. Whatever ends it, a terminal is at the beginning of a line then.
    ReadLine read(const std::string& prompt, const std::function<bool()>& done);

  private:
    ReadLine readOn(const std::function<bool()>& done);

    int fd_;
    Conversation& conversation_;
    Output& out_;
    bool terminal_;
    std::string rest_;  ///< read and not yet returned
};

}  // namespace krutil_client
