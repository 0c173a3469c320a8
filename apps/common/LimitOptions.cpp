#include "common/LimitOptions.hpp"

#include <algorithm>
#include <array>
#include <cctype>
#include <charconv>
#include <system_error>

namespace apps {
namespace {

constexpr std::uint64_t kibi = 1024;
constexpr std::uint64_t unlimited = std::numeric_limits<std::uint64_t>::max();
constexpr std::array<std::string_view, 5> units{"", "KiB", "MiB", "GiB", "TiB"};

bool equalIgnoringCase(std::string_view left, std::string_view right) {
    return std::equal(left.begin(), left.end(), right.begin(), right.end(),
                      [](unsigned char a, unsigned char b) { return std::tolower(a) == std::tolower(b); });
}

// The library's own reader of sizes takes a sign, and numbers that wrap around.
CLI::Option* addNumber(CLI::App& app, const std::string& name, std::uint64_t& number, std::uint64_t largest,
                       const std::string& description, std::uint64_t smallest = 1) {
    return app
        .add_option_function<std::string>(
            name, [&number](const std::string& text) { number = parseSize(text).value(); }, description)
        ->check([smallest, largest](const std::string& text) {
            const auto size = parseSize(text);
            return size && *size >= smallest && *size <= largest
                       ? std::string()
                       : "expected a number from " + std::to_string(smallest) + " to " + std::to_string(largest) +
                             ", if need be with a unit such as MiB, got " + text;
        })
        ->group("Limits");
}

}  // namespace

std::optional<std::uint64_t> parseSize(std::string_view text) {
    std::uint64_t number = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
    if (error != std::errc()) {
        return std::nullopt;
    }
    const std::string_view unit = text.substr(static_cast<std::size_t>(end - text.data()));
    std::uint64_t factor = 1;
    for (const std::string_view name : units) {
        if (equalIgnoringCase(unit, name) || (!name.empty() && equalIgnoringCase(unit, name.substr(0, 1)))) {
            return number <= unlimited / factor ? std::optional(number * factor) : std::nullopt;
        }
        factor *= kibi;
    }
    return std::nullopt;
}

std::string sizeText(std::uint64_t bytes) {
    std::size_t unit = 0;
    while (bytes != 0 && bytes % kibi == 0 && unit + 1 < units.size()) {
        bytes /= kibi;
        ++unit;
    }
    return std::to_string(bytes) + std::string(units[unit]);
}

CLI::Option* addSizeOption(CLI::App& app, const std::string& name, std::uint64_t& bytes, const std::string& description,
                           std::uint64_t largest, std::uint64_t smallest) {
    return addNumber(app, name, bytes, largest, description, smallest)->type_name("SIZE")->default_str(sizeText(bytes));
}

void addLimitOptions(CLI::App& app, foundation::msg_svc::transport::layers::session::Limits& limits) {
    addSizeOption(app, "--limit-tag", limits.tag, "Longest tag of a frame that is accepted",
                  foundation::msg_svc::transport::layers::session::Limits::longestTag);
    addSizeOption(app, "--limit-tagged-frame", limits.taggedFrame, "Largest tagged frame that is accepted");
    addSizeOption(app, "--limit-array-message", limits.arrayMessage,
                  "Largest tagged frame of an array that is accepted");
    addSizeOption(app, "--limit-message", limits.message, "Largest message that is accepted, all its frames together");
    addNumber(app, "--limit-frames", limits.frames, unlimited, "Most frames of a message that are accepted")
        ->type_name("COUNT")
        ->default_str(std::to_string(limits.frames));
    addNumber(app, "--limit-parts", limits.parts, unlimited, "Most fields of a tagged frame that are accepted")
        ->type_name("COUNT")
        ->default_str(std::to_string(limits.parts));
}

}  // namespace apps
