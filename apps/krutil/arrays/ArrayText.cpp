#include "krutil/arrays/ArrayText.hpp"

#include <algorithm>
#include <array>
#include <charconv>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <type_traits>
#include <utility>

#include "msg_svc/protobuf/ustring.hpp"

namespace krutil_client {
namespace {

using foundation::korveldata::Array;
using foundation::korveldata::ElementType;
using foundation::korveldata::MemoryOrder;

constexpr std::size_t columns = 80;
constexpr std::uint64_t edge = 3;
// From here on even two of each dimension are too many.
constexpr std::size_t mostSummarised = 10;

enum class Digits { All, Eight };

template <class T>
std::string numberText(T value, Digits digits) {
    std::array<char, 32> text{};
    if constexpr (std::is_floating_point_v<T>) {
        if (std::isnan(value)) {
            return "nan";
        }
        if (digits == Digits::Eight) {
            std::snprintf(text.data(), text.size(), "%.8g", static_cast<double>(value));
            return text.data();
        }
    }
    const auto end = std::to_chars(text.data(), text.data() + text.size(), value).ptr;
    return std::string(text.data(), end);
}

template <class T>
T valueAt(const char* bytes) {
    T value;
    std::memcpy(&value, bytes, sizeof value);
    return value;
}

template <class T>
std::string realAt(const char* bytes, Digits digits) {
    return numberText(valueAt<T>(bytes), digits);
}

template <class T>
std::string complexAt(const char* bytes, Digits digits) {
    const std::string imaginary = realAt<T>(bytes + sizeof(T), digits);
    return realAt<T>(bytes, digits) + (imaginary.front() == '-' ? "" : "+") + imaginary + "j";
}

std::string characterText(char16_t unit) {
    switch (unit) {
        case u'\n':
            return "'\\n'";
        case u'\t':
            return "'\\t'";
        case u'\'':
            return "'\\''";
        case u'\\':
            return "'\\\\'";
        default:
            break;
    }
    if (unit < u' ') {
        std::array<char, 8> text{};
        std::snprintf(text.data(), text.size(), "'\\x%02x'", static_cast<unsigned>(unit));
        return text.data();
    }
    return "'" + msg_svc::protobuf::ustring_to_utf8(std::u16string(1, unit)) + "'";
}

std::string elementText(ElementType type, const char* bytes, Digits digits) {
    switch (type) {
        case ElementType::Bool:
            return *bytes != 0 ? "true" : "false";
        case ElementType::Char16:
            return characterText(valueAt<char16_t>(bytes));
        case ElementType::Single:
            return realAt<float>(bytes, digits);
        case ElementType::Double:
            return realAt<double>(bytes, digits);
        case ElementType::Int8:
            return realAt<std::int8_t>(bytes, digits);
        case ElementType::UInt8:
            return realAt<std::uint8_t>(bytes, digits);
        case ElementType::Int16:
            return realAt<std::int16_t>(bytes, digits);
        case ElementType::UInt16:
            return realAt<std::uint16_t>(bytes, digits);
        case ElementType::Int32:
            return realAt<std::int32_t>(bytes, digits);
        case ElementType::UInt32:
            return realAt<std::uint32_t>(bytes, digits);
        case ElementType::Int64:
            return realAt<std::int64_t>(bytes, digits);
        case ElementType::UInt64:
            return realAt<std::uint64_t>(bytes, digits);
        case ElementType::ComplexSingle:
            return complexAt<float>(bytes, digits);
        case ElementType::ComplexDouble:
            return complexAt<double>(bytes, digits);
        case ElementType::ComplexInt8:
            return complexAt<std::int8_t>(bytes, digits);
        case ElementType::ComplexUInt8:
            return complexAt<std::uint8_t>(bytes, digits);
        case ElementType::ComplexInt16:
            return complexAt<std::int16_t>(bytes, digits);
        case ElementType::ComplexUInt16:
            return complexAt<std::uint16_t>(bytes, digits);
        case ElementType::ComplexInt32:
            return complexAt<std::int32_t>(bytes, digits);
        case ElementType::ComplexUInt32:
            return complexAt<std::uint32_t>(bytes, digits);
        case ElementType::ComplexInt64:
            return complexAt<std::int64_t>(bytes, digits);
        case ElementType::ComplexUInt64:
            return complexAt<std::uint64_t>(bytes, digits);
        case ElementType::Container:
            break;
    }
    return "?";
}

// Characters that a terminal shows in as many columns, roughly: code points.
std::size_t widthOf(const std::string& text) {
    return static_cast<std::size_t>(std::count_if(
        text.begin(), text.end(), [](char c) { return (static_cast<unsigned char>(c) & 0xC0U) != 0x80U; }));
}

// The values of an array with at least one dimension and at least one element.
class Values {
  public:
    explicit Values(const Array& array) : array_(array), strides_(stridesOf(array)) {
        if (array.numberOfElements() > mostShownElements) {
            edge_ = array.dimensions().size() <= 3 ? edge : 1;
        }
    }

    std::string text() {
        measure(0, 0);
        render(0, 0);
        return std::move(text_);
    }

  private:
    std::size_t last() const { return array_.dimensions().size() - 1; }

    // Calls `visit` with each index of a dimension that is shown, and `skip` where some are left out.
    template <class Visit, class Skip>
    void forEachShown(std::size_t dimension, Visit visit, Skip skip) const {
        const std::uint64_t extent = array_.dimensions()[dimension];
        const bool whole = edge_ == 0 || extent <= 2 * edge_;
        for (std::uint64_t i = 0; i < extent; ++i) {
            if (!whole && i == edge_) {
                skip();
                i = extent - edge_;
            }
            visit(i);
        }
    }

    std::string cell(std::uint64_t offset) const {
        const char* const bytes = array_.data() + offset * foundation::korveldata::elementSize(array_.elementType());
        return elementText(array_.elementType(), bytes, Digits::Eight);
    }

    void measure(std::size_t dimension, std::uint64_t offset) {
        forEachShown(
            dimension,
            [&](std::uint64_t i) {
                const std::uint64_t at = offset + i * strides_[dimension];
                if (dimension == last()) {
                    width_ = std::max(width_, widthOf(cell(at)));
                } else {
                    measure(dimension + 1, at);
                }
            },
            [] {});
    }

    void render(std::size_t dimension, std::uint64_t offset) {
        text_ += '[';
        bool first = true;
        std::size_t column = dimension + 1;
        const auto separate = [&](std::size_t width) {
            if (dimension != last()) {
                if (!first) {
                    text_ += ',' + std::string(last() - dimension, '\n') + std::string(dimension + 1, ' ');
                }
            } else if (first) {
                column += width;
            } else if (column + 2 + width >= columns) {
                text_ += ",\n" + std::string(dimension + 1, ' ');
                column = dimension + 1 + width;
            } else {
                text_ += ", ";
                column += 2 + width;
            }
            first = false;
        };
        forEachShown(
            dimension,
            [&](std::uint64_t i) {
                const std::uint64_t at = offset + i * strides_[dimension];
                separate(width_);
                if (dimension == last()) {
                    const std::string value = cell(at);
                    text_ += std::string(width_ - widthOf(value), ' ') + value;
                } else {
                    render(dimension + 1, at);
                }
            },
            [&] {
                separate(3);
                text_ += "...";
            });
        text_ += ']';
    }

    const Array& array_;
    std::vector<std::uint64_t> strides_;
    std::uint64_t edge_ = 0;  // shown at both ends of a dimension; 0 for all
    std::size_t width_ = 0;
    std::string text_;
};

std::string valuesText(const Array& array) {
    if (array.numberOfElements() == 0) {
        return "[]";
    }
    if (array.numberOfElements() > mostShownElements && array.dimensions().size() > mostSummarised) {
        return "[...]";
    }
    return Values(array).text();
}

}  // namespace

bool isText(const Array& array) {
    const auto dimensions = array.dimensions();
    return array.elementType() == ElementType::Char16 &&
           (dimensions.empty() ||
            std::all_of(dimensions.begin(), dimensions.end() - 1, [](std::uint64_t extent) { return extent == 1; }));
}

std::string arrayHeading(const Array& array) {
    if (isText(array)) {
        const std::uint64_t characters = array.numberOfElements();
        return "text of " + std::to_string(characters) + (characters == 1 ? " character" : " characters");
    }
    std::string heading(elementTypeName(array.elementType()));
    const char* separator = ", ";
    for (const std::uint64_t extent : array.dimensions()) {
        heading += separator + std::to_string(extent);
        separator = " x ";
    }
    if (array.dimensions().size() == 1) {
        heading += array.dimensions()[0] == 1 ? " element" : " elements";
    }
    return heading;
}

std::string elementText(const Array& array, std::uint64_t index) {
    const char* const bytes = array.data() + index * foundation::korveldata::elementSize(array.elementType());
    return elementText(array.elementType(), bytes, Digits::All);
}

std::vector<std::uint64_t> stridesOf(const Array& array) {
    const auto dimensions = array.dimensions();
    std::vector<std::uint64_t> strides(dimensions.size());
    std::uint64_t stride = 1;
    for (std::size_t i = 0; i < dimensions.size(); ++i) {
        const std::size_t dimension = array.order() == MemoryOrder::ColumnMajor ? i : dimensions.size() - 1 - i;
        strides[dimension] = stride;
        stride *= dimensions[dimension];
    }
    return strides;
}

std::string arrayText(const Array& array) {
    const std::string heading = arrayHeading(array) + ":";
    if (isText(array)) {
        const std::string text = msg_svc::protobuf::ustring_to_utf8(array.toText());
        return heading + (text.find('\n') == std::string::npos ? " " : "\n") + text + "\n";
    }
    if (array.dimensions().empty()) {
        return heading + " " + elementText(array, 0) + "\n";
    }
    return heading + "\n" + valuesText(array) + "\n";
}

}  // namespace krutil_client
