#include "krutil/terminal/Completion.hpp"

#include <algorithm>
#include <cwchar>

#include "krutil/base/Text.hpp"

namespace krutil_client {
namespace {

constexpr std::size_t longestTable = 200;
constexpr std::size_t gap = 2;

std::wstring shownName(std::wstring name) {
    std::replace_if(
        name.begin(), name.end(),
        [](wchar_t c) { return ::wcwidth(c) < 0 || steersTerminal(static_cast<char32_t>(c)); }, L'?');
    return name;
}

std::size_t columnsOf(const std::wstring& name) {
    return static_cast<std::size_t>(std::max(::wcswidth(name.c_str(), name.size()), 0));
}

}  // namespace

std::wstring commonBeginning(const std::vector<std::wstring>& candidates) {
    if (candidates.empty()) {
        return {};
    }
    std::wstring common = candidates.front();
    for (const std::wstring& each : candidates) {
        const auto differs = std::mismatch(common.begin(), common.end(), each.begin(), each.end());
        common.erase(differs.first, common.end());
    }
    return common;
}

std::wstring tableOf(const std::vector<std::wstring>& candidates, std::size_t width) {
    const std::size_t count = std::min(candidates.size(), longestTable);
    std::vector<std::wstring> names(count);
    std::transform(candidates.begin(), candidates.begin() + static_cast<std::ptrdiff_t>(count), names.begin(),
                   shownName);
    std::size_t widest = 0;
    for (const std::wstring& name : names) {
        widest = std::max(widest, columnsOf(name));
    }
    const std::size_t columns = std::max<std::size_t>((width + gap) / (widest + gap), 1);
    const std::size_t rows = (count + columns - 1) / columns;
    std::wstring table;
    for (std::size_t row = 0; row < rows; ++row) {
        // Down the columns, as a person reads a list.
        for (std::size_t i = row; i < count; i += rows) {
            table += names[i];
            if (i + rows < count) {
                table.append(widest + gap - columnsOf(names[i]), L' ');
            }
        }
        table += L'\n';
    }
    if (count < candidates.size()) {
        table += L"and " + std::to_wstring(candidates.size() - count) + L" more\n";
    }
    return table;
}

}  // namespace krutil_client
