// The search of the history for a part of an entry.
#pragma once

#include <cstddef>
#include <string>

#include "krutil/terminal/LineHistory.hpp"

namespace krutil_client {

/// What a person types behind Ctrl-R, and what is found. Another Ctrl-R goes on to an older entry, and what is typed or
/// erased changes the part that is looked for. Main thread only.
class HistorySearch {
  public:
    /// `before` is the text that is shown until something is found. `history` must outlive the object.
    HistorySearch(const LineHistory& history, std::wstring before)
        : history_(history), before_(std::move(before)), text_(before_) {}

    /// Takes a key. False for one that is none of the search and ends it.
    bool take(wchar_t key);

    /// What was found last, and the place in it.
    const std::wstring& text() const noexcept { return text_; }
    std::size_t place() const noexcept { return place_; }

    const std::wstring& before() const noexcept { return before_; }

    /// What is looked for, and whether it was found.
    std::wstring prompt() const { return (found_ ? L"search: " : L"not found: ") + part_ + L" >>> "; }

  private:
    void look();

    const LineHistory& history_;
    const std::wstring before_;
    std::wstring part_;
    std::wstring text_;
    std::size_t place_ = 0;
    std::size_t age_ = 0;
    bool found_ = true;
};

}  // namespace krutil_client
