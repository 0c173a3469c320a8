#include "krutil/display/Progress.hpp"

#include <algorithm>
#include <array>
#include <cstdio>
#include <string_view>

namespace krutil_client {
namespace {

// Smaller frames are no array worth a line: pieces of text, for example.
constexpr std::uint64_t leastFrame = 1U << 20;
// Of the row: what was there before, and the key Ctrl-C as the terminal shows it.
constexpr const char* eraseRest = "\x1b[K";
// Beside the bar itself.
constexpr std::size_t barWidth = 30;
constexpr std::size_t roomBesideBar = 50;

std::string amount(std::uint64_t done, std::uint64_t total) {
    struct Unit {
        std::uint64_t bytes;
        const char* name;
    };
    constexpr std::array units{Unit{1U << 30, "GiB"}, Unit{1U << 20, "MiB"}, Unit{1U << 10, "KiB"}};
    const auto* const unit = std::find_if(units.begin(), units.end() - 1,
                                          [total](const Unit& candidate) { return total >= candidate.bytes; });
    std::array<char, 64> text{};
    const auto inUnits = [unit](std::uint64_t bytes) {
        return static_cast<double>(bytes) / static_cast<double>(unit->bytes);
    };
    std::snprintf(text.data(), text.size(), "%.1f of %.1f %s", inUnits(done), inUnits(total), unit->name);
    return text.data();
}

}  // namespace

Progress::Progress(const Traffic& traffic, std::uint64_t toSend, Clock::time_point now) noexcept
    : toSend_(toSend), writtenBefore_(traffic.written), since_(now) {}

std::string Progress::update(const Traffic& traffic, Clock::time_point now, std::size_t columns) {
    if (const std::uint64_t sent = traffic.written - writtenBefore_; sent < toSend_) {
        return show("sending  ", sent, toSend_, now, columns);
    }
    if (toSend_ != 0) {
        toSend_ = 0;
        since_.reset();
    }
    if (traffic.arriving >= leastFrame) {
        return show("receiving", std::min(traffic.arrived, traffic.arriving), traffic.arriving, now, columns);
    }
    since_.reset();
    return clear();
}

std::string Progress::show(const char* what, std::uint64_t done, std::uint64_t total, Clock::time_point now,
                           std::size_t columns) {
    if (!since_) {
        since_ = now;
    }
    if (now - *since_ < moment) {
        return {};
    }
    const double part = static_cast<double>(done) / static_cast<double>(total);
    std::string line = what;
    if (columns >= barWidth + roomBesideBar) {
        const auto filled = static_cast<std::size_t>(part * barWidth);
        line += " [" + std::string(filled, '#') + std::string(barWidth - filled, ' ') + "]";
    }
    std::array<char, 16> percent{};
    std::snprintf(percent.data(), percent.size(), " %3d%%", static_cast<int>(part * 100));
    line += percent.data() + std::string("  ") + amount(done, total);
    if (columns > 0) {
        // A line that fills the last column would begin a new one.
        line.resize(std::min(line.size(), columns - 1));
    }
    if (line == shown_) {
        return {};
    }
    shown_ = line;
    return '\r' + line + eraseRest;
}

std::string Progress::clear() {
    if (shown_.empty()) {
        return {};
    }
    shown_.clear();
    return std::string("\r") + eraseRest;
}

}  // namespace krutil_client
