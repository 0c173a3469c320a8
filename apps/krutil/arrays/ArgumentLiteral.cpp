#include "krutil/arrays/ArgumentLiteral.hpp"

#include <algorithm>
#include <cctype>
#include <charconv>
#include <complex>
#include <cstdint>
#include <cstring>
#include <limits>
#include <nlohmann/json.hpp>
#include <optional>
#include <string_view>
#include <type_traits>
#include <vector>

#include "foundation/korveldata/ArrayFactory.hpp"
#include "msg_svc/protobuf/ustring.hpp"

namespace krutil_client {
namespace {

using foundation::korveldata::Array;
using foundation::korveldata::ArrayFactory;
using foundation::korveldata::ElementTypeOf;
using foundation::korveldata::MemoryOrder;

// In the order in which one holds the other, but for Bool, which stands alone.
enum class Kind { Bool, Integer, Double, Complex };

struct Value {
    Kind kind = Kind::Integer;
    std::int64_t integer = 0;
    std::complex<double> number;  // the same value, if it is none of the others
};

template <class T>
T as(const Value& value) {
    if constexpr (std::is_same_v<T, std::complex<double>>) {
        return value.number;
    } else if constexpr (std::is_same_v<T, double>) {
        return value.number.real();
    } else {
        return static_cast<T>(value.integer);
    }
}

bool isDigit(char c) {
    return c >= '0' && c <= '9';
}

class Parser {
  public:
    explicit Parser(const std::string& text) : text_(text) {}

    Array parse() {
        skipSpace();
        if (at('"')) {
            return parseText();
        }
        parseElement(0);
        skipSpace();
        if (position_ != text_.size()) {
            failHere("expected the end of the literal");
        }
        return build();
    }

  private:
    [[noreturn]] void failAt(std::size_t offset, const std::string& sentence) const {
        throw LiteralError(offset, sentence);
    }

    [[noreturn]] void failHere(const std::string& expected) const {
        std::size_t end = position_;
        // A character, not a byte of one; or a whole word.
        do {
            ++end;
        } while (end < text_.size() && ((static_cast<unsigned char>(text_[end]) & 0xC0U) == 0x80U ||
                                        (std::isalpha(static_cast<unsigned char>(text_[position_])) != 0 &&
                                         std::isalnum(static_cast<unsigned char>(text_[end])) != 0)));
        failAt(position_,
               expected + (position_ < text_.size() ? ", got '" + text_.substr(position_, end - position_) + "'"
                                                    : std::string(", got the end of it")));
    }

    bool at(char c) const { return position_ < text_.size() && text_[position_] == c; }
    bool atDigit() const { return position_ < text_.size() && isDigit(text_[position_]); }
    bool atSign() const { return at('+') || at('-'); }
    bool atImaginaryUnit() const { return at('j') || at('J'); }

    void skipSpace() {
        while (at(' ') || at('\t') || at('\n')) {
            ++position_;
        }
    }

    bool acceptWord(std::string_view word) {
        if (std::string_view(text_).substr(position_, word.size()) != word) {
            return false;
        }
        position_ += word.size();
        return true;
    }

    Array parseText() {
        try {
            const auto json = nlohmann::json::parse(text_);
            return ArrayFactory().createText(msg_svc::protobuf::utf8_to_ustring(json.get<std::string>()));
        } catch (const nlohmann::json::parse_error& error) {
            const std::size_t place = error.byte > 0 ? error.byte - 1 : 0;
            failAt(std::min(place, text_.size()), "expected a text in double quotes, with the escapes of JSON");
        }
    }

    // `depth` is the number of lists around it.
    void parseElement(std::size_t depth) {
        if (depth > 0) {
            checkListsAgree(depth);
        }
        if (at('[')) {
            parseList(depth);
        } else {
            parseValue();
        }
    }

    // The elements of all lists of one depth are lists, or none is.
    void checkListsAgree(std::size_t depth) {
        if (holdsLists_.size() < depth) {
            holdsLists_.push_back(at('['));
        } else if (holdsLists_[depth - 1] != at('[')) {
            failHere(holdsLists_[depth - 1] ? "expected a list like the elements before it"
                                            : "expected a number like the elements before it");
        }
    }

    void parseList(std::size_t depth) {
        if (depth == foundation::korveldata::maxDimensions) {
            failAt(position_, "expected at most " + std::to_string(foundation::korveldata::maxDimensions) +
                                  " lists in one another");
        }
        const std::size_t begin = position_++;
        if (extents_.size() == depth) {
            extents_.emplace_back();
        }
        std::uint64_t extent = 0;
        skipSpace();
        while (!at(']')) {
            if (extent > 0) {
                if (!at(',')) {
                    failHere("expected ',' or ']'");
                }
                ++position_;
                skipSpace();
            }
            parseElement(depth + 1);
            ++extent;
            skipSpace();
        }
        ++position_;
        if (!extents_[depth]) {
            extents_[depth] = extent;
        } else if (*extents_[depth] != extent) {
            failAt(begin, "expected a list of " + std::to_string(*extents_[depth]) + " like the ones before it, got " +
                              std::to_string(extent));
        }
    }

    void parseValue() {
        const std::size_t begin = position_;
        const Value value = parseScalar();
        const bool boolean = value.kind == Kind::Bool;
        if (!values_.empty() && boolean != (values_.front().kind == Kind::Bool)) {
            position_ = begin;
            failHere(boolean ? "expected a number like the elements before it"
                             : "expected true or false like the elements before it");
        }
        kind_ = values_.empty() ? value.kind : std::max(kind_, value.kind);
        values_.push_back(value);
    }

    Value parseScalar() {
        if (acceptWord("true")) {
            return {Kind::Bool, 1, 1.0};
        }
        if (acceptWord("false")) {
            return {Kind::Bool, 0, 0.0};
        }
        Value value = parseReal();
        if (atImaginaryUnit()) {
            ++position_;
            return {Kind::Complex, 0, {0.0, value.number.real()}};
        }
        if (atSign()) {
            const Value imaginary = parseReal();
            if (!atImaginaryUnit()) {
                failHere("expected j after the imaginary part");
            }
            ++position_;
            return {Kind::Complex, 0, {value.number.real(), imaginary.number.real()}};
        }
        return value;
    }

    // A sign and a number.
    Value parseReal() {
        const std::size_t begin = position_;
        const bool negative = at('-');
        if (atSign()) {
            ++position_;
        }
        if (acceptWord("inf")) {
            const double infinity = std::numeric_limits<double>::infinity();
            return {Kind::Double, 0, negative ? -infinity : infinity};
        }
        if (acceptWord("nan")) {
            return {Kind::Double, 0, std::numeric_limits<double>::quiet_NaN()};
        }
        const bool point = at('.') && position_ + 1 < text_.size() && isDigit(text_[position_ + 1]);
        if (!atDigit() && !point) {
            failNoValue();
        }
        const char* const first = text_.data() + position_;
        const char* const last = text_.data() + text_.size();
        double number = 0;
        const auto [end, error] = std::from_chars(first, last, number);
        const std::string_view digits(first, static_cast<std::size_t>(end - first));
        if (error == std::errc::result_out_of_range) {
            failAt(begin, "expected a number in the range of a double, got '" + std::string(digits) + "'");
        }
        position_ += digits.size();
        const double signedNumber = negative ? -number : number;
        if (digits.find_first_not_of("0123456789") != std::string_view::npos || atImaginaryUnit()) {
            return {Kind::Double, 0, signedNumber};
        }
        std::int64_t integer = 0;
        const char* const from = negative ? first - 1 : first;
        if (std::from_chars(from, end, integer).ec != std::errc()) {
            failAt(begin, "expected an integer of 64 bits, got '" + std::string(from, end) +
                              "'; with a point or an exponent it is a double");
        }
        return {Kind::Integer, integer, signedNumber};
    }

    [[noreturn]] void failNoValue() const {
        if (at('"') || at('\'')) {
            failHere(extents_.empty() ? "expected a text in double quotes"
                                      : "expected a number; lists cannot hold text");
        }
        failHere(extents_.empty() ? "expected a number, true, false, a list in [ ], a text in \" \" (the shell needs "
                                    "quotes around those: '\"text\"') or a .npy file"
                                  : "expected a number, true, false or a list");
    }

    Array build() const {
        switch (kind_) {
            case Kind::Bool:
                return build<bool>();
            case Kind::Integer:
                return build<std::int64_t>();
            case Kind::Double:
                break;
            case Kind::Complex:
                return build<std::complex<double>>();
        }
        return build<double>();
    }

    template <class T>
    Array build() const {
        std::vector<std::uint64_t> dimensions;
        for (const auto& extent : extents_) {
            dimensions.push_back(*extent);
        }
        Array array = ArrayFactory().createArray(ElementTypeOf<T>::value, dimensions);
        char* bytes = array.mutableData();
        for (const Value& value : values_) {
            const T element = as<T>(value);
            std::memcpy(bytes, &element, sizeof element);
            bytes += sizeof element;
        }
        return array;
    }

    const std::string& text_;
    std::size_t position_ = 0;
    std::vector<std::optional<std::uint64_t>> extents_;  // of each depth, known when its first list is closed
    std::vector<bool> holdsLists_;                       // the lists of each depth
    std::vector<Value> values_;
    Kind kind_ = Kind::Double;
};

}  // namespace

Array parseLiteral(const std::string& text) {
    return Parser(text).parse();
}

}  // namespace krutil_client
