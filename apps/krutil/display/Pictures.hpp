// Pictures that running code shows.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "foundation/korveldata/Array.hpp"

namespace krutil_client {

/// Whether a text of the engine's announces a picture: a line of its own such as
///
///     [picture 1: image/png, text/html, 640 x 480]
bool pictureLine(std::u16string_view text);

/// Whether that line is of any use to a person who has the value's text: pages are not.
bool announcesImage(std::u16string_view line);

/// One form of a picture.
struct PictureForm {
    enum class Type { Png, Svg, Html };
    Type type;
    std::string content;
};

struct Picture {
    std::uint64_t number;
    std::vector<PictureForm> forms;
};

/// "image/png", "image/svg+xml" or "text/html".
std::string_view typeName(PictureForm::Type type) noexcept;

/// Width and height that a PNG file states.
struct PixelSize {
    std::uint32_t width;
    std::uint32_t height;
};
PixelSize sizeOfPng(const std::string& content);

/// The pictures that the outputs of qvm.take_displays() hold; forms of other types are left out. Throws
/// std::runtime_error, with what was wrong, for outputs that are none of such a call.
std::vector<Picture> picturesOf(const std::vector<foundation::korveldata::Array>& outputs);

/// Writes a form to a new file in the directory for temporary files, for this user alone, and returns its path. Throws
/// std::runtime_error, with the reason, when that cannot be.
std::string writePicture(const PictureForm& form);

}  // namespace krutil_client
