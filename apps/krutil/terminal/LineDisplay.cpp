#include "krutil/terminal/LineDisplay.hpp"

#include <algorithm>
#include <cwchar>
#include <utility>

#include "krutil/base/Text.hpp"

namespace krutil_client {
namespace {

constexpr std::size_t tabStop = 8;

// The length of the sequence at `at`, which sets a colour or the like; 0 where there is none.
std::size_t styleAt(std::wstring_view text, std::size_t at) {
    if (text.substr(at, 2) != L"\x1b[") {
        return 0;
    }
    const auto end = text.find_first_not_of(L"0123456789;:", at + 2);
    return end != std::wstring_view::npos && text[end] == L'm' ? end + 1 - at : 0;
}

// Each begins anew, whatever was before.
const char* sequenceOf(Style style) {
    switch (style) {
        case Style::Keyword:
            return "\x1b[0;35m";
        case Style::Literal:
            return "\x1b[0;32m";
        case Style::Number:
            return "\x1b[0;36m";
        case Style::Comment:
            return "\x1b[0;90m";
        case Style::Match:
            return "\x1b[0;1;4m";
        case Style::Plain:
            break;
    }
    return "\x1b[0m";
}

bool isControl(wchar_t c) {
    return c < L' ' || c == L'\x7f';
}

}  // namespace

// Puts characters into rows as a terminal does.
class LineDisplay::Layout {
  public:
    explicit Layout(std::size_t columns) : columns_(columns) {}

    void putPrompt(std::wstring_view prompt) {
        for (std::size_t i = 0; i < prompt.size();) {
            if (const auto style = styleAt(prompt, i); style != 0) {
                row().bytes += toUtf8(prompt.substr(i, style));
                i += style;
            } else {
                put(prompt[i++]);
            }
        }
    }

    // Of the characters from now on.
    void setStyle(Style style) noexcept { style_ = style; }

    void put(wchar_t c) {
        if (c == L'\n') {
            endStyle();
            picture_.rows.emplace_back();
        } else if (c == L'\t') {
            do {
                put(" ", 1);
            } while (row().width % tabStop != 0 && row().width < columns_);
        } else if (isControl(c)) {
            put("^", 1);
            put(std::string(1, c == L'\x7f' ? '?' : static_cast<char>(c + L'@')), 1);
        } else if (const int width = ::wcwidth(c); width >= 0) {
            put(toUtf8(std::wstring_view(&c, 1)), static_cast<std::size_t>(width));
        } else {
            put("\uFFFD", 1);
        }
    }

    void markCursor() {
        if (row().width == columns_) {
            wrap();
        }
        picture_.cursorRow = picture_.rows.size() - 1;
        picture_.cursorColumn = row().width;
    }

    Picture finish() {
        endStyle();
        if (row().width == columns_) {
            wrap();
        }
        return std::move(picture_);
    }

  private:
    Row& row() { return picture_.rows.back(); }

    void wrap() {
        endStyle();
        row().goesOn = true;
        picture_.rows.emplace_back();
    }

    // One character; those without a width are a part of the one before.
    void put(const std::string& bytes, std::size_t width) {
        width = std::min(width, columns_);
        if (row().width + width > columns_) {
            wrap();
        }
        if (written_ != style_) {
            row().bytes += sequenceOf(style_);
            written_ = style_;
        }
        row().bytes += bytes;
        row().width += width;
    }

    // Each row has its styles to itself, because any may be the first one on the terminal.
    void endStyle() {
        if (written_ != Style::Plain) {
            row().bytes += sequenceOf(Style::Plain);
            written_ = Style::Plain;
        }
    }

    const std::size_t columns_;
    Style style_ = Style::Plain;
    Style written_ = Style::Plain;
    Picture picture_;
};

bool LineDisplay::measures(std::wstring_view text) {
    for (std::size_t i = 0; i < text.size();) {
        if (const auto style = styleAt(text, i); style != 0) {
            i += style;
        } else if (text[i] == L'\t' || (!isControl(text[i]) && ::wcwidth(text[i]) >= 0)) {
            ++i;
        } else {
            return false;
        }
    }
    return true;
}

std::string LineDisplay::begin(const std::wstring& written, TerminalSize size) {
    size_ = size;
    Layout layout(size_.columns);
    layout.putPrompt(written);
    layout.markCursor();
    picture_ = layout.finish();
    first_ = 0;
    scrollToCursor();
    painted_ = paint();
    certain_ = true;
    // A terminal that has filled a row leaves it with the next character only.
    const bool filled = picture_.cursorRow > 0 && picture_.cursorColumn == 0;
    return filled ? " \r" : "";
}

std::string LineDisplay::show(const Line& line, TerminalSize size) {
    const bool resized = size.columns != size_.columns || size.rows != size_.rows;
    const bool certain = std::exchange(certain_, true) && !resized;
    const std::size_t cursorRow = resized ? rowAfterResize(size.columns) : picture_.cursorRow - first_;
    const bool atEnd =
        first_ + cursorRow + 1 == picture_.rows.size() && picture_.cursorColumn == picture_.rows.back().width;
    const std::size_t cursorColumn = picture_.cursorColumn;
    const std::string before = std::move(painted_);
    const std::size_t firstBefore = first_;

    size_ = size;
    Layout layout(size_.columns);
    layout.putPrompt(line.prompt);
    for (std::size_t i = 0; i < line.text.size(); ++i) {
        if (i == line.cursor) {
            layout.markCursor();
        }
        layout.setStyle(i < line.styles.size() ? line.styles[i] : Style::Plain);
        layout.put(line.text[i]);
        if (line.text[i] == L'\n') {
            layout.setStyle(Style::Plain);
            layout.putPrompt(line.continuation);
        }
    }
    if (line.cursor >= line.text.size()) {
        layout.markCursor();
    }
    picture_ = layout.finish();
    scrollToCursor();
    painted_ = paint();

    const std::size_t lastRow = std::min(picture_.rows.size() - first_, size_.rows) - 1;
    const std::size_t lastColumn = picture_.rows[first_ + lastRow].width;
    if (certain && first_ == firstBefore && painted_ == before) {
        return cursorRow == picture_.cursorRow - first_ && cursorColumn == picture_.cursorColumn
                   ? std::string()
                   : moveCursor(cursorRow, cursorColumn);
    }
    if (certain && first_ == firstBefore && atEnd && painted_.compare(0, before.size(), before) == 0) {
        return painted_.substr(before.size()) + moveCursor(lastRow, lastColumn);
    }
    std::string text = cursorRow > 0 ? "\x1b[" + std::to_string(cursorRow) + "A\r" : "\r";
    text += painted_;
    // In a full row the cursor still stands on the last character; below it there is nothing then.
    if (lastColumn < size_.columns) {
        text += "\x1b[J";
    }
    return text + moveCursor(lastRow, lastColumn);
}

// The visible rows, from the beginning of the first one.
std::string LineDisplay::paint() const {
    std::string text;
    const std::size_t end = std::min(picture_.rows.size(), first_ + size_.rows);
    for (std::size_t i = first_; i < end; ++i) {
        const Row& row = picture_.rows[i];
        text += row.bytes;
        const bool last = i + 1 == end;
        if (row.width < size_.columns && !last) {
            text += "\x1b[K";
        }
        if (!last && !row.goesOn) {
            text += "\r\n";
        } else if (!last && row.width == size_.columns && picture_.rows[i + 1].width == 0) {
            // Moves on to a row that has nothing yet.
            text += " \r";
        }
    }
    return text;
}

// From a place on the terminal to the cursor's.
std::string LineDisplay::moveCursor(std::size_t row, std::size_t column) const {
    const std::size_t wanted = picture_.cursorRow - first_;
    std::string text;
    if (wanted < row) {
        text += "\x1b[" + std::to_string(row - wanted) + "A";
    } else if (wanted > row) {
        text += "\x1b[" + std::to_string(wanted - row) + "B";
    }
    if (picture_.cursorColumn == column) {
        return text;
    }
    text += '\r';
    if (picture_.cursorColumn > 0) {
        text += "\x1b[" + std::to_string(picture_.cursorColumn) + "C";
    }
    return text;
}

void LineDisplay::scrollToCursor() {
    if (picture_.cursorRow < first_) {
        first_ = picture_.cursorRow;
    } else if (picture_.cursorRow >= first_ + size_.rows) {
        first_ = picture_.cursorRow - size_.rows + 1;
    }
    // No empty rows below while there are others above.
    if (picture_.rows.size() < first_ + size_.rows) {
        first_ = picture_.rows.size() > size_.rows ? picture_.rows.size() - size_.rows : 0;
    }
}

// The row of the cursor on a terminal that has filled its rows anew.
std::size_t LineDisplay::rowAfterResize(std::size_t columns) const {
    std::size_t row = 0;
    std::size_t cells = 0;
    for (std::size_t i = first_; i < picture_.cursorRow; ++i) {
        cells += picture_.rows[i].goesOn ? size_.columns : picture_.rows[i].width;
        if (!picture_.rows[i].goesOn) {
            row += 1 + (cells == 0 ? 0 : (cells - 1) / columns);
            cells = 0;
        }
    }
    return row + (cells + picture_.cursorColumn) / columns;
}

}  // namespace krutil_client
