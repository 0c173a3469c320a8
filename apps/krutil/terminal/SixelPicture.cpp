#include "krutil/terminal/SixelPicture.hpp"

#include <fcntl.h>
#include <poll.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <csignal>
#include <vector>

#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "foundation/core/posix/writeFully.hpp"

namespace krutil_client {
namespace {

namespace posix = foundation::core::posix;
using Clock = std::chrono::steady_clock;

// Of a picture that fills a large screen.
constexpr std::size_t longestSixel = 16U << 20U;

// In the child.
constexpr rlim_t mostMemory = 1U << 30U;
constexpr rlim_t mostSeconds = 5;

// Runs in the forked child: async-signal-safe calls only. Does not return.
[[noreturn]] void becomeConverter(int in, int out, char* const* arguments) {
    // Whatever it starts ends with it.
    ::setpgid(0, 0);
    ::signal(SIGPIPE, SIG_DFL);
    const int nowhere = ::open("/dev/null", O_WRONLY | O_CLOEXEC);
    if (::dup2(in, STDIN_FILENO) >= 0 && ::dup2(out, STDOUT_FILENO) >= 0 && ::dup2(nowhere, STDERR_FILENO) >= 0) {
        const auto bound = [](__rlimit_resource_t resource, rlim_t most) {
            const struct rlimit limit { most, most };
            return ::setrlimit(resource, &limit) == 0;
        };
        if (::close_range(STDERR_FILENO + 1, ~0U, CLOSE_RANGE_CLOEXEC) == 0 && bound(RLIMIT_AS, mostMemory) &&
            bound(RLIMIT_CPU, mostSeconds) && bound(RLIMIT_CORE, 0) && bound(RLIMIT_FSIZE, 0)) {
            ::execvp(arguments[0], arguments);
        }
    }
    ::_exit(127);
}

// All that is written there until its end; empty when that does not come in time, or after too much.
std::optional<std::string> readAll(int descriptor, Clock::time_point deadline) {
    std::string text;
    for (;;) {
        const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now());
        pollfd watched{descriptor, POLLIN, 0};
        const int ready = left.count() > 0 ? ::poll(&watched, 1, static_cast<int>(left.count())) : 0;
        std::array<char, 65'536> piece;
        const ssize_t got = ready > 0 ? ::read(descriptor, piece.data(), piece.size()) : -1;
        if (got < 0 && ready != 0 && errno == EINTR) {
            continue;
        }
        if (got == 0) {
            return text;
        }
        if (got < 0 || static_cast<std::size_t>(got) > longestSixel - text.size()) {
            return std::nullopt;
        }
        text.append(piece.data(), static_cast<std::size_t>(got));
    }
}

// Until the process has ended, which is not reaped.
void awaitEnd(pid_t pid, Clock::time_point deadline) {
    // The C library's own wrapper cannot be linked from C++ in all its versions.
    const posix::OwnedDescriptor process(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)));
    pollfd watched{process.get(), POLLIN, 0};
    for (;;) {
        const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now());
        if (left.count() <= 0 || ::poll(&watched, 1, static_cast<int>(left.count())) >= 0 || errno != EINTR) {
            return;
        }
    }
}

}  // namespace

bool isSixel(std::string_view text) {
    constexpr std::string_view begin = "\x1bP";
    constexpr std::string_view end = "\x1b\\";
    if (!text.starts_with(begin) || !text.ends_with(end) || text.size() < begin.size() + end.size()) {
        return false;
    }
    text = text.substr(begin.size(), text.size() - begin.size() - end.size());
    // What else begins so is not drawn: other letters ask for other things.
    const std::size_t numbers = text.find_first_not_of("0123456789;");
    return numbers != std::string_view::npos && text[numbers] == 'q' &&
           std::all_of(text.begin(), text.end(), [](char c) { return c >= ' ' && c <= '~'; });
}

std::optional<std::string> sixelOf(const std::string& png, std::optional<std::size_t> width,
                                   std::chrono::milliseconds patience) {
    // A file in memory needs nobody who goes on writing while the output is read.
    const posix::OwnedDescriptor picture(::memfd_create("picture", MFD_CLOEXEC));
    int ends[2];
    if (!picture || !posix::writeFully(picture.get(), png) || ::lseek(picture.get(), 0, SEEK_SET) != 0 ||
        ::pipe2(ends, O_CLOEXEC) != 0) {
        return std::nullopt;
    }
    const posix::OwnedDescriptor ours(ends[0]);
    posix::OwnedDescriptor theirs(ends[1]);
    std::vector<std::string> arguments{"img2sixel"};
    if (width) {
        arguments.insert(arguments.end(), {"-w", std::to_string(*width)});
    }
    std::vector<char*> pointers;
    pointers.reserve(arguments.size() + 1);
    for (std::string& argument : arguments) {
        pointers.push_back(argument.data());
    }
    pointers.push_back(nullptr);
    const auto deadline = Clock::now() + patience;
    const pid_t pid = ::fork();
    if (pid < 0) {
        return std::nullopt;
    }
    if (pid == 0) {
        becomeConverter(picture.get(), theirs.get(), pointers.data());
    }
    // Here as well, so that there is a group to be killed, whoever comes first.
    ::setpgid(pid, pid);
    theirs.reset();
    const auto text = readAll(ours.get(), deadline);
    if (text) {
        awaitEnd(pid, deadline);
    }
    ::kill(-pid, SIGKILL);
    int status = 0;
    while (::waitpid(pid, &status, 0) < 0 && errno == EINTR) {
    }
    const bool whole = text && WIFEXITED(status) && WEXITSTATUS(status) == 0 && isSixel(*text);
    return whole ? text : std::nullopt;
}

}  // namespace krutil_client
