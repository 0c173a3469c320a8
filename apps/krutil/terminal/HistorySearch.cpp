#include "krutil/terminal/HistorySearch.hpp"

namespace krutil_client {

bool HistorySearch::take(wchar_t key) {
    constexpr wchar_t again = L'\x12';
    constexpr wchar_t backspace = L'\b';
    constexpr wchar_t erase = L'\x7f';
    if (key == again) {
        age_ += found_ && !part_.empty() ? 1 : 0;
    } else if (key == backspace || key == erase) {
        part_.resize(part_.empty() ? 0 : part_.size() - 1);
        age_ = 0;
    } else if (key < L' ') {
        return false;
    } else {
        part_ += key;
    }
    look();
    return true;
}

void HistorySearch::look() {
    if (part_.empty()) {
        found_ = true;
        return;
    }
    const auto entry = history_.find(part_, age_);
    found_ = entry.has_value();
    if (entry) {
        age_ = entry->age;
        text_ = entry->text;
        place_ = text_.find(part_);
    }
}

}  // namespace krutil_client
