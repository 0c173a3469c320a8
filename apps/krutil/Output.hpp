// Where the program's text goes.
#pragma once

#include <cstddef>
#include <string_view>

namespace client {

class Interrupt;

/// One of the program's own output descriptors. Nothing is buffered: text is with the reader, as far as it takes it,
/// when write() returns. Ctrl-C is dispatched while a write waits for a reader that does not read. Main thread only.
class Output {
  public:
    /// `fd` is not owned. `name` is what an error calls it. `interrupt` must outlive the object.
    Output(int fd, std::string_view name, Interrupt& interrupt);

    /// Writes all of `text`. Throws OutputClosed when nobody reads any more, Failure when the text cannot be written,
    /// and what the interrupt's action throws.
    void write(std::string_view text);

    /// Whether a person reads this on a terminal.
    bool isTerminal() const noexcept { return terminal_; }

    /// Columns of the terminal; 80 where that is not known.
    std::size_t columns() const noexcept;

  private:
    int fd_;
    std::string_view name_;
    Interrupt& interrupt_;
    bool terminal_;
    bool mayBlock_;
};

}  // namespace client
