// Pictures on terminals that can draw them.
#pragma once

#include <chrono>
#include <cstddef>
#include <optional>
#include <string>

#include "krutil/base/Output.hpp"

namespace krutil_client {

/// What a terminal understands.
enum class ImageProtocol {
    None,
    Kitty,   ///< kitty's graphics protocol
    ITerm2,  ///< iTerm2's inline images
    Sixel,   ///< DEC's sixels
};

/// What came of asking a terminal.
struct AskedTerminal {
    ImageProtocol protocol = ImageProtocol::None;
    std::string typed{};  ///< read meanwhile, and no answer: a person has typed it
};

/// Asks the terminal `out`, which is standard input too, what it understands, and waits for its answer no longer than
/// `patience`. Nobody else may read there meanwhile. Nothing is asked, and nothing returned, when a person has typed
/// already, because that would be read with the answer, and when the program is not in the foreground.
std::optional<AskedTerminal> askTerminal(Output& out, std::chrono::milliseconds patience);

/// What to write to `out` for a PNG picture to be drawn where the cursor is. It ends at the beginning of a line. One of
/// more pixels than the terminal has in a row, where that is known, is made to fit. Empty when the terminal cannot draw
/// it, or nothing can make the sixels that it needs.
std::optional<std::string> drawing(ImageProtocol protocol, const std::string& png, std::size_t width,
                                   const Output& out);

}  // namespace krutil_client
