#include "krutil/terminal/Highlight.hpp"

#include <algorithm>
#include <array>
#include <cwctype>
#include <string_view>

namespace krutil_client {
namespace {

constexpr std::array<std::wstring_view, 35> keywords{
    L"False", L"None",     L"True",  L"and",    L"as",   L"assert", L"async",  L"await",    L"break",
    L"class", L"continue", L"def",   L"del",    L"elif", L"else",   L"except", L"finally",  L"for",
    L"from",  L"global",   L"if",    L"import", L"in",   L"is",     L"lambda", L"nonlocal", L"not",
    L"or",    L"pass",     L"raise", L"return", L"try",  L"while",  L"with",   L"yield"};

bool isNameCharacter(wchar_t c) {
    return c == L'_' || std::iswalnum(static_cast<wint_t>(c)) != 0;
}

class Styler {
  public:
    explicit Styler(std::wstring_view code) : code_(code), styles_(code.size(), Style::Plain) {}

    std::vector<Style> take(std::size_t cursor) {
        while (at_ < code_.size()) {
            passToken();
        }
        for (const Pair& pair : pairs_) {
            const auto near = [cursor](std::size_t place) { return place == cursor || place + 1 == cursor; };
            if (near(pair.open) || near(pair.close)) {
                styles_[pair.open] = styles_[pair.close] = Style::Match;
            }
        }
        return std::move(styles_);
    }

  private:
    struct Pair {
        std::size_t open;
        std::size_t close;
    };

    void passToken() {
        const std::size_t begin = at_;
        const wchar_t c = code_[at_];
        if (c == L'#') {
            at_ = std::min(code_.find(L'\n', at_), code_.size());
            mark(begin, Style::Comment);
        } else if (c == L'"' || c == L'\'') {
            passString(c);
            mark(begin, Style::Literal);
        } else if (c >= L'0' && c <= L'9') {
            passWhile([](wchar_t each) { return isNameCharacter(each) || each == L'.'; });
            mark(begin, Style::Number);
        } else if (isNameCharacter(c)) {
            passWhile(isNameCharacter);
            const std::wstring_view name = code_.substr(begin, at_ - begin);
            if (std::find(keywords.begin(), keywords.end(), name) != keywords.end()) {
                mark(begin, Style::Keyword);
            }
        } else {
            passBracket(c);
            ++at_;
        }
    }

    template <class Condition>
    void passWhile(const Condition& condition) {
        while (at_ < code_.size() && condition(code_[at_])) {
            ++at_;
        }
    }

    void passString(wchar_t quote) {
        const std::wstring triple(3, quote);
        const bool isTriple = code_.substr(at_, 3) == triple;
        const std::wstring_view end = isTriple ? std::wstring_view(triple) : std::wstring_view(triple).substr(0, 1);
        at_ += end.size();
        while (at_ < code_.size() && code_.substr(at_, end.size()) != end) {
            if (!isTriple && code_[at_] == L'\n') {
                return;
            }
            at_ += code_[at_] == L'\\' ? 2 : 1;
        }
        at_ = std::min(at_ + end.size(), code_.size());
    }

    void passBracket(wchar_t c) {
        constexpr std::wstring_view opening = L"([{";
        constexpr std::wstring_view closing = L")]}";
        if (opening.find(c) != std::wstring_view::npos) {
            open_.push_back(at_);
        } else if (const auto kind = closing.find(c); kind != std::wstring_view::npos && !open_.empty()) {
            if (code_[open_.back()] == opening[kind]) {
                pairs_.push_back({open_.back(), at_});
            }
            open_.pop_back();
        }
    }

    void mark(std::size_t begin, Style style) {
        at_ = std::min(at_, code_.size());
        std::fill(styles_.begin() + static_cast<std::ptrdiff_t>(begin),
                  styles_.begin() + static_cast<std::ptrdiff_t>(at_), style);
    }

    const std::wstring_view code_;
    std::size_t at_ = 0;
    std::vector<Style> styles_;
    std::vector<std::size_t> open_;
    std::vector<Pair> pairs_;
};

}  // namespace

std::vector<Style> stylesOf(const std::wstring& code, std::size_t cursor) {
    return Styler(code).take(cursor);
}

}  // namespace krutil_client
