// A terminal with a program on it, as a person sits at one.
#pragma once

#include <gtest/gtest.h>
#include <poll.h>
#include <pty.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <string>
#include <utility>
#include <vector>

#include "Descriptor.hpp"

namespace client {

/// Runs a program on a pseudo-terminal of its own. A program that still runs when the object goes is killed.
class Terminal {
  public:
    /// `environment` is set besides this process's own.
    Terminal(const std::vector<std::string>& arguments,
             const std::vector<std::pair<std::string, std::string>>& environment) {
        std::vector<char*> pointers;
        for (const auto& argument : arguments) {
            pointers.push_back(const_cast<char*>(argument.c_str()));
        }
        pointers.push_back(nullptr);
        const winsize size{24, 100, 0, 0};
        int terminal = -1;
        pid_ = ::forkpty(&terminal, nullptr, nullptr, &size);
        if (pid_ == 0) {
            for (const auto& [name, value] : environment) {
                ::setenv(name.c_str(), value.c_str(), 1);
            }
            ::execv(pointers[0], pointers.data());
            ::_exit(127);
        }
        terminal_.reset(terminal);
    }

    ~Terminal() {
        if (pid_ > 0) {
            ::kill(pid_, SIGKILL);
            ::waitpid(pid_, nullptr, 0);
        }
    }

    Terminal(const Terminal&) = delete;
    Terminal& operator=(const Terminal&) = delete;

    /// Types keys, "\x03" for Ctrl-C, "\x04" for Ctrl-D, "\r" for Enter.
    void type(const std::string& keys) {
        ASSERT_EQ(::write(terminal_.get(), keys.data(), keys.size()), static_cast<ssize_t>(keys.size()));
    }

    /// Waits until the screen has shown `text` after what the last call waited for.
    void expect(const std::string& text) {
        while (screen_.find(text, seen_) == std::string::npos) {
            if (!readMore()) {
                FAIL() << "expected \"" << text << "\", the screen shows:\n" << screen_;
            }
        }
        seen_ = screen_.find(text, seen_) + text.size();
    }

    /// Waits until the program has ended, and returns its exit code; -1 for another end.
    int exitCode() {
        while (readMore()) {
        }
        int status = 0;
        ::waitpid(std::exchange(pid_, -1), &status, 0);
        return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    }

    /// All that the screen has shown.
    const std::string& screen() const { return screen_; }

  private:
    // False when the program has gone, or has not shown anything for too long.
    bool readMore() {
        pollfd watched{terminal_.get(), POLLIN, 0};
        constexpr int patience = 30'000;
        if (::poll(&watched, 1, patience) <= 0) {
            return false;
        }
        std::array<char, 4096> piece{};
        const auto got = ::read(terminal_.get(), piece.data(), piece.size());
        if (got <= 0) {
            return false;
        }
        screen_.append(piece.data(), static_cast<std::size_t>(got));
        return true;
    }

    pid_t pid_ = -1;
    Descriptor terminal_;
    std::string screen_;
    std::size_t seen_ = 0;
};

}  // namespace client
