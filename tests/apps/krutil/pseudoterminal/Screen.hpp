// What a terminal makes of the bytes that a program writes to it.
#pragma once

#include <algorithm>
#include <clocale>
#include <cstddef>
#include <cwchar>
#include <string>
#include <string_view>
#include <vector>

namespace krutil_client {

/// The rows of a terminal, as far as this program's texts need it: it wraps, scrolls, moves its cursor and erases, and
/// fills its rows anew when its size changes. A value; it sets the process's character type to UTF-8.
class Screen {
  public:
    /// Stands for the cursor in lines().
    static constexpr const char* cursor = "\u25ae";

    Screen(std::size_t columns, std::size_t rows) : columns_(columns), height_(rows), rows_(1) {
        std::setlocale(LC_CTYPE, "C.UTF-8");
    }

    void show(std::string_view bytes) {
        pending_ += bytes;
        while (std::size_t used = showOne()) {
            pending_.erase(0, used);
        }
    }

    void resize(std::size_t columns, std::size_t rows) {
        std::vector<Row> before = std::exchange(rows_, std::vector<Row>(1));
        const std::size_t cursorRow = std::exchange(row_, 0);
        const std::size_t cursorColumn = std::exchange(column_, 0);
        columns_ = columns;
        height_ = rows;
        std::size_t newRow = 0;
        std::size_t newColumn = 0;
        for (std::size_t i = 0; i < before.size(); ++i) {
            for (std::size_t j = 0; j < std::max(before[i].cells.size(), i == cursorRow ? cursorColumn + 1 : 0); ++j) {
                if (i == cursorRow && j == cursorColumn) {
                    newRow = column_ == columns_ ? row_ + 1 : row_;
                    newColumn = column_ == columns_ ? 0 : column_;
                }
                if (j >= before[i].cells.size()) {
                    break;
                }
                if (!before[i].cells[j].empty()) {
                    put(before[i].cells[j], j + 1 < before[i].cells.size() && before[i].cells[j + 1].empty() ? 2 : 1);
                }
            }
            if (!before[i].wrapped && i + 1 < before.size()) {
                newLine();
                column_ = 0;
            }
        }
        row_ = newRow;
        column_ = newColumn;
        rows_.resize(std::max(rows_.size(), row_ + 1));
    }

    /// All rows that there have been, without empty ones at the end and without spaces at their ends, with a mark where
    /// the cursor is.
    std::vector<std::string> lines() const {
        std::vector<std::string> lines = allLines();
        while (lines.size() > 1 && lines.back().empty()) {
            lines.pop_back();
        }
        return lines;
    }

    /// Those that the terminal still has, empty ones too.
    std::vector<std::string> visibleLines() const {
        std::vector<std::string> lines = allLines();
        lines.erase(lines.begin(), lines.begin() + static_cast<std::ptrdiff_t>(top()));
        lines.resize(height_);
        return lines;
    }

  private:
    std::vector<std::string> allLines() const {
        std::vector<std::string> lines;
        for (std::size_t i = 0; i < rows_.size(); ++i) {
            std::string line;
            std::size_t end = 0;
            for (std::size_t j = 0; j < std::max(rows_[i].cells.size(), i == row_ ? column_ + 1 : 0); ++j) {
                if (i == row_ && j == column_) {
                    line += cursor;
                    end = line.size();
                }
                if (j < rows_[i].cells.size()) {
                    line += rows_[i].cells[j];
                    end = rows_[i].cells[j] != " " ? line.size() : end;
                } else if (j < column_ && i == row_) {
                    line += ' ';
                }
            }
            line.resize(end);
            lines.push_back(line);
        }
        return lines;
    }

    struct Row {
        std::vector<std::string> cells{};  // the right half of a wide character is empty
        bool wrapped = false;
    };

    std::size_t top() const { return rows_.size() > height_ ? rows_.size() - height_ : 0; }

    // Bytes that were used; 0 when more are needed.
    std::size_t showOne() {
        if (pending_.empty()) {
            return 0;
        }
        switch (pending_[0]) {
            case '\r':
                column_ = 0;
                return 1;
            case '\n':
                newLine();
                return 1;
            case '\b':
                column_ = column_ > 0 ? std::min(column_, columns_) - 1 : 0;
                return 1;
            case '\a':
                return 1;
            case '\t':
                column_ = std::min(columns_ - 1, (column_ / 8 + 1) * 8);
                return 1;
            case '\x1b':
                return showSequence();
            default:
                break;
        }
        std::mbstate_t state{};
        wchar_t c = L'\0';
        const std::size_t length = std::mbrtowc(&c, pending_.data(), pending_.size(), &state);
        if (length == static_cast<std::size_t>(-2)) {
            return 0;
        }
        if (length > pending_.size()) {
            put("\uFFFD", 1);
            return 1;
        }
        put(pending_.substr(0, length), ::wcwidth(c));
        return std::max<std::size_t>(length, 1);
    }

    std::size_t showSequence() {
        // Strings, such as pictures, up to their end.
        if (pending_.size() > 1 && pending_[1] == 'P') {
            const std::size_t stringEnd = pending_.find("\x1b\\", 2);
            return stringEnd == std::string::npos ? 0 : stringEnd + 2;
        }
        if (pending_.size() > 1 && (pending_[1] == '_' || pending_[1] == ']')) {
            const std::size_t stringEnd = pending_.find('\\');
            const std::size_t bell = pending_[1] == ']' ? pending_.find('\a') : std::string::npos;
            const std::size_t last = std::min(stringEnd, bell);
            return last == std::string::npos ? 0 : last + 1;
        }
        const std::size_t end = pending_.find_first_of("ABCDGHJKclhmn", 2);
        if (end == std::string::npos) {
            return 0;
        }
        const std::string argument = pending_.substr(2, end - 2);
        const std::size_t number = argument.empty() || argument[0] == '?' ? 0 : std::stoul(argument);
        const std::size_t distance = std::max<std::size_t>(number, 1);
        column_ = std::min(column_, pending_[end] == 'm' ? column_ : columns_ - 1);
        switch (pending_[end]) {
            case 'A':
                row_ = std::max(top(), row_ - std::min(row_, distance));
                break;
            case 'B':
                row_ = std::min(top() + height_ - 1, row_ + distance);
                rows_.resize(std::max(rows_.size(), row_ + 1));
                break;
            case 'C':
                column_ = std::min(columns_ - 1, column_ + distance);
                break;
            case 'D':
                column_ -= std::min(column_, distance);
                break;
            case 'G':
                column_ = distance - 1;
                break;
            case 'H':
                row_ = top();
                column_ = 0;
                break;
            case 'J':
                if (number == 0) {
                    rows_.resize(row_ + 1);
                    eraseToEnd();
                } else {
                    rows_.resize(top());
                    rows_.resize(row_ + 1);
                }
                break;
            case 'K':
                eraseToEnd();
                break;
            default:
                break;
        }
        return end + 1;
    }

    void eraseToEnd() {
        Row& row = rows_[row_];
        row.cells.resize(std::min(row.cells.size(), column_));
        row.wrapped = false;
    }

    void newLine() {
        ++row_;
        rows_.resize(std::max(rows_.size(), row_ + 1));
    }

    void put(const std::string& character, int width) {
        if (width <= 0) {
            if (column_ > 0 && column_ <= rows_[row_].cells.size()) {
                std::size_t cell = column_ - 1;
                while (cell > 0 && rows_[row_].cells[cell].empty()) {
                    --cell;
                }
                rows_[row_].cells[cell] += character;
            }
            return;
        }
        const auto cells = static_cast<std::size_t>(width);
        if (column_ + cells > columns_) {
            rows_[row_].wrapped = true;
            newLine();
            column_ = 0;
        }
        Row& row = rows_[row_];
        row.cells.resize(std::max(row.cells.size(), column_ + cells), " ");
        row.cells[column_] = character;
        for (std::size_t i = 1; i < cells; ++i) {
            row.cells[column_ + i].clear();
        }
        column_ += cells;
    }

    std::size_t columns_;
    std::size_t height_;
    std::vector<Row> rows_;  // those that have scrolled away too
    std::size_t row_ = 0;
    std::size_t column_ = 0;  // columns_ when the row is full and the next character goes to the next one
    std::string pending_;
};

}  // namespace krutil_client
