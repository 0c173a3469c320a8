#include "krutil/terminal/TerminalImages.hpp"

#include <poll.h>
#include <sys/ioctl.h>
#include <termios.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <string_view>

#include "krutil/terminal/SixelPicture.hpp"

namespace krutil_client {
namespace {

using Clock = std::chrono::steady_clock;

// A picture of one pixel, which is not drawn; the size of a character cell; and what every terminal answers, so that
// there is an end. Terminals answer in order, and leave out what they do not know.
constexpr std::string_view questions =
    "\x1b_Gi=31,s=1,v=1,a=q,t=d,f=24;AAAA\x1b\\"
    "\x1b]1337;ReportCellSize\x1b\\"
    "\x1b[c";

// The terminal's standard input without echo and without lines, as long as this lives.
class Unbuffered {
  public:
    Unbuffered() : known_(::tcgetattr(STDIN_FILENO, &before_) == 0) {
        termios mode = before_;
        mode.c_lflag &= ~static_cast<tcflag_t>(ICANON | ECHO);
        mode.c_cc[VMIN] = 1;
        mode.c_cc[VTIME] = 0;
        known_ = known_ && ::tcsetattr(STDIN_FILENO, TCSANOW, &mode) == 0;
    }
    ~Unbuffered() {
        if (known_) {
            ::tcsetattr(STDIN_FILENO, TCSANOW, &before_);
        }
    }
    Unbuffered(const Unbuffered&) = delete;
    Unbuffered& operator=(const Unbuffered&) = delete;

    explicit operator bool() const noexcept { return known_; }

  private:
    termios before_{};
    bool known_;
};

// Takes out the first part of `text` that begins so and ends in one of two ways.
std::optional<std::string> takePart(std::string& text, std::string_view begin, std::string_view end,
                                    std::string_view otherEnd) {
    const auto from = text.find(begin);
    if (from == std::string::npos) {
        return std::nullopt;
    }
    const auto first = text.find(end, from + begin.size());
    const auto second = text.find(otherEnd, from + begin.size());
    const auto at = std::min(first, second);
    if (at == std::string::npos) {
        return std::nullopt;
    }
    const auto to = at + (at == first ? end.size() : otherEnd.size());
    std::string part = text.substr(from, to - from);
    text.erase(from, to - from);
    return part;
}

// Whether the terminal's attributes, "ESC [ ? 62 ; 4 c" for example, say so. The first number is the kind of terminal.
bool drawsSixels(std::string_view attributes) {
    return attributes.find(";4;") != std::string_view::npos || attributes.ends_with(";4c");
}

// Reads until the terminal has given its last answer, or until the deadline.
AskedTerminal readAnswers(Clock::time_point deadline) {
    constexpr std::size_t longest = 65'536;
    AskedTerminal asked;
    std::string& text = asked.typed;
    for (;;) {
        const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now());
        pollfd watched{STDIN_FILENO, POLLIN, 0};
        const int ready = left.count() > 0 ? ::poll(&watched, 1, static_cast<int>(left.count())) : 0;
        if (ready < 0 && errno == EINTR) {
            continue;
        }
        std::array<char, 1024> piece{};
        const auto got = ready > 0 ? ::read(STDIN_FILENO, piece.data(), piece.size()) : 0;
        if (got <= 0 || text.size() > longest) {
            return asked;
        }
        text.append(piece.data(), static_cast<std::size_t>(got));
        if (const auto device = takePart(text, "\x1b[?", "c", "c")) {
            const auto kitty = takePart(text, "\x1b_Gi=31;", "\x1b\\", "\x1b\\");
            const auto cell = takePart(text, "\x1b]1337;ReportCellSize=", "\x1b\\", "\a");
            asked.protocol = kitty && kitty->find(";OK") != std::string::npos ? ImageProtocol::Kitty
                             : cell                                           ? ImageProtocol::ITerm2
                             : drawsSixels(*device)                           ? ImageProtocol::Sixel
                                                                              : ImageProtocol::None;
            return asked;
        }
    }
}

std::string base64(std::string_view bytes) {
    constexpr std::string_view digits = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
    std::string text;
    text.reserve((bytes.size() + 2) / 3 * 4);
    for (std::size_t i = 0; i < bytes.size(); i += 3) {
        const auto byte = [&bytes, i](std::size_t offset) {
            return i + offset < bytes.size() ? static_cast<unsigned char>(bytes[i + offset]) : 0U;
        };
        const unsigned bits = byte(0) << 16U | byte(1) << 8U | byte(2);
        text += digits[bits >> 18U & 63U];
        text += digits[bits >> 12U & 63U];
        text += i + 1 < bytes.size() ? digits[bits >> 6U & 63U] : '=';
        text += i + 2 < bytes.size() ? digits[bits & 63U] : '=';
    }
    return text;
}

std::string kittyDrawing(const std::string& encoded, const std::string& placement) {
    // The protocol's own bound.
    constexpr std::size_t chunk = 4096;
    std::string text;
    for (std::size_t at = 0; at == 0 || at < encoded.size(); at += chunk) {
        const bool last = at + chunk >= encoded.size();
        // Without answers, which nobody would read.
        text += "\x1b_G" + (at == 0 ? "a=T,f=100,q=2" + placement + "," : std::string("q=2,")) +
                (last ? "m=0;" : "m=1;") + encoded.substr(at, chunk) + "\x1b\\";
    }
    return text + "\n";
}

}  // namespace

std::optional<AskedTerminal> askTerminal(Output& out, std::chrono::milliseconds patience) {
    if (::tcgetpgrp(STDIN_FILENO) != ::getpgrp()) {
        return std::nullopt;
    }
    // Lines that are not complete cannot be seen in the usual mode.
    const Unbuffered unbuffered;
    int pending = 0;
    if (!unbuffered || ::ioctl(STDIN_FILENO, FIONREAD, &pending) != 0 || pending != 0) {
        return std::nullopt;
    }
    out.show(questions);
    return readAnswers(Clock::now() + patience);
}

std::optional<std::string> drawing(ImageProtocol protocol, const std::string& png, std::size_t width,
                                   const Output& out) {
    const TerminalSize size = out.terminalSize();
    const bool tooWide = size.pixelWidth != 0 && width > size.pixelWidth;
    switch (protocol) {
        case ImageProtocol::Kitty:
            return kittyDrawing(base64(png), tooWide ? ",c=" + std::to_string(size.columns) : "");
        case ImageProtocol::ITerm2:
            return "\x1b]1337;File=inline=1;size=" + std::to_string(png.size()) + (tooWide ? ";width=100%" : "") + ":" +
                   base64(png) + "\a\n";
        case ImageProtocol::Sixel: {
            auto sixels = sixelOf(png, tooWide ? std::optional(size.pixelWidth) : std::nullopt);
            return sixels ? std::optional(*sixels + "\n") : std::nullopt;
        }
        case ImageProtocol::None:
            break;
    }
    return std::nullopt;
}

}  // namespace krutil_client
