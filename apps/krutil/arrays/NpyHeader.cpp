#include "krutil/arrays/NpyHeader.hpp"

#include <algorithm>
#include <array>
#include <charconv>
#include <utility>

#include "krutil/base/ExitCode.hpp"

namespace krutil_client {
namespace {

constexpr std::string_view magic("\x93NUMPY", 6);
// Magic and the two bytes of the version.
constexpr std::size_t versionEnd = 8;
// Arrays that can be read here have short headers; records with many fields have long ones.
constexpr std::size_t longestHeader = 1U << 16;
// NumPy aligns the elements in the file to this.
constexpr std::size_t alignment = 64;

[[noreturn]] void cannotRead(const std::string& name, const std::string& why) {
    throw Failure(ExitCode::Usage, "cannot read " + name + ": " + why);
}

std::string quoted(const std::string& text) {
    constexpr std::size_t longest = 60;
    return "'" + text.substr(0, longest) + (text.size() > longest ? "...'" : "'");
}

// Reads the header's text: a Python dictionary of exactly three keys, in any order.
class HeaderParser {
  public:
    HeaderParser(std::string_view text, const std::string& name) : text_(text), name_(name) {}

    NpyHeader parse() {
        NpyHeader header;
        std::array<bool, 3> seen{};
        const auto once = [&](std::size_t key, const std::string& text) {
            if (std::exchange(seen[key], true)) {
                failHere("the key '" + text + "' a second time");
            }
        };
        expect('{');
        while (!accept('}')) {
            const std::string key = parseString();
            expect(':');
            if (key == "descr") {
                once(0, key);
                header.descr = parseDescr();
            } else if (key == "fortran_order") {
                once(1, key);
                header.columnMajor = parseBool();
            } else if (key == "shape") {
                once(2, key);
                header.shape = parseShape();
            } else {
                failHere("the unknown key " + quoted(key));
            }
            if (!accept(',')) {
                expect('}');
                break;
            }
        }
        skipSpace();
        if (position_ != text_.size()) {
            failHere("more text after the dictionary");
        }
        if (!std::all_of(seen.begin(), seen.end(), [](bool value) { return value; })) {
            failHere("not all of the keys 'descr', 'fortran_order' and 'shape'");
        }
        return header;
    }

  private:
    [[noreturn]] void failHere(const std::string& what) const {
        cannotRead(name_, "its header has " + what + " at byte " + std::to_string(position_));
    }

    void skipSpace() {
        while (position_ < text_.size() && (text_[position_] == ' ' || text_[position_] == '\n')) {
            ++position_;
        }
    }

    bool accept(char c) {
        skipSpace();
        if (position_ < text_.size() && text_[position_] == c) {
            ++position_;
            return true;
        }
        return false;
    }

    void expect(char c) {
        if (!accept(c)) {
            failHere(std::string("no '") + c + "'");
        }
    }

    std::string parseString() {
        skipSpace();
        const char quote = position_ < text_.size() ? text_[position_] : '\0';
        if (quote != '\'' && quote != '"') {
            failHere("no text in quotes");
        }
        const auto end = text_.find(quote, position_ + 1);
        const auto content = text_.substr(position_ + 1, end == std::string_view::npos ? 0 : end - position_ - 1);
        if (end == std::string_view::npos || content.find('\\') != std::string_view::npos) {
            failHere("a text that does not end or has escapes");
        }
        position_ = end + 1;
        return std::string(content);
    }

    std::string parseDescr() {
        skipSpace();
        if (position_ < text_.size() && text_[position_] == '[') {
            cannotRead(name_, "its elements are records, which cannot be sent; send their fields one by one");
        }
        return parseString();
    }

    bool parseBool() {
        skipSpace();
        for (const auto& [word, value] :
             {std::pair{std::string_view("True"), true}, {std::string_view("False"), false}}) {
            if (text_.substr(position_, word.size()) == word) {
                position_ += word.size();
                return value;
            }
        }
        failHere("neither True nor False");
    }

    std::vector<std::uint64_t> parseShape() {
        std::vector<std::uint64_t> shape;
        expect('(');
        bool comma = true;
        while (!accept(')')) {
            if (!comma) {
                failHere("no ','");
            }
            skipSpace();
            std::uint64_t extent = 0;
            const auto* const begin = text_.data() + position_;
            const auto [end, error] = std::from_chars(begin, text_.data() + text_.size(), extent);
            if (error != std::errc()) {
                failHere("no extent that fits 64 bits");
            }
            shape.push_back(extent);
            position_ += static_cast<std::size_t>(end - begin);
            comma = accept(',');
        }
        if (shape.size() == 1 && !comma) {
            failHere("a number in parentheses, which is no shape,");
        }
        return shape;
    }

    std::string_view text_;
    const std::string& name_;
    std::size_t position_ = 0;
};

std::size_t littleEndian(std::string_view bytes) {
    std::size_t number = 0;
    for (std::size_t i = bytes.size(); i-- > 0;) {
        number = number << 8U | static_cast<unsigned char>(bytes[i]);
    }
    return number;
}

}  // namespace

std::string NpyHeader::quotedDescr() const {
    return quoted(descr);
}

NpyHeader readNpyHeader(std::string_view bytes, const std::string& name) {
    const auto require = [&](std::size_t end) {
        if (bytes.size() < end) {
            cannotRead(name, "it ends after " + std::to_string(bytes.size()) + " bytes, in the middle of its header");
        }
    };
    if (bytes.substr(0, magic.size()) != magic) {
        cannotRead(name, "it is no .npy file (it does not begin with \"\\x93NUMPY\")");
    }
    require(versionEnd);
    const auto major = static_cast<unsigned char>(bytes[versionEnd - 2]);
    const auto minor = static_cast<unsigned char>(bytes[versionEnd - 1]);
    if (major < 1 || major > 3 || minor != 0) {
        cannotRead(name, "it has version " + std::to_string(major) + "." + std::to_string(minor) +
                             " of the .npy format; 1.0, 2.0 and 3.0 are known here");
    }
    const std::size_t begin = versionEnd + (major == 1 ? 2 : 4);
    require(begin);
    const std::size_t length = littleEndian(bytes.substr(versionEnd, begin - versionEnd));
    require(begin + length);
    if (length > longestHeader) {
        cannotRead(name, "its header has " + std::to_string(length) + " bytes; at most " +
                             std::to_string(longestHeader) + " are expected");
    }
    NpyHeader header = HeaderParser(bytes.substr(begin, length), name).parse();
    header.end = begin + length;
    return header;
}

std::string npyHeaderText(const std::string& descr, bool columnMajor, std::span<const std::uint64_t> shape) {
    std::string text =
        "{'descr': '" + descr + "', 'fortran_order': " + (columnMajor ? "True" : "False") + ", 'shape': (";
    for (const std::uint64_t extent : shape) {
        text += std::to_string(extent) + ", ";
    }
    if (shape.size() > 1) {
        text.resize(text.size() - 2);
    } else if (!shape.empty()) {
        text.pop_back();
    }
    text += "), }";
    const std::size_t unpadded = versionEnd + 2 + text.size() + 1;
    text.append((alignment - unpadded % alignment) % alignment, ' ');
    text += '\n';
    std::string file(magic);
    file += {'\1', '\0', static_cast<char>(text.size() & 0xFFU), static_cast<char>(text.size() >> 8U)};
    return file + text;
}

}  // namespace krutil_client
