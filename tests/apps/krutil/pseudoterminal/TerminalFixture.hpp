// What a person does at a terminal with the client on it.
#pragma once

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <memory>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "apps/krutil/pseudoterminal/Terminal.hpp"
#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "support/TemporaryDirectory.hpp"

namespace krutil_client {

// Where the cursor is, and what keys send.
inline const std::string at = Screen::cursor;

inline constexpr const char* left = "\x1b[D";
inline constexpr const char* right = "\x1b[C";
inline constexpr const char* up = "\x1b[A";
inline constexpr const char* backspace = "\x7f";
inline constexpr const char* lineBegin = "\x01";
inline constexpr const char* lineEnd = "\x05";
inline constexpr const char* down = "\x1b[B";
inline constexpr const char* searchKey = "\x12";
inline constexpr const char* eraseToBegin = "\x15";
inline constexpr const char* eraseToEnd = "\x0b";
inline constexpr const char* eraseWord = "\x17";
inline constexpr const char* bringBack = "\x19";
inline constexpr const char* clearScreen = "\x0c";
// Comes when the line that is typed from now on is the program's to show.
inline constexpr const char* editing = "\x1b[?2004h";
inline constexpr const char* pasteBegin = "\x1b[200~";
inline constexpr const char* pasteEnd = "\x1b[201~";

/// Terminals whose programs keep their files in a directory of the test.
class TerminalTest : public ::testing::Test {
  protected:
    std::vector<std::pair<std::string, std::string>> environment(const std::string& noColor = "1") const {
        return {{"TERM", "xterm"}, {"XDG_STATE_HOME", directory.string()}, {"NO_COLOR", noColor}};
    }

    static std::vector<std::string> command(std::vector<std::string> arguments) {
        arguments.insert(arguments.begin(), KRUTIL_CLIENT);
        return arguments;
    }

    /// A shell that runs `script`, in which $KRUTIL is the client.
    static std::vector<std::string> shell(const std::string& script) {
        return {"/bin/sh", "-c", "KRUTIL='" + std::string(KRUTIL_CLIENT) + "'; " + script};
    }

    const test_support::TemporaryDirectory files;
    const std::filesystem::path directory = files.path();
};

/// Something that code on the engine waits for, in a thread of its own, until a test lets it happen.
class Happening {
  public:
    /// `file` is created.
    explicit Happening(const std::filesystem::path& file) : file_(file) {
        if (::mkfifo(file_.c_str(), 0600) != 0) {
            throw std::runtime_error("no pipe at " + file_.string());
        }
        // For both directions, so that neither this nor the engine waits for the other one to open it.
        pipe_.reset(::open(file_.c_str(), O_RDWR | O_CLOEXEC));
    }

    /// A line of code that has `code`, an expression, evaluated each time that it happens.
    std::string thread(const std::string& code) const {
        return "import os, signal, threading; threading.Thread(target=lambda: [" + code + " for line in open('" +
               file_.string() + "')], daemon=True).start()";
    }

    void happen() const { ASSERT_EQ(::write(pipe_.get(), "\n", 1), 1); }

    /// Waits until code has written something to the file itself.
    void await() const {
        constexpr int patience = 60'000;
        pollfd watched{pipe_.get(), POLLIN, 0};
        ASSERT_EQ(::poll(&watched, 1, patience), 1) << "nothing was written to " << file_;
    }

  private:
    std::filesystem::path file_;
    foundation::core::posix::OwnedDescriptor pipe_;
};

/// One client that reads lines.
class TerminalReplTest : public TerminalTest {
  protected:
    static constexpr const char* prompt = ">>> ";

    void expectPrompt() { terminal->expect(prompt); }

    void begin(const std::vector<std::string>& arguments = {"repl"}) { beginWith(command(arguments)); }

    void beginWith(const std::vector<std::string>& arguments) {
        terminal = std::make_unique<Terminal>(arguments, environment());
        expectPrompt();
    }

    /// Types a line whose end on the screen is waited for, so that what follows is what came of it.
    void enter(const std::string& line) {
        terminal->type(line);
        terminal->expect(line);
        terminal->type("\r");
        terminal->expect("\r\n");
    }

    /// Enters a line, and waits for what comes of it, if that is anything, and for the next prompt.
    void evaluate(const std::string& line, const std::string& shown = "", const std::string& next = prompt) {
        enter(line);
        if (!shown.empty()) {
            terminal->expect(shown);
        }
        terminal->expect(next);
    }

    /// Leaves with Ctrl-D, or whatever else leaves.
    void leave(const std::string& keys = "\x04") {
        terminal->type(keys);
        EXPECT_EQ(terminal->exitCode(), 0);
    }

    std::unique_ptr<Terminal> terminal;
};

}  // namespace krutil_client
