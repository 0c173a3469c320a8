// Pictures for terminals that draw sixels.
#pragma once

#include <chrono>
#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

namespace krutil_client {

/// Whether `text` is one sixel sequence and nothing else: from ESC P, numbers and q to ESC \, with printable ASCII
/// between them. A terminal does nothing else with it but draw.
bool isSixel(std::string_view text);

/// The PNG picture as a sixel sequence, `width` pixels wide, or as wide as it is without one. Made by the program
/// img2sixel on PATH, so that no engine's picture is decoded in this process: it gets the picture and nothing else of
/// this process, and is bounded in memory, time and output. Empty where it is missing, fails, takes longer than
/// `patience`, or prints anything but one sequence.
std::optional<std::string> sixelOf(const std::string& png, std::optional<std::size_t> width,
                                   std::chrono::milliseconds patience = std::chrono::seconds(5));

}  // namespace krutil_client
