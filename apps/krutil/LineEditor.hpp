// A line editor with a history, for terminals.
#pragma once

#include <functional>
#include <memory>
#include <string>

#include "Conversation.hpp"
#include "LineReader.hpp"

namespace client {

/// Reads lines from standard input, which must be a terminal like standard output; they are edited with the usual keys
/// and kept in a history. What arrives in the session is delivered meanwhile, and Ctrl-C is dispatched. One object a
/// process: it sets the process's character type to UTF-8. Main thread only.
class LineEditor {
  public:
    /// `historyFile` is read now and written when the object goes, for its owner only; empty for none. A history that
    /// cannot be read or written is none. `conversation` must outlive the object.
    LineEditor(Conversation& conversation, std::string historyFile);
    ~LineEditor();
    LineEditor(const LineEditor&) = delete;
    LineEditor& operator=(const LineEditor&) = delete;

    /// As LineReader::read() does. Whatever leaves Conversation::run() ends the editing.
    ReadLine read(const std::string& prompt, const std::function<bool()>& done);

  private:
    class Impl;
    std::unique_ptr<Impl> impl_;
};

/// Where the history of this user's lines is kept: below $XDG_STATE_HOME, or ~/.local/state; empty when neither is
/// known.
std::string defaultHistoryFile();

}  // namespace client
