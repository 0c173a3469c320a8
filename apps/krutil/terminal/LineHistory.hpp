// What a person has typed, kept in a file.
#pragma once

#include <histedit.h>

#include <cstddef>
#include <optional>
#include <string>

namespace krutil_client {

/// A history for the line editor. An entry is a line, or all lines of a block. Each is appended to its file at once, so
/// that programs that run at the same time lose none of each other's; what others add is read with the next start. A
/// file that cannot be read or written is none. The file is for its owner only, and is cut to size when an object is
/// made. LC_CTYPE must be one of UTF-8. Main thread only.
class LineHistory {
  public:
    /// How many entries are remembered, and left in the file.
    static constexpr int lines = 1000;

    /// `file` is created with its directory when there is a line to keep; empty for none.
    explicit LineHistory(std::string file);
    ~LineHistory();
    LineHistory(const LineHistory&) = delete;
    LineHistory& operator=(const LineHistory&) = delete;

    /// A sentence when there is a file, and it is not read or written because it may be another user's; otherwise
    /// empty.
    const std::string& refusal() const noexcept { return refusal_; }

    /// What the editor takes its lines from.
    HistoryW* get() const noexcept { return history_; }

    /// Remembers an entry, which may end in a newline.
    void add(const wchar_t* line);

    struct Found {
        std::size_t age;    ///< how many entries are younger
        std::wstring text;  ///< without the newline at its end
    };

    /// The youngest entry that has `part` and is not younger than `age`.
    std::optional<Found> find(const std::wstring& part, std::size_t age) const;

  private:
    const std::string file_;
    std::string refusal_;
    HistoryW* const history_;
};

/// Where the history of this user's lines is kept: below $XDG_STATE_HOME, or ~/.local/state; empty when neither is
/// known.
std::string defaultHistoryFile();

}  // namespace krutil_client
