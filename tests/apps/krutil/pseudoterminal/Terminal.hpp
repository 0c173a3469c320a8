// A terminal with a program on it, as a person sits at one.
#pragma once

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <pty.h>
#include <sys/ioctl.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdlib>
#include <functional>
#include <string>
#include <utility>
#include <vector>

#include "apps/krutil/pseudoterminal/Screen.hpp"
#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "programs/support/TracedSession.hpp"

namespace krutil_client {

/// Runs a program on a pseudo-terminal of its own. Whatever is waited for has a deadline of a minute from the start;
/// what is not there by then fails the test, ends the program, and lets everything after it return at once. A program
/// that still runs when the object goes is killed. When the client has ended, the test fails if a request of its
/// session had no legal life.
class Terminal {
  public:
    static constexpr unsigned short columns = 100;
    static constexpr unsigned short rows = 24;

    /// `environment` is set besides this process's own.
    Terminal(std::vector<std::string> arguments, const std::vector<std::pair<std::string, std::string>>& environment)
        : session_(arguments) {
        std::vector<char*> pointers;
        for (const auto& argument : arguments) {
            pointers.push_back(const_cast<char*>(argument.c_str()));
        }
        pointers.push_back(nullptr);
        const winsize size{rows, columns, 0, 0};
        int terminal = -1;
        pid_ = ::forkpty(&terminal, nullptr, nullptr, &size);
        if (pid_ == 0) {
            // As a terminal's own shell has them, whatever started the tests.
            for (const int signal : {SIGINT, SIGQUIT, SIGTSTP, SIGTTIN, SIGTTOU, SIGHUP, SIGTERM, SIGPIPE}) {
                ::signal(signal, SIG_DFL);
            }
            for (const auto& [name, value] : environment) {
                ::setenv(name.c_str(), value.c_str(), 1);
            }
            ::execv(pointers[0], pointers.data());
            ::_exit(127);
        }
        terminal_.reset(terminal);
        // Another program that is started meanwhile would keep the terminal open.
        ::fcntl(terminal, F_SETFD, FD_CLOEXEC);
        ::fcntl(terminal, F_SETFL, O_NONBLOCK);
    }

    ~Terminal() {
        if (pid_ > 0) {
            kill();
            ::waitpid(pid_, nullptr, 0);
            checkSession(-1);
        }
    }

    Terminal(const Terminal&) = delete;
    Terminal& operator=(const Terminal&) = delete;

    /// Types keys, "\x03" for Ctrl-C, "\x04" for Ctrl-D, "\r" for Enter.
    void type(std::string keys) {
        while (!keys.empty() && !failed_) {
            const auto written = ::write(terminal_.get(), keys.data(), keys.size());
            if (written > 0) {
                keys.erase(0, static_cast<std::size_t>(written));
            } else if (errno != EAGAIN || !pump(POLLOUT)) {
                giveUp("the program does not read what is typed");
            }
        }
    }

    /// Waits until the terminal has been sent `text` after what the last call waited for.
    void expect(const std::string& text) {
        const auto found = [&] { return sent_.find(text, seen_) != std::string::npos; };
        if (waitFor(found, [&] { return "expected \"" + text + "\""; })) {
            seen_ = sent_.find(text, seen_) + text.size();
        }
    }

    /// Waits until the screen shows exactly these lines at its bottom, with Screen::cursor where the cursor is.
    void expectBottom(const std::vector<std::string>& lines) {
        const auto shown = [&] {
            const auto all = screen_.lines();
            return all.size() >= lines.size() && std::equal(lines.rbegin(), lines.rend(), all.rbegin());
        };
        if (waitFor(shown, [&] { return "expected at the bottom:\n" + joined(lines); })) {
            seen_ = sent_.size();
        }
    }

    /// Waits until what is on the screen fulfils `condition`; `what` says what that is.
    void expectScreen(const std::string& what, const std::function<bool(const std::vector<std::string>&)>& condition) {
        waitFor([&] { return condition(screen_.lines()); }, [&] { return "expected " + what; });
    }

    /// Gives the terminal another size, and tells the program. A width in pixels of 0 is none that it knows.
    void resize(unsigned short newColumns, unsigned short newRows, unsigned short pixels = 0) {
        screen_.resize(newColumns, newRows);
        const winsize size{newRows, newColumns, pixels, 0};
        ::ioctl(terminal_.get(), TIOCSWINSZ, &size);
    }

    /// Waits until the program has ended, and returns its exit code; -1 for another end.
    int exitCode() {
        while (!failed_ && pump(0)) {
        }
        if (!failed_) {
            const foundation::core::posix::OwnedDescriptor process(
                static_cast<int>(::syscall(SYS_pidfd_open, pid_, 0)));
            pollfd watched{process.get(), POLLIN, 0};
            if (::poll(&watched, 1, millisecondsLeft()) != 1) {
                giveUp("the program did not end");
            }
        }
        int status = 0;
        ::waitpid(std::exchange(pid_, -1), &status, 0);
        const int code = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
        checkSession(code);
        return code;
    }

    /// All bytes that the terminal has been sent.
    const std::string& sent() const { return sent_; }

    /// What the screen has shown, line by line.
    std::vector<std::string> lines() const { return screen_.lines(); }

  private:
    template <class Condition, class What>
    bool waitFor(const Condition& condition, const What& what) {
        while (!failed_ && !condition()) {
            if (!pump(0)) {
                giveUp(what());
            }
        }
        return !failed_;
    }

    void checkSession(int code) const { EXPECT_EQ(session_.whatIsWrong(code, sent_), ""); }

    static std::string joined(const std::vector<std::string>& lines) {
        std::string text;
        for (const auto& line : lines) {
            text += line + "\n";
        }
        return text;
    }

    int millisecondsLeft() const {
        const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline_ - std::chrono::steady_clock::now());
        return static_cast<int>(std::max<std::int64_t>(left.count(), 0));
    }

    void kill() {
        // The program leads a process group of its own.
        ::kill(-pid_, SIGKILL);
        ::kill(pid_, SIGKILL);
    }

    void giveUp(const std::string& what) {
        if (!failed_) {
            failed_ = true;
            ADD_FAILURE() << what << "\nthe screen shows:\n" << joined(screen_.lines());
            if (pid_ > 0) {
                kill();
            }
        }
    }

    // Waits for output, and for `event` besides; false when the program has gone, or the minute has passed.
    bool pump(short event) {
        pollfd watched{terminal_.get(), static_cast<short>(POLLIN | event), 0};
        const int ready = ::poll(&watched, 1, millisecondsLeft());
        if (ready < 0) {
            return errno == EINTR;
        }
        if (ready == 0) {
            return false;
        }
        std::array<char, 4096> piece{};
        const auto got = ::read(terminal_.get(), piece.data(), piece.size());
        if (got > 0) {
            sent_.append(piece.data(), static_cast<std::size_t>(got));
            screen_.show({piece.data(), static_cast<std::size_t>(got)});
            return true;
        }
        return got < 0 && (errno == EAGAIN || errno == EINTR);
    }

    const std::chrono::steady_clock::time_point deadline_ = std::chrono::steady_clock::now() + std::chrono::minutes(1);
    programs_test::TracedSession session_;
    pid_t pid_ = -1;
    foundation::core::posix::OwnedDescriptor terminal_;
    std::string sent_;
    std::size_t seen_ = 0;
    Screen screen_{columns, rows};
    bool failed_ = false;
};

}  // namespace krutil_client
