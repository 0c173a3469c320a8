// What stands in the last line of a terminal.
#pragma once

#include <algorithm>
#include <cstddef>
#include <string>
#include <string_view>
#include <utility>

namespace krutil_client {

/// Text that has been written to a terminal since its last newline, by whoever writes there. A value; main thread only.
class LastLine {
  public:
    /// More than this is not kept, nor ever less of a line than its beginning.
    static constexpr std::size_t longest = 4096;

    /// `text` has been written.
    void add(std::string_view text) {
        if (const auto newline = text.rfind('\n'); newline != std::string_view::npos) {
            text_.clear();
            text.remove_prefix(newline + 1);
        }
        whole_ = text_.empty() ? text.size() <= longest : whole_ && text.size() <= longest - text_.size();
        text_.append(text.substr(0, longest - text_.size()));
    }

    const std::string& text() const noexcept { return text_; }

    /// Whether text() is all of the line.
    bool whole() const noexcept { return whole_; }

    /// Forgets the line, and returns it.
    std::string take() {
        whole_ = true;
        return std::exchange(text_, {});
    }

  private:
    std::string text_;
    bool whole_ = true;
};

}  // namespace krutil_client
