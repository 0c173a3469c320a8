// What the key Tab makes of half a name.
#pragma once

#include <cstddef>
#include <functional>
#include <optional>
#include <string>
#include <vector>

namespace krutil_client {

/// How a text may go on: each candidate stands for the characters from `start` to `end`.
struct Completions {
    std::size_t start = 0;
    std::size_t end = 0;
    std::vector<std::wstring> candidates{};
};

/// Finds out how `text` may go on at `cursor`, both counted in characters; `start` and `end` lie in the text. Returns
/// nothing when nobody knows.
using Complete = std::function<std::optional<Completions>(const std::wstring& text, std::size_t cursor)>;

/// The beginning that all of these have.
std::wstring commonBeginning(const std::vector<std::wstring>& candidates);

/// The candidates in columns, for a terminal of that width, with a newline at the end. Of very many the first ones, and
/// how many more there are. Control characters are shown as question marks.
std::wstring tableOf(const std::vector<std::wstring>& candidates, std::size_t width);

}  // namespace krutil_client
