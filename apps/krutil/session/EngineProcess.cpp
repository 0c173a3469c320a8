#include "krutil/session/EngineProcess.hpp"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstring>
#include <filesystem>
#include <utility>

#include "krutil/base/ExitCode.hpp"

namespace krutil_client {
namespace {

[[noreturn]] void fail(const std::string& what, int error) {
    throw Failure(ExitCode::Stream, what + ": " + std::strerror(error));
}

// Runs in the forked child, which shares nothing with this process any more: async-signal-safe calls only. Returns only
// when the program could not be started, with errno.
void becomeEngine(int stream, char* const* arguments, const TerminalLoan* loan) {
    if (loan != nullptr) {
        ::setpgid(0, 0);
        // The shell that could let it go on does not know this group.
        ::signal(SIGTSTP, SIG_IGN);
        loan->takeInChild();
    } else {
        ::signal(SIGINT, SIG_IGN);
    }
    ::signal(SIGPIPE, SIG_DFL);
    sigset_t none;
    sigemptyset(&none);
    ::sigprocmask(SIG_SETMASK, &none, nullptr);
    if (::dup2(stream, STDIN_FILENO) < 0 || ::dup2(stream, STDOUT_FILENO) < 0) {
        return;
    }
    // What this program itself was started with is no business of the engine's; a kernel that does not know the call
    // leaves such descriptors open, which does no harm to the session.
    ::close_range(STDERR_FILENO + 1, ~0U, CLOSE_RANGE_CLOEXEC);
    ::execvp(arguments[0], arguments);
}

// The C library's own wrapper cannot be linked from C++ in all its versions.
int openPidfd(pid_t pid) {
    return static_cast<int>(::syscall(SYS_pidfd_open, pid, 0));
}

}  // namespace

std::string EngineEnd::text() const {
    if (!signalled) {
        return "exited with code " + std::to_string(number);
    }
    const char* description = ::sigdescr_np(number);
    return "was killed by signal " + std::to_string(number) + " (" + (description ? description : "unknown") + ")";
}

bool EngineEnd::wasInterrupted() const noexcept {
    constexpr int ofShells = 128;
    return signalled ? number == SIGINT : number == ofShells + SIGINT;
}

EngineProcess::EngineProcess(pid_t pid, posix::OwnedDescriptor pidfd, posix::OwnedDescriptor stream) noexcept
    : pid_(pid), pidfd_(std::move(pidfd)), stream_(std::move(stream)) {}

EngineProcess::EngineProcess(EngineProcess&& other) noexcept
    : pid_(std::exchange(other.pid_, -1)),
      pidfd_(std::move(other.pidfd_)),
      relay_(std::move(other.relay_)),
      stream_(std::move(other.stream_)),
      end_(other.end_),
      loan_(std::move(other.loan_)) {}

EngineProcess::~EngineProcess() {
    kill();
}

EngineProcess EngineProcess::start(const std::vector<std::string>& arguments) {
    return start(arguments, std::nullopt);
}

EngineProcess EngineProcess::startCommand(const std::string& command) {
    return start({"/bin/sh", "-c", command}, TerminalLoan());
}

EngineProcess EngineProcess::start(const std::vector<std::string>& arguments, std::optional<TerminalLoan> loan) {
    const std::string cannot = "cannot start the engine '" + arguments.at(0) + "'";
    int ends[2];
    if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) != 0) {
        fail(cannot, errno);
    }
    posix::OwnedDescriptor ours(ends[0]);
    posix::OwnedDescriptor theirs(ends[1]);
    // Tells why the program could not be started; closed unwritten by a start that succeeds.
    int report[2];
    if (::pipe2(report, O_CLOEXEC) != 0) {
        fail(cannot, errno);
    }
    posix::OwnedDescriptor reportRead(report[0]);
    posix::OwnedDescriptor reportWrite(report[1]);
    std::vector<char*> pointers;
    pointers.reserve(arguments.size() + 1);
    for (const auto& argument : arguments) {
        pointers.push_back(const_cast<char*>(argument.c_str()));
    }
    pointers.push_back(nullptr);

    const pid_t pid = ::fork();
    if (pid < 0) {
        fail(cannot, errno);
    }
    if (pid == 0) {
        becomeEngine(theirs.get(), pointers.data(), loan ? &*loan : nullptr);
        const int error = errno;
        [[maybe_unused]] const auto written = ::write(reportWrite.get(), &error, sizeof error);
        ::_exit(127);
    }
    posix::OwnedDescriptor pidfd(openPidfd(pid));
    if (!pidfd) {
        const int error = errno;
        ::kill(pid, SIGKILL);
        ::waitpid(pid, nullptr, 0);
        fail(cannot, error);
    }
    EngineProcess engine(pid, std::move(pidfd), std::move(ours));
    if (loan) {
        loan->lentTo(pid);
        engine.loan_.emplace(std::move(*loan));
    }
    theirs.reset();
    reportWrite.reset();
    int error = 0;
    ssize_t got = 0;
    do {
        got = ::read(reportRead.get(), &error, sizeof error);
    } while (got < 0 && errno == EINTR);
    if (got == static_cast<ssize_t>(sizeof error)) {
        fail(cannot, error);
    }
    return engine;
}

EngineProcess EngineProcess::connect(const std::string& path) {
    const std::string cannot = "cannot connect to '" + path + "'";
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (path.empty() || path.size() >= sizeof address.sun_path) {
        throw Failure(ExitCode::Stream,
                      cannot + ": a socket's path has 1 to " + std::to_string(sizeof address.sun_path - 1) + " bytes");
    }
    path.copy(address.sun_path, path.size());
    posix::OwnedDescriptor stream(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (!stream) {
        fail(cannot, errno);
    }
    if (::connect(stream.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
        fail(cannot, errno);
    }
    ucred peer{};
    socklen_t length = sizeof peer;
    if (::getsockopt(stream.get(), SOL_SOCKET, SO_PEERCRED, &peer, &length) != 0) {
        fail(cannot, errno);
    }
    // The kernel names whoever listened. That is root where the system's service manager holds the socket.
    if (peer.uid != ::geteuid() && peer.uid != 0) {
        throw Failure(ExitCode::Stream, cannot + ": the engine there runs as user " + std::to_string(peer.uid) +
                                            ", not as user " + std::to_string(::geteuid()) + " as this program does");
    }
    return EngineProcess(-1, posix::OwnedDescriptor(), std::move(stream));
}

EngineProcess EngineProcess::connect(const TlsAddress& address) {
    auto relay = std::make_unique<TlsRelay>(address);
    EngineProcess engine(-1, posix::OwnedDescriptor(), posix::OwnedDescriptor(relay->takeStream()));
    engine.relay_ = std::move(relay);
    return engine;
}

std::optional<EngineEnd> EngineProcess::waitForEnd(std::chrono::milliseconds patience) {
    if (pid_ <= 0 || end_) {
        return end_;
    }
    const auto deadline = std::chrono::steady_clock::now() + patience;
    pollfd watched{pidfd_.get(), POLLIN, 0};
    for (;;) {
        const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
        const int ready = ::poll(&watched, 1, left.count() > 0 ? static_cast<int>(left.count()) : 0);
        if (ready == 0) {
            return std::nullopt;
        }
        if (ready > 0) {
            break;
        }
        if (errno != EINTR) {
            return std::nullopt;
        }
    }
    siginfo_t info{};
    if (::waitid(P_PIDFD, static_cast<id_t>(pidfd_.get()), &info, WEXITED | WNOHANG) == 0 && info.si_pid == pid_) {
        end_ = EngineEnd{info.si_code != CLD_EXITED, info.si_status};
    }
    return end_;
}

void EngineProcess::takeTerminalBack() noexcept {
    if (loan_) {
        loan_->takeBack();
    }
}

void EngineProcess::kill() noexcept {
    if (pid_ <= 0 || end_) {
        return;
    }
    // Not yet reaped, so the number still belongs to the child.
    ::kill(loan_ ? -pid_ : pid_, SIGKILL);
    int status = 0;
    while (::waitpid(pid_, &status, 0) < 0 && errno == EINTR) {
    }
    end_ = WIFSIGNALED(status) ? EngineEnd{true, WTERMSIG(status)} : EngineEnd{false, WEXITSTATUS(status)};
}

std::vector<std::string> defaultEngineCommand() {
    std::error_code error;
    const auto self = std::filesystem::read_symlink("/proc/self/exe", error);
    if (!error) {
        const auto beside = self.parent_path() / "krutil-qvm";
        if (::access(beside.c_str(), X_OK) == 0) {
            return {beside.string(), "--stdio"};
        }
    }
    return {"krutil-qvm", "--stdio"};
}

}  // namespace krutil_client
