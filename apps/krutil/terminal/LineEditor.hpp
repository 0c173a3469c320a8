// A line editor with a history, for terminals.
#pragma once

#include <functional>
#include <memory>
#include <string>

#include "krutil/base/LastLine.hpp"
#include "krutil/base/Output.hpp"
#include "krutil/session/Conversation.hpp"
#include "krutil/terminal/Completion.hpp"
#include "krutil/terminal/LineReader.hpp"

namespace krutil_client {

/// Reads lines from standard input, a terminal, where they are edited with the usual keys. What arrives in the session
/// is delivered meanwhile: the line is taken away before, and shown again behind it. Ctrl-C is dispatched, Ctrl-Z stops
/// the program and leaves the terminal as it was. One object a process: it sets the process's character type to UTF-8.
/// Main thread only.
///
/// Code is edited in blocks: Enter begins a line of its own, indented, until the code is whole (isWhole()). Up and Down
/// move inside the block, and in its first and last line through the history, of which a block is one entry.
class LineEditor {
  public:
    /// What a line is typed for.
    enum class For {
        Code,   ///< it is remembered in the history
        Input,  ///< what runs has asked for it: the last line of the terminal is a part of the prompt
    };

    /// Code is remembered in `historyFile`, see LineHistory; empty for none. `out` is the terminal, which has a cursor,
    /// and which nothing but outputs with this `lastLine` writes to. Both must outlive the object. `color` says that
    /// code is coloured, and the bracket marked that belongs to the one at the cursor.
    LineEditor(Output& out, LastLine& lastLine, std::string historyFile, bool color);
    ~LineEditor();
    LineEditor(const LineEditor&) = delete;
    LineEditor& operator=(const LineEditor&) = delete;

    /// As LineReader::read() does, while `conversation` goes on. Whatever leaves Conversation::run() ends the editing.
    /// Code that is half typed when an exception leaves here, but LineDropped, is what the next code begins with.
    /// The key Tab asks `complete`, which may deliver, and inserts blanks when that is empty or returns nothing.
    ReadLine read(Conversation& conversation, const Complete& complete, For what, const std::string& prompt,
                  const std::function<bool()>& done);

    /// See LineHistory::refusal().
    const std::string& historyRefusal() const noexcept;

    /// Takes keys that have been typed and read elsewhere: the next line begins with them.
    void type(const std::string& keys);

  private:
    class Impl;
    std::unique_ptr<Impl> impl_;
};

}  // namespace krutil_client
