#include "krutil/display/Pictures.hpp"

#include <fcntl.h>
#include <stdlib.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <nlohmann/json.hpp>
#include <optional>
#include <stdexcept>
#include <utility>

#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "foundation/core/posix/writeFully.hpp"
#include "krutil/arrays/ArrayText.hpp"
#include "msg_svc/protobuf/ustring.hpp"

namespace krutil_client {
namespace {

using foundation::korveldata::Array;
using foundation::korveldata::ElementType;

struct FormType {
    PictureForm::Type type;
    std::string_view name;
    std::string_view suffix;
};

constexpr std::array formTypes{FormType{PictureForm::Type::Png, "image/png", ".png"},
                               FormType{PictureForm::Type::Svg, "image/svg+xml", ".svg"},
                               FormType{PictureForm::Type::Html, "text/html", ".html"}};

const FormType& rowOf(PictureForm::Type type) {
    return *std::find_if(formTypes.begin(), formTypes.end(),
                         [type](const FormType& each) { return each.type == type; });
}

// Each may become a file. Engines keep fewer.
constexpr std::size_t mostPictures = 1'000;

// A PNG file begins with these, followed by its width and height as four bytes each.
constexpr std::string_view pngBegin{"\x89PNG\r\n\x1a\n\0\0\0\rIHDR", 16};
constexpr std::size_t pngHeader = pngBegin.size() + 8;

std::uint32_t bigEndian(const std::string& content, std::size_t at) {
    std::uint32_t number = 0;
    for (std::size_t i = at; i < at + 4; ++i) {
        number = number << 8 | static_cast<unsigned char>(content[i]);
    }
    return number;
}

// Takes the bytes of the pictures one after another.
class PictureBytes {
  public:
    explicit PictureBytes(std::string_view bytes) : rest_(bytes) {}

    std::string take(std::uint64_t size) {
        if (size > rest_.size()) {
            throw std::runtime_error("expected " + std::to_string(size) + " bytes of a picture, got " +
                                     std::to_string(rest_.size()));
        }
        std::string content(rest_.substr(0, size));
        rest_.remove_prefix(size);
        if (size < pngHeader || !content.starts_with(pngBegin)) {
            throw std::runtime_error("expected a PNG picture, got other bytes");
        }
        return content;
    }

  private:
    std::string_view rest_;
};

std::optional<PictureForm> formOf(const nlohmann::json& described, PictureBytes& bytes) {
    const auto name = described.at("type").get<std::string>();
    const auto* const row =
        std::find_if(formTypes.begin(), formTypes.end(), [&name](const FormType& each) { return each.name == name; });
    if (row == formTypes.end()) {
        return std::nullopt;
    }
    return PictureForm{row->type, row->type == PictureForm::Type::Png
                                      ? bytes.take(described.at("bytes").get<std::uint64_t>())
                                      : described.at("text").get<std::string>()};
}

bool isBytes(const Array& array) {
    return array.elementType() == ElementType::UInt8 || array.numberOfElements() == 0;
}

}  // namespace

bool pictureLine(std::u16string_view text) {
    constexpr std::u16string_view begin = u"[picture ";
    constexpr std::u16string_view end = u"]\n";
    return text.starts_with(begin) && text.ends_with(end) && text.find(u'\n') == text.size() - 1;
}

bool announcesImage(std::u16string_view line) {
    return line.find(u": image/") != std::u16string_view::npos;
}

std::string_view typeName(PictureForm::Type type) noexcept {
    return rowOf(type).name;
}

PixelSize sizeOfPng(const std::string& content) {
    return {bigEndian(content, pngBegin.size()), bigEndian(content, pngBegin.size() + 4)};
}

std::vector<Picture> picturesOf(const std::vector<Array>& outputs) {
    if (outputs.size() != 2 || !isText(outputs[0]) || !isBytes(outputs[1])) {
        throw std::runtime_error("expected a text and an array of bytes");
    }
    std::vector<Picture> pictures;
    try {
        PictureBytes bytes({outputs[1].data(), outputs[1].sizeInBytes()});
        for (const auto& described : nlohmann::json::parse(msg_svc::protobuf::ustring_to_utf8(outputs[0].toText()))) {
            Picture picture{described.at("number").get<std::uint64_t>(), {}};
            for (const auto& form : described.at("formats")) {
                if (auto known = formOf(form, bytes)) {
                    picture.forms.push_back(std::move(*known));
                }
            }
            pictures.push_back(std::move(picture));
            if (pictures.size() > mostPictures) {
                throw std::runtime_error("expected at most " + std::to_string(mostPictures) + ", got more");
            }
        }
    } catch (const nlohmann::json::exception& error) {
        throw std::runtime_error(std::string("their description cannot be read: ") + error.what());
    }
    return pictures;
}

std::string writePicture(const PictureForm& form) {
    const std::string suffix(rowOf(form.type).suffix);
    std::string path = (std::filesystem::temp_directory_path() / ("krutil-picture-XXXXXX" + suffix)).string();
    const foundation::core::posix::OwnedDescriptor file(
        ::mkostemps(path.data(), static_cast<int>(suffix.size()), O_CLOEXEC));
    if (!file) {
        throw std::runtime_error("cannot make " + path + ": " + std::strerror(errno));
    }
    if (!foundation::core::posix::writeFully(file.get(), form.content)) {
        const std::string reason = std::strerror(errno);
        ::unlink(path.c_str());
        throw std::runtime_error("cannot write " + path + ": " + reason);
    }
    return path;
}

}  // namespace krutil_client
