#include "krutil/terminal/LineReader.hpp"

#include <termios.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <system_error>

#include "krutil/base/ExitCode.hpp"

namespace krutil_client {

void failReading() {
    throw Failure(ExitCode::Usage, "cannot read standard input: " + std::generic_category().message(errno));
}

bool isLineDropped(const std::exception_ptr& error) {
    try {
        if (error) {
            std::rethrow_exception(error);
        }
    } catch (const LineDropped&) {
        return true;
    } catch (...) {
    }
    return false;
}

LineReader::LineReader(int fd, Conversation& conversation, Output& out)
    : fd_(fd), conversation_(conversation), out_(out), terminal_(::isatty(fd) == 1) {}

ReadLine LineReader::read(const std::string& prompt, const std::function<bool()>& done) {
    if (!terminal_) {
        return readOn(done);
    }
    out_.write(prompt);
    try {
        ReadLine line = readOn(done);
        // With a line, its newline is on the terminal too.
        if (line.end != ReadLine::End::Newline) {
            out_.write("\n");
        }
        return line;
    } catch (...) {
        out_.write("\n");
        throw;
    }
}

ReadLine LineReader::readOn(const std::function<bool()>& done) {
    for (;;) {
        if (const auto newline = rest_.find('\n'); newline != std::string::npos) {
            std::string line = rest_.substr(0, newline);
            rest_.erase(0, newline + 1);
            return {ReadLine::End::Newline, std::move(line)};
        }
        if (!conversation_.runUntilReadable(fd_, done)) {
            if (terminal_) {
                ::tcflush(fd_, TCIFLUSH);
                rest_.clear();
            }
            return {ReadLine::End::Done, {}};
        }
        std::array<char, 4096> piece{};
        const auto got = ::read(fd_, piece.data(), piece.size());
        if (got > 0) {
            rest_.append(piece.data(), static_cast<std::size_t>(got));
        } else if (got < 0 && errno != EINTR && errno != EAGAIN) {
            failReading();
        } else if (got == 0) {
            if (!rest_.empty()) {
                return {ReadLine::End::Newline, std::exchange(rest_, {})};
            }
            return {ReadLine::End::EndOfInput, {}};
        }
    }
}

}  // namespace krutil_client
