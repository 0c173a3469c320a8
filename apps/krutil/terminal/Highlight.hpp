// Colours for Python that a person types.
#pragma once

#include <cstddef>
#include <string>
#include <vector>

namespace krutil_client {

/// How a character is shown.
enum class Style : unsigned char { Plain, Keyword, Literal, Number, Comment, Match };

/// The style of each character of `code`. A bracket before or at `cursor` and its counterpart are a Match; `cursor` is
/// past the end of the code for none. An estimate: what is a keyword is told by its name.
std::vector<Style> stylesOf(const std::wstring& code, std::size_t cursor);

}  // namespace krutil_client
