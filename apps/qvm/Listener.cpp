#include "qvm/Listener.hpp"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/signalfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <set>
#include <stdexcept>
#include <system_error>
#include <utility>
#include <vector>

#include "common/Build.hpp"
#include "common/KrutilSession.hpp"
#include "common/Precheck.hpp"
#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "foundation/msg_svc/transport/layers/session/Session.hpp"
#include "qvm/process/AppendFile.hpp"
#include "qvm/process/StandardDescriptors.hpp"
#include "qvm/python/PythonStart.hpp"

namespace qvm {
namespace {

namespace posix = foundation::core::posix;
namespace session_layer = foundation::msg_svc::transport::layers::session;

// How long sessions have to end after they were told to.
constexpr std::chrono::seconds sessionPatience{2};

// How long a client waits that could not be accepted, until that is tried again. The end of a session shortens it.
constexpr int acceptPauseMilliseconds = 1000;

[[noreturn]] void fail(const std::string& what) {
    throw std::runtime_error(what);
}

[[noreturn]] void failWithErrno(const std::string& what) {
    fail(what + ": " + std::generic_category().message(errno));
}

std::string octal(mode_t mode) {
    std::array<char, 8> text{};
    std::snprintf(text.data(), text.size(), "%04o", mode & 07777U);
    return text.data();
}

// Opens the directory for its lock, after making sure that nobody else can put anything into it. Other users may pass
// through it if some of them are admitted.
int openOwnDirectory(const std::string& path, bool othersPass) {
    if (::mkdir(path.c_str(), othersPass ? 0711 : 0700) != 0 && errno != EEXIST) {
        failWithErrno("Cannot create the directory \"" + path + "\"");
    }
    const int directory = ::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    if (directory < 0) {
        failWithErrno("Cannot open the directory \"" + path + "\" (a symbolic link is not accepted)");
    }
    struct stat status {};
    std::string problem;
    if (::fstat(directory, &status) != 0) {
        problem = "cannot be examined";
    } else if (status.st_uid != ::geteuid()) {
        problem = "belongs to user " + std::to_string(status.st_uid) + ", not to " + std::to_string(::geteuid());
    } else if ((status.st_mode & (othersPass ? 022U : 077U)) != 0) {
        problem = "is open to other users (mode " + octal(status.st_mode) + ", expected " +
                  (othersPass ? "0711" : "0700") + ")";
    }
    if (!problem.empty()) {
        ::close(directory);
        fail("The directory \"" + path + "\" " + problem + ": put the socket into a directory of your own.");
    }
    return directory;
}

sockaddr_un addressOf(const std::string& path) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (path.size() >= sizeof(address.sun_path)) {
        fail("The socket's path \"" + path + "\" has " + std::to_string(path.size()) + " bytes; the system allows " +
             std::to_string(sizeof(address.sun_path) - 1) + ".");
    }
    std::memcpy(address.sun_path, path.data(), path.size());
    return address;
}

int newSocket() {
    const int descriptor = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
    if (descriptor < 0) {
        failWithErrno("Cannot make a socket");
    }
    return descriptor;
}

bool somebodyAnswers(const sockaddr_un& address) {
    const posix::OwnedDescriptor probe(newSocket());
    // EAGAIN: a listener whose backlog is full.
    return ::connect(probe.get(), reinterpret_cast<const sockaddr*>(&address), sizeof(address)) == 0 || errno == EAGAIN;
}

// Whether the system lacks what every accept needs, whoever waits.
bool isShortage(int error) noexcept {
    return error == EMFILE || error == ENFILE || error == ENOBUFS || error == ENOMEM;
}

// Those that end the engine are not among them if whoever started it has had them ignored.
sigset_t watchedSignals() {
    sigset_t signals;
    ::sigemptyset(&signals);
    ::sigaddset(&signals, SIGCHLD);
    for (const int number : {SIGTERM, SIGINT, SIGHUP}) {
        struct sigaction handling {};
        if (::sigaction(number, nullptr, &handling) == 0 && handling.sa_handler != SIG_IGN) {
            ::sigaddset(&signals, number);
        }
    }
    return signals;
}

}  // namespace

Listener::Listener(const Options& options, Log& log) : Listener(options, log, -1) {}

Listener::Listener(const Options& options, Log& log, int socket)
    : options_(options),
      log_(log),
      users_(options.allowUsers),
      socket_(socket >= 0 ? socket : newSocket()),
      seats_(options.maxSessions) {
    // Before Python takes SIGINT: one that comes now is for this process, not for the code of a session.
    const sigset_t watched = watchedSignals();
    ::sigprocmask(SIG_BLOCK, &watched, nullptr);
    try {
        if (options_.sessionProcesses > 0) {
            groups_.emplace(options_.sessionProcesses);
        }
        preparePython(options_.python);
        // Made once, before sessions are forked.
        apps::precheck(!options_.noPrecheck);
        // Each session opens it again. What is wrong with it is said here, and not to each client.
        const AppendFile diary(options_.diary, {});
        // The signals are blocked: without this, only SIGKILL would end the engine.
        signals_ = ::signalfd(-1, &watched, SFD_CLOEXEC | SFD_NONBLOCK);
        if (signals_ < 0) {
            failWithErrno("Cannot watch for signals");
        }
        if (socket < 0) {
            bindSocket();
        } else if (::fcntl(socket, F_SETFL, O_NONBLOCK) != 0) {
            failWithErrno("Cannot use the socket");
        }
    } catch (...) {
        ::close(socket_);
        if (signals_ >= 0) {
            ::close(signals_);
        }
        throw;
    }
}

Listener::~Listener() {
    if (connection_ >= 0) {
        return;
    }
    ::close(socket_);
    ::close(signals_);
    // Another engine may have taken the path over after someone removed the file. One that cannot be looked at is this
    // one's: nobody else had a reason to replace it.
    struct stat status {};
    if (::lstat(options_.listen.c_str(), &status) != 0 || status.st_ino == inode_) {
        ::unlink(options_.listen.c_str());
    }
}

void Listener::bindSocket() {
    const std::string& path = options_.listen;
    const sockaddr_un address = addressOf(path);
    const std::filesystem::path parent = std::filesystem::path(path).parent_path();
    const posix::OwnedDescriptor directory(
        openOwnDirectory(parent.empty() ? "." : parent.string(), users_.areSeveral()));
    // Two engines that start at the same time must not both find a dead socket and remove each other's.
    if (::flock(directory.get(), LOCK_EX) != 0) {
        failWithErrno("Cannot lock the directory of \"" + path + "\"");
    }
    struct stat status {};
    if (::lstat(path.c_str(), &status) == 0) {
        if (!S_ISSOCK(status.st_mode)) {
            fail("\"" + path + "\" exists and is not a socket.");
        }
        if (somebodyAnswers(address)) {
            fail("Another engine serves \"" + path + "\" already.");
        }
        ::unlink(path.c_str());
    }
    // Whoever reaches it is asked who they are.
    const mode_t before = ::umask(users_.areSeveral() ? 0111 : 0177);
    const int bound = ::bind(socket_, reinterpret_cast<const sockaddr*>(&address), sizeof(address));
    ::umask(before);
    if (bound != 0 || ::listen(socket_, SOMAXCONN) != 0 || ::lstat(path.c_str(), &status) != 0) {
        const int error = errno;
        if (bound == 0) {
            ::unlink(path.c_str());
        }
        errno = error;
        failWithErrno("Cannot serve \"" + path + "\"");
    }
    inode_ = status.st_ino;
}

ExitCode Listener::run() {
    log_.say("serving " + (options_.listenFds ? std::string("the socket of the service manager") : options_.listen));
    for (;;) {
        const bool waiting = awaitSomething();
        signalfd_siginfo signal{};
        while (::read(signals_, &signal, sizeof(signal)) == static_cast<ssize_t>(sizeof(signal))) {
            if (signal.ssi_signo == SIGCHLD) {
                reap();
                continue;
            }
            endSessions();
            return ExitCode::Ok;
        }
        for (const std::string& refusal : seats_.answer(Seats::Clock::now())) {
            sayRefused(": " + refusal);
        }
        if (waiting) {
            acceptOrMakeRoom();
        }
        if (connection_ >= 0) {
            Engine engine(options_, log_, &*seat_);
            return engine.run(connection_, connection_);
        }
    }
}

// Returns whether a client may be waiting that can be served, or that another one has to give way to.
bool Listener::awaitSomething() {
    // The socket stays readable while clients wait, so it is not watched while none can be accepted.
    const bool paused = failedAccepts_ > 0;
    bool watching = !paused;
    int milliseconds = paused ? acceptPauseMilliseconds : -1;
    if (!paused && !seats_.hasRoomForHandshake()) {
        const auto next = seats_.nextWithdrawal();
        const auto left = next ? std::chrono::ceil<std::chrono::milliseconds>(*next - Seats::Clock::now()).count() : -1;
        watching = next && left <= 0;
        milliseconds = watching ? -1 : static_cast<int>(left);
    }
    std::vector<pollfd> watched{{signals_, POLLIN, 0}, {watching ? socket_ : -1, POLLIN, 0}};
    seats_.appendTo(watched);
    if (::poll(watched.data(), watched.size(), milliseconds) < 0 && errno != EINTR) {
        failWithErrno("Cannot wait for clients");
    }
    return paused || watched[1].revents != 0;
}

void Listener::acceptOrMakeRoom() {
    if (seats_.hasRoomForHandshake()) {
        accept();
    } else if (const auto next = seats_.nextWithdrawal(); next && *next <= Seats::Clock::now()) {
        sayRefused(": its handshake was the oldest of " + std::to_string(Seats::maxHandshakes) + " unfinished ones");
        seats_.withdrawOldest();
    }
}

void Listener::accept() {
    // Made before, so that a client waits where there is a descriptor for it and none for this.
    std::array<int, 2> line{-1, -1};
    const bool ready = ::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, line.data()) == 0;
    posix::OwnedDescriptor ours(line[0]);
    posix::OwnedDescriptor theirs(line[1]);
    const int connection = ready ? ::accept4(socket_, nullptr, nullptr, SOCK_CLOEXEC) : -1;
    if (connection < 0 && isShortage(errno)) {
        if (failedAccepts_ == 0) {
            log_.say("cannot accept a client: " + std::generic_category().message(errno) + "; clients wait meanwhile");
        }
        ++failedAccepts_;
        return;
    }
    if (failedAccepts_ > 0) {
        log_.say("clients are accepted again after " + std::to_string(failedAccepts_) + " failed attempts");
        failedAccepts_ = 0;
    }
    if (connection < 0) {
        // The client has gone again.
        return;
    }
    if (const std::string refusal = users_.refusal(connection); !refusal.empty()) {
        sayRefused(refusal);
        ::close(connection);
        return;
    }
    if (seats_.areTaken(Seats::Clock::now())) {
        sayRefused(": " + std::to_string(options_.maxSessions) + " sessions are open (--max-sessions)");
        refuse(connection, fullOfSessions(options_.maxSessions));
        return;
    }
    serve(connection, std::move(ours), std::move(theirs));
}

// Starts a process for the session, to which a line leads.
void Listener::serve(int connection, posix::OwnedDescriptor ours, posix::OwnedDescriptor theirs) {
    const pid_t child = forkPrepared();
    if (child < 0) {
        const std::string why = "no process for its session: " + std::generic_category().message(errno);
        sayRefused(": " + why);
        refuse(connection, "it has " + why + "; try again later");
        return;
    }
    if (child > 0) {
        seats_.add(child, std::move(ours));
        if (groups_) {
            groups_->begun(child);
        }
        ::close(connection);
        return;
    }
    // What code sends to its process group is for this session alone, and it has no terminal.
    ::setsid();
    ::close(socket_);
    ::close(signals_);
    seats_.forget();
    const sigset_t watched = watchedSignals();
    ::sigprocmask(SIG_UNBLOCK, &watched, nullptr);
    log_.startOver();
    connection_ = connection;
    seat_.emplace(std::move(theirs), options_.maxSessions, Seats::maxHandshakes, options_.handshakeTimeout);
    if (groups_) {
        groups_->join();
    }
}

void Listener::refuse(int connection, const std::string& refusal) {
    auto config = apps::krutilSession(session_layer::Role::Engine);
    config.build = apps::buildString("krutil-qvm");
    config.limits = options_.limits;
    session_layer::Session::refuse(connection, config, refusal);
}

void Listener::sayRefused(const std::string& why) {
    if (const auto leftOut = refusals_.ask(apps::RateLimit::Clock::now())) {
        log_.say("refused a client" + why +
                 (*leftOut > 0 ? "; " + std::to_string(*leftOut) + " earlier refusals were left out" : ""));
    }
}

void Listener::countSilent() {
    if (const auto leftOut = silent_.ask(apps::RateLimit::Clock::now())) {
        log_.say("a client connected and left without a word, as health checks do" +
                 (*leftOut > 0 ? "; " + std::to_string(*leftOut) + " did so before" : ""));
    }
}

void Listener::reap() {
    int status = 0;
    for (;;) {
        const pid_t child = ::waitpid(-1, &status, WNOHANG);
        if (child <= 0) {
            return;
        }
        seats_.remove(child);
        if (groups_) {
            groups_->ended(child);
        }
        if (WIFEXITED(status) && WEXITSTATUS(status) == static_cast<int>(ExitCode::Silent)) {
            countSilent();
        }
        if (WIFSIGNALED(status)) {
            log_.say("the session of process " + std::to_string(child) + " was ended by signal " +
                     std::to_string(WTERMSIG(status)) + " (" + ::strsignal(WTERMSIG(status)) + ")");
        }
    }
}

void Listener::endSessions() {
    std::set<pid_t> sessions = seats_.processes();
    for (const pid_t child : sessions) {
        ::kill(child, SIGTERM);
    }
    const sigset_t childSignal = [] {
        sigset_t signals;
        ::sigemptyset(&signals);
        ::sigaddset(&signals, SIGCHLD);
        return signals;
    }();
    const auto deadline = std::chrono::steady_clock::now() + sessionPatience;
    const auto reapQuietly = [&sessions] {
        for (;;) {
            const pid_t child = ::waitpid(-1, nullptr, WNOHANG);
            if (child <= 0) {
                return;
            }
            sessions.erase(child);
        }
    };
    reapQuietly();
    while (!sessions.empty() && std::chrono::steady_clock::now() < deadline) {
        const timespec wait{0, 50'000'000};
        ::sigtimedwait(&childSignal, nullptr, &wait);
        reapQuietly();
    }
    for (const pid_t child : sessions) {
        ::kill(child, SIGKILL);
        ::waitpid(child, nullptr, 0);
    }
}

}  // namespace qvm
