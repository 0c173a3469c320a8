#include "krutil/terminal/PythonInput.hpp"

#include <algorithm>
#include <cstddef>

namespace krutil_client {
namespace {

constexpr std::string_view space = " \t\r\f";

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

  private:
    void passCharacter(char c) {
        ++at_;
        if (c == '(' || c == '[' || c == '{') {
            ++depth_;
        } else if (c == ')' || c == ']' || c == '}') {
            depth_ = std::max(depth_ - 1, 0);
        } else if (c == '\n' && depth_ == 0) {
            endLine();
            return;
        } else if (c == '@' && last_ == '\0') {
            block_ = true;
        }
        if (c != '\n' && space.find(c) == std::string_view::npos) {
            last_ = c;
        }
    }

    void endLine() {
        block_ = block_ || (depth_ == 0 && last_ == ':');
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
    char last_ = '\0';  // the last character of the line that counts
    bool block_ = false;
};

}  // namespace

bool needsMoreLines(std::string_view code) {
    Scanner scanner(code);
    if (scanner.openAtEnd()) {
        return true;
    }
    const auto newline = code.rfind('\n');
    const std::string_view lastLine = newline == std::string_view::npos ? code : code.substr(newline + 1);
    return scanner.block() &&
           (newline == std::string_view::npos || lastLine.find_first_not_of(space) != std::string_view::npos);
}

}  // namespace krutil_client
