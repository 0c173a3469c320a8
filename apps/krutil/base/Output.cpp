#include "krutil/base/Output.hpp"

#include <limits.h>
#include <poll.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <string>

#include "krutil/base/ExitCode.hpp"
#include "krutil/base/Interrupt.hpp"
#include "krutil/base/LastLine.hpp"

namespace krutil_client {
namespace {

bool isFile(int fd) {
    struct stat status {};
    return ::fstat(fd, &status) == 0 && S_ISREG(status.st_mode);
}

}  // namespace

Output::Output(int fd, std::string_view name, Interrupt& interrupt, LastLine* lastLine)
    : fd_(fd),
      name_(name),
      interrupt_(interrupt),
      terminal_(::isatty(fd) == 1),
      mayBlock_(!isFile(fd)),
      lastLine_(lastLine) {}

bool Output::hasCursor() const noexcept {
    const char* const variable = std::getenv("TERM");
    const std::string_view name = variable != nullptr ? variable : "";
    return terminal_ && !name.empty() && name != "dumb" && name != "emacs";
}

TerminalSize Output::terminalSize() const noexcept {
    TerminalSize size;
    winsize said{};
    if (::ioctl(fd_, TIOCGWINSZ, &said) == 0) {
        size.columns = said.ws_col != 0 ? said.ws_col : size.columns;
        size.rows = said.ws_row != 0 ? said.ws_row : size.rows;
        size.pixelWidth = said.ws_xpixel;
    }
    return size;
}

void Output::write(std::string_view text) {
    if (terminal_ && lastLine_ != nullptr) {
        lastLine_->add(text);
    }
    put(text, true);
}

void Output::show(std::string_view text) {
    put(text, false);
}

void Output::put(std::string_view text, bool interruptible) {
    while (!text.empty()) {
        std::size_t piece = text.size();
        if (mayBlock_) {
            std::array<pollfd, 2> watched{pollfd{fd_, POLLOUT, 0}, pollfd{interrupt_.fd(), POLLIN, 0}};
            if (::poll(watched.data(), watched.size(), -1) < 0 && errno != EINTR) {
                throw Failure(ExitCode::Stream,
                              std::string("cannot wait for ") + std::string(name_) + ": " + std::strerror(errno));
            }
            if (watched[1].revents != 0 && (interruptible || watched[0].revents == 0)) {
                interrupt_.dispatch();
            }
            if (watched[0].revents == 0) {
                continue;
            }
            // A pipe that is ready takes this much without blocking.
            piece = std::min<std::size_t>(piece, PIPE_BUF);
        }
        const auto written = ::write(fd_, text.data(), piece);
        if (written >= 0) {
            text.remove_prefix(static_cast<std::size_t>(written));
        } else if (errno == EPIPE) {
            throw OutputClosed();
        } else if (errno != EINTR && errno != EAGAIN) {
            throw Failure(ExitCode::Stream, "cannot write to " + std::string(name_) + ": " + std::strerror(errno));
        }
    }
}

}  // namespace krutil_client
