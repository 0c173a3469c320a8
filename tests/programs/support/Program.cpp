#include "programs/support/Program.hpp"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <pty.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <csignal>
#include <cstring>
#include <stdexcept>
#include <system_error>

#include "support/Patience.hpp"

extern char** environ;

namespace programs_test {
namespace {

using test_support::patience;

void makePipe(int (&ends)[2]) {
    if (::pipe2(ends, O_CLOEXEC) != 0) {
        throw std::system_error(errno, std::generic_category(), "pipe2");
    }
}

// A process on the terminal has one end as both its standard input and output, whoever watches it the other.
void makeTerminal(int (&in)[2], int (&out)[2]) {
    const winsize size{24, 100, 0, 0};
    if (::openpty(&out[0], &out[1], nullptr, nullptr, &size) != 0) {
        throw std::system_error(errno, std::generic_category(), "openpty");
    }
    ::fcntl(out[0], F_SETFD, FD_CLOEXEC);
    ::fcntl(out[1], F_SETFD, FD_CLOEXEC);
    in[0] = ::fcntl(out[1], F_DUPFD_CLOEXEC, 0);
    in[1] = ::fcntl(out[0], F_DUPFD_CLOEXEC, 0);
}

void closeDescriptor(int& descriptor) {
    if (descriptor >= 0) {
        ::close(descriptor);
        descriptor = -1;
    }
}

void requireProcess(pid_t pid) {
    if (pid <= 1) {
        throw std::logic_error("no process of a test has the number " + std::to_string(pid));
    }
}

std::vector<char*> pointersTo(const std::vector<std::string>& texts) {
    std::vector<char*> pointers;
    for (const auto& text : texts) {
        pointers.push_back(const_cast<char*>(text.c_str()));
    }
    pointers.push_back(nullptr);
    return pointers;
}

}  // namespace

Program::Program(const std::vector<std::string>& arguments, const Options& options)
    : command_(arguments),
      session_(command_),
      input_(options.input),
      deadline_(std::chrono::steady_clock::now() + patience) {
    std::signal(SIGPIPE, SIG_IGN);
    int in[2];
    int out[2];
    int err[2];
    if (options.terminal) {
        makeTerminal(in, out);
    } else {
        makePipe(in);
        makePipe(out);
    }
    makePipe(err);
    std::vector<std::string> environment = options.environment;
    for (char** variable = environ; *variable != nullptr; ++variable) {
        environment.emplace_back(*variable);
    }
    const auto argumentPointers = pointersTo(command_);
    const auto environmentPointers = pointersTo(environment);
    pid_ = ::fork();
    if (pid_ == 0) {
        ::signal(SIGPIPE, SIG_DFL);
        if (options.terminal) {
            ::setpgid(0, 0);
        }
        ::dup2(in[0], STDIN_FILENO);
        ::dup2(out[1], STDOUT_FILENO);
        ::dup2(err[1], STDERR_FILENO);
        // What whoever runs the tests left open may change its name meanwhile, and is not the program's.
        ::closefrom(STDERR_FILENO + 1);
        if (!options.directory.empty() && ::chdir(options.directory.c_str()) != 0) {
            ::_exit(126);
        }
        ::execvpe(argumentPointers[0], argumentPointers.data(), environmentPointers.data());
        ::_exit(127);
    }
    if (pid_ < 0) {
        throw std::system_error(errno, std::generic_category(), "fork");
    }
    ::close(in[0]);
    ::close(out[1]);
    ::close(err[1]);
    in_ = in[1];
    out_ = out[0];
    err_ = err[0];
    ::fcntl(in_, F_SETFL, O_NONBLOCK);
    if (input_.empty() && !options.terminal) {
        closeDescriptor(in_);
    }
}

Program::~Program() {
    closeDescriptor(in_);
    closeDescriptor(out_);
    closeDescriptor(err_);
    if (pid_ > 0) {
        ::kill(pid_, SIGKILL);
        ::waitpid(pid_, nullptr, 0);
        ran_.exitCode = 128 + SIGKILL;
        checkSession();
    }
}

void Program::checkSession() {
    if (const std::string wrong = session_.whatIsWrong(ran_.exitCode, ran_.err); !wrong.empty()) {
        std::string text = "in the session of";
        for (const std::string& word : command_) {
            text += " " + quotedForShell(word.substr(0, 200));
        }
        ADD_FAILURE() << text << ":\n" << wrong;
    }
}

void Program::giveUp(const std::string& what) {
    ADD_FAILURE() << what << "\nstandard output: " << ran_.out.substr(0, 2000)
                  << "\nstandard error: " << ran_.err.substr(0, 2000);
    signalOne(pid_, SIGKILL);
}

// Moves what there is; false when nothing can come any more.
bool Program::pump() {
    if (out_ < 0 && err_ < 0) {
        return false;
    }
    std::array<pollfd, 3> watched{pollfd{input_.empty() ? -1 : in_, POLLOUT, 0}, pollfd{out_, POLLIN, 0},
                                  pollfd{err_, POLLIN, 0}};
    const auto left =
        std::chrono::ceil<std::chrono::milliseconds>(deadline_ - std::chrono::steady_clock::now()).count();
    const int ready = ::poll(watched.data(), watched.size(), left > 0 ? static_cast<int>(left) : 0);
    if (ready == 0) {
        giveUp("the program did not end in time");
        return false;
    }
    if (watched[0].revents != 0) {
        const auto written = ::write(in_, input_.data(), input_.size());
        if (written < 0 && errno != EAGAIN) {
            closeDescriptor(in_);
        } else if (written > 0) {
            input_.erase(0, static_cast<std::size_t>(written));
        }
        if (input_.empty()) {
            closeDescriptor(in_);
        }
    }
    const auto take = [](const pollfd& source, int& descriptor, std::string& text) {
        if (source.revents == 0) {
            return;
        }
        std::array<char, 1U << 16> piece;
        const auto got = ::read(descriptor, piece.data(), piece.size());
        if (got > 0) {
            text.append(piece.data(), static_cast<std::size_t>(got));
        } else {
            closeDescriptor(descriptor);
        }
    };
    take(watched[1], out_, ran_.out);
    take(watched[2], err_, ran_.err);
    return true;
}

bool Program::waitFor(const std::string& text, const std::string& where, std::size_t& seen) {
    auto found = where.find(text, seen);
    while (found == std::string::npos) {
        if (!pump()) {
            return false;
        }
        found = where.find(text, seen);
    }
    seen = found + text.size();
    return true;
}

bool Program::waitForOut(const std::string& text) {
    return waitFor(text, ran_.out, seenOut_);
}

bool Program::waitForErr(const std::string& text) {
    return waitFor(text, ran_.err, seenErr_);
}

void Program::closeOut() {
    closeDescriptor(out_);
}

void Program::signal(int number) {
    signalOne(pid_, number);
}

void Program::type(const std::string& keys) {
    ASSERT_EQ(::write(in_, keys.data(), keys.size()), static_cast<ssize_t>(keys.size()));
}

void Program::pressCtrlC() {
    requireProcess(pid_);
    ::kill(-pid_, SIGINT);
}

Ran Program::finish() {
    while (pump()) {
    }
    pollfd watched{static_cast<int>(::syscall(SYS_pidfd_open, pid_, 0)), POLLIN, 0};
    const auto left =
        std::chrono::ceil<std::chrono::milliseconds>(deadline_ - std::chrono::steady_clock::now()).count();
    if (::poll(&watched, 1, left > 0 ? static_cast<int>(left) : 0) != 1) {
        giveUp("the program closed its output and did not end");
    }
    ::close(watched.fd);
    int status = 0;
    ::waitpid(pid_, &status, 0);
    pid_ = -1;
    ran_.exitCode = WIFSIGNALED(status) ? 128 + WTERMSIG(status) : WEXITSTATUS(status);
    checkSession();
    return ran_;
}

void signalOne(pid_t pid, int number) {
    requireProcess(pid);
    ::kill(pid, number);
}

bool endsWithin(pid_t pid, std::chrono::milliseconds time) {
    pollfd watched{static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)), POLLIN, 0};
    if (watched.fd < 0) {
        return true;
    }
    const bool ended = ::poll(&watched, 1, static_cast<int>(time.count())) == 1;
    ::close(watched.fd);
    return ended;
}

bool waitUntilGone(pid_t pid) {
    return endsWithin(pid, patience);
}

Ran run(const std::vector<std::string>& arguments, const Program::Options& options) {
    return Program(arguments, options).finish();
}

std::vector<std::string> clientCommand(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), KRUTIL_CLIENT);
    return arguments;
}

Ran runClient(std::vector<std::string> arguments, const Program::Options& options) {
    return run(clientCommand(std::move(arguments)), options);
}

std::string enginePath() {
    return KRUTIL_ENGINE;
}

std::string fakeEngine(const std::string& scene) {
    return quotedForShell(KRUTIL_FAKE_ENGINE) + " " + scene;
}

std::string quotedForShell(const std::string& text) {
    std::string quoted = "'";
    for (const char c : text) {
        quoted += c == '\'' ? std::string("'\\''") : std::string(1, c);
    }
    return quoted + "'";
}

}  // namespace programs_test
