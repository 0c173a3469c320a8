// When the lines that a person has typed are worth evaluating.
#pragma once

#include <string_view>

namespace krutil_client {

/// Whether `code`, one or more lines without the newline of the last one, goes on in a line still to be typed: a
/// bracket or a string of several lines is open, a line ends in a backslash, or a block has begun (a line that ends in
/// a colon, or a decorator) and no empty line has ended it. An estimate for Python's grammar; what is wrong is for the
/// engine to say.
bool needsMoreLines(std::string_view code);

}  // namespace krutil_client
