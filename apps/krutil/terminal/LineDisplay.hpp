// How a line that is being edited looks on a terminal.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>
#include <vector>

#include "krutil/base/Output.hpp"
#include "krutil/terminal/Highlight.hpp"

namespace krutil_client {

/// Keeps a prompt and a line behind it shown, over as many rows as they need, or as many of these around the cursor as
/// the terminal has. The object decides what to write; writing it is its user's work. Nothing else may be written
/// between begin() and the last show(). Widths are those of the C library, so LC_CTYPE must be one of UTF-8. The
/// terminal wraps lines and knows the usual sequences to move the cursor and to erase. A value.
class LineDisplay {
  public:
    /// What to show. Control characters of the text are shown as ^A and the like.
    struct Line {
        std::wstring prompt;  ///< for which measures() is true
        std::wstring text{};
        std::size_t cursor = 0;       ///< the character of `text` that the cursor stands before
        std::vector<Style> styles{};  ///< of each character of `text`; empty for plain ones
        std::wstring continuation{};  ///< before each line of `text` but the first one; measures() is true for it
    };

    /// Whether the place of the cursor after this text is known: it has no control characters but tabs and complete
    /// sequences for colours and the like.
    static bool measures(std::wstring_view text);

    /// The terminal has `written` in the row of the cursor, and in rows above if it is longer, and the cursor behind
    /// it; measures() must be true for it. Returns what to write to make sure of that.
    std::string begin(const std::wstring& written, TerminalSize size);

    /// The terminal may have more behind the cursor than begin() was told: the next show() writes all of the line.
    void doubt() noexcept { certain_ = false; }

    /// What to write to have `line` shown instead of what was shown before; empty when nothing changes. When the size
    /// is another one than before, the terminal is taken to have filled its rows anew, as most do.
    std::string show(const Line& line, TerminalSize size);

  private:
    struct Row {
        std::string bytes{};
        std::size_t width = 0;
        bool goesOn = false;  // in the next row, without a newline
    };
    struct Picture {
        std::vector<Row> rows{1};
        std::size_t cursorRow = 0;
        std::size_t cursorColumn = 0;
    };
    class Layout;

    std::string paint() const;
    std::string moveCursor(std::size_t row, std::size_t column) const;
    void scrollToCursor();
    std::size_t rowAfterResize(std::size_t columns) const;

    TerminalSize size_;
    Picture picture_;
    std::size_t first_ = 0;  // row of the picture that is the first one on the terminal
    std::string painted_;
    bool certain_ = true;  // whether painted_ is what the terminal shows
};

}  // namespace krutil_client
