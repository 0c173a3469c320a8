// Lines of Python that a person has typed or pasted: where code is complete, and where statements begin.
#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace krutil_client {

/// Whether `code`, one or more lines without the newline of the last one, goes on in a line still to be typed: a
/// bracket or a string of several lines is open, a line ends in a backslash, or a block has begun (a line that ends in
/// a colon, or a decorator) and no empty line has ended it. An estimate for Python's grammar; what is wrong is for the
/// engine to say.
bool needsMoreLines(std::string_view code);

/// Whether `code` may be evaluated as it is: the last of its statements needs no more lines. So may one line
/// that is no code, because it begins with a colon, a question mark or an exclamation mark.
bool isWhole(std::string_view code);

/// The blanks that a line behind `code` begins with: one step more than the last line when that begins a block or opens
/// a bracket, one step less when it leaves a block. A statement of several lines is as deep as its first one. None in a
/// string.
std::string indentationAfter(std::string_view code);

/// The statements of `code`, each with all its lines; comments and empty lines between them belong to the one before. A
/// line that begins with a colon, where a statement may begin, is a piece of its own. The last piece keeps the empty
/// lines at its end. None for code without any. As much an estimate as needsMoreLines().
std::vector<std::string> piecesOf(std::string_view code);

}  // namespace krutil_client
