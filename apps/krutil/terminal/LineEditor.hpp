// A line editor with a history, for terminals.
#pragma once

#include <functional>
#include <memory>
#include <string>

#include "krutil/base/LastLine.hpp"
#include "krutil/base/Output.hpp"
#include "krutil/session/Conversation.hpp"
#include "krutil/terminal/LineReader.hpp"

namespace krutil_client {

/// Reads lines from standard input, a terminal, where they are edited with the usual keys. What arrives in the session
/// is delivered meanwhile: the line is taken away before, and shown again behind it. Ctrl-C is dispatched, Ctrl-Z stops
/// the program and leaves the terminal as it was. One object a process: it sets the process's character type to UTF-8.
/// Main thread only.
class LineEditor {
  public:
    /// What a line is typed for.
    enum class For {
        Code,   ///< it is remembered in the history
        Input,  ///< what runs has asked for it: the last line of the terminal is a part of the prompt
    };

    /// Code is remembered in `historyFile`, see LineHistory; empty for none. `out` is the terminal, which has a cursor,
    /// and which nothing but outputs with this `lastLine` writes to. All must outlive the object.
    LineEditor(Conversation& conversation, Output& out, LastLine& lastLine, std::string historyFile);
    ~LineEditor();
    LineEditor(const LineEditor&) = delete;
    LineEditor& operator=(const LineEditor&) = delete;

    /// As LineReader::read() does. Whatever leaves Conversation::run() ends the editing.
    ReadLine read(For what, const std::string& prompt, const std::function<bool()>& done);

  private:
    class Impl;
    std::unique_ptr<Impl> impl_;
};

/// Where the history of this user's lines is kept: below $XDG_STATE_HOME, or ~/.local/state; empty when neither is
/// known.
std::string defaultHistoryFile();

}  // namespace krutil_client
