// Where the program's text goes.
#pragma once

#include <cstddef>
#include <string_view>

namespace krutil_client {

class Interrupt;
class LastLine;

/// How large a terminal is.
struct TerminalSize {
    std::size_t columns = 80;    ///< at least 1; 80 where it is not known
    std::size_t rows = 24;       ///< at least 1; 24 where it is not known
    std::size_t pixelWidth = 0;  ///< 0 where it is not known
};

/// One of the program's own output descriptors. Nothing is buffered: text is with the reader, as far as it takes it,
/// when write() returns. Ctrl-C is dispatched meanwhile, so that neither a reader that does not read nor text without
/// end holds it up. Main thread only.
class Output {
  public:
    /// `fd` is not owned. `name` is what an error calls it. `lastLine`, if there is one, is told of what is written to
    /// a terminal; outputs to the same terminal share it. `interrupt` and `lastLine` must outlive the object.
    Output(int fd, std::string_view name, Interrupt& interrupt, LastLine* lastLine = nullptr);

    /// Writes all of `text`. Throws OutputClosed when nobody reads any more, Failure when the text cannot be written,
    /// and what the interrupt's action throws.
    void write(std::string_view text);

    /// The same for what will be taken away again, and is no part of the terminal's last line. A reader that reads gets
    /// all of it, whatever Ctrl-C does: its writer knows what the terminal shows.
    void show(std::string_view text);

    /// Whether a person reads this on a terminal.
    bool isTerminal() const noexcept { return terminal_; }

    /// Whether that terminal is known to have a cursor that can be moved, and to erase.
    bool hasCursor() const noexcept;

    /// What the terminal says now. The numbers belong together: it may say others a moment later.
    TerminalSize terminalSize() const noexcept;

  private:
    void put(std::string_view text, bool interruptible);

    int fd_;
    std::string_view name_;
    Interrupt& interrupt_;
    bool terminal_;
    bool mayBlock_;
    LastLine* lastLine_;
};

}  // namespace krutil_client
