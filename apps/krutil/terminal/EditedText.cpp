#include "krutil/terminal/EditedText.hpp"

#include <algorithm>

namespace krutil_client {

std::wstring EditedText::text() const {
    const LineInfoW* const line = ::el_wline(editor_);
    return {line->buffer, line->lastchar};
}

std::size_t EditedText::cursor() const noexcept {
    const LineInfoW* const line = ::el_wline(editor_);
    return static_cast<std::size_t>(line->cursor - line->buffer);
}

void EditedText::moveTo(std::size_t position) {
    ::el_cursor(editor_, static_cast<int>(position) - static_cast<int>(cursor()));
}

bool EditedText::replace(std::size_t begin, std::size_t end, const std::wstring& text) {
    moveTo(end);
    ::el_wdeletestr(editor_, static_cast<int>(end - begin));
    return text.empty() || ::el_winsertstr(editor_, text.c_str()) == 0;
}

std::size_t EditedText::lineBegin() const {
    const std::wstring all = text();
    const std::size_t at = cursor();
    return at == 0 ? 0 : all.rfind(L'\n', at - 1) + 1;
}

std::size_t EditedText::lineEnd() const {
    const std::wstring all = text();
    return std::min(all.find(L'\n', cursor()), all.size());
}

bool EditedText::moveUp() {
    const std::size_t begin = lineBegin();
    if (begin == 0) {
        return false;
    }
    const std::size_t column = cursor() - begin;
    moveTo(begin - 1);
    moveTo(std::min(lineBegin() + column, begin - 1));
    return true;
}

bool EditedText::moveDown() {
    const std::size_t end = lineEnd();
    if (end == text().size()) {
        return false;
    }
    const std::size_t column = cursor() - lineBegin();
    moveTo(end + 1);
    moveTo(std::min(end + 1 + column, lineEnd()));
    return true;
}

bool EditedText::inIndentation() const {
    const std::size_t begin = lineBegin();
    return text().substr(begin, cursor() - begin).find_first_not_of(L" \t") == std::wstring::npos;
}

bool EditedText::indent() {
    const std::size_t column = cursor() - lineBegin();
    return insert(std::wstring(indentation - (inIndentation() ? column % indentation : 0), L' '));
}

void EditedText::eraseBack() {
    const std::size_t at = cursor();
    if (at == 0) {
        return;
    }
    const std::size_t column = at - lineBegin();
    const bool blanks = column > 0 && inIndentation() && text().find(L'\t', at - column) >= at;
    replace(at - (blanks ? (column - 1) % indentation + 1 : 1), at, {});
}

void EditedText::eraseToLineBegin() {
    if (cursor() > 0) {
        eraseAlong(cursor() == lineBegin() ? L"\x02" : L"\x01");
    }
}

void EditedText::eraseToLineEnd() {
    if (cursor() < text().size()) {
        eraseAlong(cursor() == lineEnd() ? L"\x06" : L"\x05");
    }
}

// From here to where the key `move` leads.
void EditedText::eraseAlong(const wchar_t* move) {
    ::el_wpush(editor_, (std::wstring(markKey) + move + eraseToMarkKey).c_str());
}

}  // namespace krutil_client
