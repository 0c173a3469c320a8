#include "krutil/terminal/PythonInput.hpp"

#include <algorithm>
#include <array>
#include <cstddef>

namespace krutil_client {
namespace {

constexpr std::string_view space = " \t\r\f";
constexpr std::string_view blank = " \t\r\f\n";

// Goes through code as Python's tokenizer does, as far as lines matter.
class Scanner {
  public:
    explicit Scanner(std::string_view code) : code_(code) {}

    bool openAtEnd() {
        while (at_ < code_.size()) {
            const char c = code_[at_];
            if (c == '#') {
                at_ = std::min(code_.find('\n', at_), code_.size());
            } else if (c == '"' || c == '\'') {
                if (!passString(c)) {
                    inString_ = true;
                    return true;
                }
                last_ = c;
            } else if (c == '\\') {
                if (at_ + 1 == code_.size()) {
                    return true;
                }
                at_ += 2;
            } else {
                passCharacter(c);
            }
        }
        endLine();
        return depth_ > 0;
    }

    bool block() const { return block_; }

    // Whether the code ends in a string that goes on.
    bool inString() const { return inString_; }

    // Whether the code ends in a line that goes on deeper: it opens a block or a bracket.
    bool deeper() const {
        return ending_ == '(' || ending_ == '[' || ending_ == '{' || (depth_ == 0 && ending_ == ':');
    }

    // Where a line begins that goes on with none before it: outside of brackets and strings.
    struct Start {
        std::size_t at;
        bool inHead;  // the line before begins a block, or decorates what comes
    };
    const std::vector<Start>& starts() const { return starts_; }

  private:
    void passCharacter(char c) {
        ++at_;
        if (c == '(' || c == '[' || c == '{') {
            ++depth_;
        } else if (c == ')' || c == ']' || c == '}') {
            depth_ = std::max(depth_ - 1, 0);
        } else if (c == '\n' && depth_ == 0) {
            endLine();
            starts_.push_back({at_, inHead_});
            return;
        } else if (c == '@' && last_ == '\0') {
            decorator_ = true;
        }
        if (c != '\n' && space.find(c) == std::string_view::npos) {
            last_ = c;
        }
    }

    void endLine() {
        if (last_ != '\0') {
            inHead_ = decorator_ || (depth_ == 0 && last_ == ':');
            block_ = block_ || inHead_;
        }
        decorator_ = false;
        ending_ = last_;
        last_ = '\0';
    }

    // Returns whether the string ends, or is one that cannot go on in another line.
    bool passString(char quote) {
        const std::string_view ends = quote == '"' ? "\"\"\"" : "'''";
        const bool triple = code_.substr(at_, 3) == ends;
        at_ += triple ? 3 : 1;
        while (at_ < code_.size()) {
            const char c = code_[at_];
            if (c == '\\') {
                if (at_ + 1 >= code_.size()) {
                    return false;
                }
                at_ += 2;
            } else if (triple && code_.substr(at_, 3) == ends) {
                at_ += 3;
                return true;
            } else if (!triple && (c == quote || c == '\n')) {
                // A newline is an error, and left for the line's end.
                at_ += c == quote ? 1 : 0;
                return true;
            } else {
                ++at_;
            }
        }
        return !triple;
    }

    std::string_view code_;
    std::size_t at_ = 0;
    int depth_ = 0;
    char last_ = '\0';    // the last character of the line that counts
    char ending_ = '\0';  // the same of the line that ended last
    bool block_ = false;
    bool inString_ = false;
    bool decorator_ = false;  // the line is one
    bool inHead_ = false;     // the last line that counts begins a block, or decorates what comes
    std::vector<Start> starts_;
};

// The first line of `text`.
std::string_view lineOf(std::string_view text) {
    return text.substr(0, text.find('\n'));
}

// Whether a line has more than a comment.
bool hasCode(std::string_view line) {
    const auto first = line.find_first_not_of(blank);
    return first != std::string_view::npos && line[first] != '#';
}

std::string_view lastLineOf(std::string_view text) {
    return text.substr(text.rfind('\n') + 1);
}

// The word that a line begins with, if it is one of small letters.
std::string_view wordOf(std::string_view line) {
    return line.substr(0, line.find_first_not_of("abcdefghijklmnopqrstuvwxyz"));
}

// Whether a line, outside of brackets, strings and blocks' heads, begins a statement instead of going on with one.
bool beginsStatement(std::string_view line) {
    if (line.empty() || line[0] == '#' || space.find(line[0]) != std::string_view::npos) {
        return false;
    }
    constexpr std::array<std::string_view, 4> goOn{"else", "elif", "except", "finally"};
    return std::find(goOn.begin(), goOn.end(), wordOf(line)) == goOn.end();
}

}  // namespace

bool needsMoreLines(std::string_view code) {
    Scanner scanner(code);
    if (scanner.openAtEnd()) {
        return true;
    }
    const std::string_view lastLine = lastLineOf(code);
    return scanner.block() &&
           (lastLine.size() == code.size() || lastLine.find_first_not_of(space) != std::string_view::npos);
}

bool isWhole(std::string_view code) {
    constexpr std::string_view noCode = ":?!";
    if (!code.empty() && noCode.find(code[0]) != std::string_view::npos && lastLineOf(code).size() == code.size()) {
        return true;
    }
    const auto pieces = piecesOf(code);
    return pieces.empty() || !needsMoreLines(pieces.back());
}

std::string indentationAfter(std::string_view code) {
    constexpr std::string_view step = "    ";
    constexpr std::array<std::string_view, 5> leave{"return", "pass", "raise", "break", "continue"};
    Scanner scanner(code);
    const bool open = scanner.openAtEnd();
    if (scanner.inString()) {
        return {};
    }
    // What goes on over several lines is as deep as the first of them.
    const auto& starts = scanner.starts();
    const std::string_view line = open ? lastLineOf(code) : lineOf(code.substr(starts.empty() ? 0 : starts.back().at));
    std::string blanks(line.substr(0, std::min(line.find_first_not_of(" \t"), line.size())));
    if (scanner.deeper()) {
        return blanks += step;
    }
    const bool leaves =
        !open && std::find(leave.begin(), leave.end(), wordOf(line.substr(blanks.size()))) != leave.end();
    if (leaves && blanks.ends_with(step)) {
        blanks.resize(blanks.size() - step.size());
    }
    return blanks;
}

std::vector<std::string> piecesOf(std::string_view code) {
    Scanner scanner(code);
    scanner.openAtEnd();
    std::vector<std::string> pieces;
    std::size_t begin = 0;
    bool begun = hasCode(lineOf(code));
    for (const auto& start : scanner.starts()) {
        const std::string_view line = lineOf(code.substr(start.at));
        const bool afterCommand = begun && code[begin] == ':';
        if (begun && !afterCommand && (start.inHead || !beginsStatement(line))) {
            continue;
        }
        if (begun) {
            const std::string_view piece = code.substr(begin, start.at - begin);
            pieces.emplace_back(piece.substr(0, piece.find_last_not_of(blank) + 1));
        }
        begin = start.at;
        begun = hasCode(line);
    }
    if (begun) {
        pieces.emplace_back(code.substr(begin));
    }
    return pieces;
}

}  // namespace krutil_client
