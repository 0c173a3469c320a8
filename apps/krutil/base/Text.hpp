// Conversions of text for display.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "krutil/cmddistributor/inExecutionStatus.hpp"
#include "krutil/io/StreamTypeEnum.hpp"

namespace krutil_client {

/// Offset in bytes of the first byte of `text` that is not part of valid UTF-8; empty when all of it is.
std::optional<std::size_t> firstInvalidUtf8(const std::string& text);

/// Text between UTF-8 and characters of the C library, whose LC_CTYPE must be one of UTF-8. What is ill-formed becomes
/// U+FFFD.
std::string toUtf8(std::wstring_view text);
std::wstring toWide(std::string_view text);

/// What a list of requests calls a piece of code: the beginning of its first line.
std::string nameOfCode(const std::string& code);

/// "output", "error" or "generic".
std::string_view streamName(krutil::io::StreamTypeEnum stream);

/// "success", "compile error", "runtime error", "debugger quit", "cancelled" or "communication error".
std::string_view statusName(krutil::cmddistributor::inExecutionStatus status);

/// Whether a terminal does not show the character where it stands, but acts on it or moves what is beside it: control
/// characters, separators of lines and paragraphs, controls of direction.
bool steersTerminal(char32_t character);

/// How an escape is written: for a person, "\x1b" and "\u202e", or as JSON has it, "\u001b".
enum class Escapes { Short, Json };

/// UTF-8 with such characters, but newline and tab, as escapes. What is not UTF-8 is U+FFFD.
std::string safeText(const std::string& text, Escapes escapes = Escapes::Short);

/// Text of a peer between double quotes, at most `longest` UTF-16 units of it and then "...". What could steer a
/// terminal or change how a line reads (steersTerminal(), quotes, backslashes) is written as an escape; what is not
/// UTF-8 is U+FFFD.
std::string quotedText(std::string_view text, std::size_t longest);

/// A line number, which peers state as a floating-point number: without a fraction where it has none.
std::string lineText(double line);

}  // namespace krutil_client
