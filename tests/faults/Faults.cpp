// A library to be loaded before others (LD_PRELOAD): system calls of this project's own code go wrong as they are told.
//
// KRUTIL_FAULTS is "PROGRAM RULE ARGUMENT...", and counts in processes of that program only:
//
//     list FILE             appends each call site, when it is first used, to the file: CALL@MODULE+OFFSET, a line each
//     once SITE ERRNO       the first call of the site fails
//     later SITE ERRNO      its third call fails
//     always SITE ERRNO     every call of the site fails
//     short                 a call that reads or writes bytes moves one
//     interrupted           every other call that may wait fails with EINTR
//     narrow                sockets and pipes take as little as the kernel lets them, so that they are full most of the
//     time
//
// KRUTIL_FAULTS_IN says which processes: "first" are those that began with the program, "forked" those that it has
// forked. Without it, both. Each process that is forked counts its own calls.
//
// A call site is the address to which the call returns, counted from the start of its module.
#include <dlfcn.h>
#include <fcntl.h>
#include <poll.h>
#include <pthread.h>
#include <signal.h>
#include <sys/epoll.h>
#include <sys/file.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <sys/signalfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/uio.h>
#include <sys/wait.h>
#include <termios.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdarg>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <mutex>
#include <optional>
#include <set>
#include <sstream>
#include <string>
#include <string_view>
#include <type_traits>

namespace {

// What KRUTIL_FAULTS says; never destroyed, because calls come to the very end.
class Rule {
  public:
    static Rule& get() {
        static Rule& rule = *new Rule;
        return rule;
    }

    // 0, or the error with which a call has to fail.
    int errorOf(std::string_view call, const void* returnsTo) {
        if ((kind_ != "list" && kind_ != "once" && kind_ != "later" && kind_ != "always") ||
            (in_ == "first" && ::getpid() != first_) || (in_ == "forked" && ::getpid() == first_)) {
            return 0;
        }
        const std::optional<Dl_info> module = ownModule(returnsTo);
        if (!module) {
            return 0;
        }
        const std::string site = siteOf(call, returnsTo, *module);
        if (kind_ == "list") {
            list(site);
            return 0;
        }
        const bool fails = site == argument_ && (kind_ == "always" || calls_++ == (kind_ == "once" ? 0 : 2));
        return fails ? error_ : 0;
    }

    bool shortens(const void* returnsTo) const { return kind_ == "short" && ownModule(returnsTo); }
    bool interrupts(const char* call, const void* returnsTo) {
        return kind_ == "interrupted" && ownModule(returnsTo) && everyOther(call);
    }
    bool isNarrow() const noexcept { return kind_ == "narrow"; }

  private:
    Rule() {
        const char* const text = std::getenv("KRUTIL_FAULTS");
        std::istringstream words(text == nullptr ? "" : text);
        std::string program;
        words >> program;
        if (program == program_invocation_short_name) {
            words >> kind_ >> argument_ >> error_;
        }
        if (const char* const in = std::getenv("KRUTIL_FAULTS_IN"); in != nullptr) {
            in_ = in;
        }
    }

    // Where the call returns to, in this project's own code or in the streams of the standard library by which it
    // writes files; nothing for a call of anybody else.
    static std::optional<Dl_info> ownModule(const void* returnsTo) {
        Dl_info info;
        if (::dladdr(returnsTo, &info) == 0 || info.dli_fname == nullptr) {
            return std::nullopt;
        }
        const std::string_view name = nameOf(info);
        const bool ours =
            (name.starts_with("krutil") || name.starts_with("libkrutil") || name.starts_with("libstdc++")) &&
            name != "libkrutil_faults.so";
        return ours ? std::optional(info) : std::nullopt;
    }

    static std::string_view nameOf(const Dl_info& module) {
        const std::string_view path(module.dli_fname);
        return path.substr(path.rfind('/') + 1);
    }

    static std::string siteOf(std::string_view call, const void* returnsTo, const Dl_info& module) {
        std::ostringstream site;
        site << call << '@' << nameOf(module) << '+' << std::hex
             << static_cast<const char*>(returnsTo) - static_cast<const char*>(module.dli_fbase);
        return site.str();
    }

    void list(const std::string& site) {
        const std::lock_guard lock(mutex_);
        if (sites_.insert(site).second) {
            std::FILE* const file = std::fopen(argument_.c_str(), "ae");
            std::fprintf(file, "%s\n", site.c_str());
            std::fclose(file);
        }
    }

    // Of each call, so that a loop of two calls gets on.
    static bool everyOther(const char* call) {
        thread_local std::map<std::string_view, bool> last;
        return last[call] = !last[call];
    }

    std::string kind_;
    std::string argument_;
    int error_ = 0;
    std::string in_;
    // The first call comes before any fork: a program opens files when it begins.
    const pid_t first_ = ::getpid();
    std::atomic<unsigned> calls_{0};
    std::mutex mutex_;
    std::set<std::string> sites_;
};

template <typename Result, typename... Parameters, typename... Arguments>
Result callUnlessFailing(const char* call, const void* returnsTo, Result (*function)(Parameters...),
                         Arguments... arguments) {
    if (const int error = Rule::get().errorOf(call, returnsTo); error != 0) {
        errno = error;
        if constexpr (std::is_same_v<Result, void*>) {
            return MAP_FAILED;
        } else if constexpr (std::is_pointer_v<Result>) {
            return nullptr;
        } else {
            return -1;
        }
    }
    return function(arguments...);
}

bool isInterrupted(const char* call, const void* returnsTo) {
    errno = EINTR;
    return Rule::get().interrupts(call, returnsTo);
}

// A call that moves bytes; it never waits where the descriptor is nonblocking.
bool isInterrupted(const char* call, const void* returnsTo, int descriptor) {
    return (::fcntl(descriptor, F_GETFL) & O_NONBLOCK) == 0 && isInterrupted(call, returnsTo);
}

// Makes both ends take little, when they have been made.
int narrowed(int result, const int* pair) {
    if (result == 0 && Rule::get().isNarrow()) {
        for (int i = 0; i < 2; ++i) {
            const int least = 1;
            if (::setsockopt(pair[i], SOL_SOCKET, SO_SNDBUF, &least, sizeof least) != 0) {
                ::fcntl(pair[i], F_SETPIPE_SZ, least);
            }
        }
    }
    return result;
}

// Whether bytes go through the descriptor. Counters, timers and signals come whole, and do not fail.
bool hasBytes(int descriptor) {
    struct stat status {};
    return ::fstat(descriptor, &status) == 0 && (status.st_mode & S_IFMT) != 0;
}

std::size_t shortened(const void* returnsTo, int descriptor, std::size_t size) {
    return Rule::get().shortens(returnsTo) && hasBytes(descriptor) ? std::min<std::size_t>(size, 1) : size;
}

// The pieces of memory that a call may use.
struct Pieces {
    Pieces(const void* returnsTo, int descriptor, const iovec* pieces, std::size_t many) : first(pieces), count(many) {
        const iovec* const used =
            std::find_if(pieces, pieces + many, [](const iovec& piece) { return piece.iov_len > 0; });
        if (used != pieces + many && Rule::get().shortens(returnsTo) && hasBytes(descriptor)) {
            oneByte = {used->iov_base, 1};
            first = &oneByte;
            count = 1;
        }
    }
    Pieces(const Pieces&) = delete;
    Pieces& operator=(const Pieces&) = delete;

    iovec oneByte{nullptr, 0};
    const iovec* first;
    std::size_t count;
};

}  // namespace

#define KRUTIL_RETURNS_TO __builtin_return_address(0)

// Calls the next library's function of that name, with these arguments, unless it has to fail.
#define KRUTIL_CALL(name, ...) \
    callUnlessFailing(#name, KRUTIL_RETURNS_TO, originalOf##name() __VA_OPT__(, ) __VA_ARGS__)

// The same for a call that moves bytes.
#define KRUTIL_MOVE(name, descriptor, ...) \
    (hasBytes(descriptor) ? KRUTIL_CALL(name, descriptor, __VA_ARGS__) : originalOf##name()(descriptor, __VA_ARGS__))

#define KRUTIL_ORIGINAL(result, name, ...)                                                        \
    static auto originalOf##name() {                                                              \
        using Function = result(__VA_ARGS__);                                                     \
        static Function* const function = reinterpret_cast<Function*>(::dlsym(RTLD_NEXT, #name)); \
        return function;                                                                          \
    }

KRUTIL_ORIGINAL(int, socket, int, int, int)
extern "C" int socket(int domain, int type, int protocol) {
    return KRUTIL_CALL(socket, domain, type, protocol);
}

KRUTIL_ORIGINAL(int, bind, int, const sockaddr*, socklen_t)
extern "C" int bind(int descriptor, const sockaddr* address, socklen_t size) {
    return KRUTIL_CALL(bind, descriptor, address, size);
}

KRUTIL_ORIGINAL(int, listen, int, int)
extern "C" int listen(int descriptor, int backlog) {
    return KRUTIL_CALL(listen, descriptor, backlog);
}

KRUTIL_ORIGINAL(int, accept4, int, sockaddr*, socklen_t*, int)
extern "C" int accept4(int descriptor, sockaddr* address, socklen_t* size, int flags) {
    return KRUTIL_CALL(accept4, descriptor, address, size, flags);
}

KRUTIL_ORIGINAL(int, getsockopt, int, int, int, void*, socklen_t*)
extern "C" int getsockopt(int descriptor, int level, int option, void* value, socklen_t* size) {
    return KRUTIL_CALL(getsockopt, descriptor, level, option, value, size);
}

KRUTIL_ORIGINAL(int, connect, int, const sockaddr*, socklen_t)
extern "C" int connect(int descriptor, const sockaddr* address, socklen_t size) {
    return KRUTIL_CALL(connect, descriptor, address, size);
}

// Of the commands, those that make a descriptor; the others only look, or cannot fail for a descriptor that is there.
KRUTIL_ORIGINAL(int, fcntl, int, int, void*)
extern "C" int fcntl(int descriptor, int command, ...) {
    va_list arguments;
    va_start(arguments, command);
    void* const argument = va_arg(arguments, void*);
    va_end(arguments);
    return command == F_DUPFD_CLOEXEC ? KRUTIL_CALL(fcntl, descriptor, command, argument)
                                      : originalOffcntl()(descriptor, command, argument);
}

// What changes a descriptor's entry cannot fail. Nor does this one for what Asio adds for itself, without a look at the
// result; it asks for EPOLLHUP where it adds others.
KRUTIL_ORIGINAL(int, epoll_ctl, int, int, int, epoll_event*)
extern "C" int epoll_ctl(int descriptor, int operation, int watched, epoll_event* event) {
    return operation == EPOLL_CTL_ADD && (event->events & EPOLLHUP) != 0
               ? KRUTIL_CALL(epoll_ctl, descriptor, operation, watched, event)
               : originalOfepoll_ctl()(descriptor, operation, watched, event);
}

KRUTIL_ORIGINAL(int, timer_create, clockid_t, sigevent*, timer_t*)
extern "C" int timer_create(clockid_t clock, sigevent* event, timer_t* timer) {
    return KRUTIL_CALL(timer_create, clock, event, timer);
}

KRUTIL_ORIGINAL(int, lstat, const char*, struct stat*)
extern "C" int lstat(const char* path, struct stat* status) {
    return KRUTIL_CALL(lstat, path, status);
}

KRUTIL_ORIGINAL(int, signalfd, int, const sigset_t*, int)
extern "C" int signalfd(int descriptor, const sigset_t* signals, int flags) {
    return KRUTIL_CALL(signalfd, descriptor, signals, flags);
}

KRUTIL_ORIGINAL(int, flock, int, int)
extern "C" int flock(int descriptor, int operation) {
    return KRUTIL_CALL(flock, descriptor, operation);
}

KRUTIL_ORIGINAL(int, fchmod, int, mode_t)
extern "C" int fchmod(int descriptor, mode_t mode) {
    return KRUTIL_CALL(fchmod, descriptor, mode);
}

KRUTIL_ORIGINAL(int, setrlimit, __rlimit_resource_t, const rlimit*)
extern "C" int setrlimit(__rlimit_resource_t resource, const rlimit* limit) noexcept {
    return KRUTIL_CALL(setrlimit, resource, limit);
}

KRUTIL_ORIGINAL(int, madvise, void*, std::size_t, int)
extern "C" int madvise(void* memory, std::size_t size, int advice) {
    return KRUTIL_CALL(madvise, memory, size, advice);
}

KRUTIL_ORIGINAL(std::FILE*, fopen, const char*, const char*)
extern "C" std::FILE* fopen(const char* path, const char* mode) {
    return KRUTIL_CALL(fopen, path, mode);
}

KRUTIL_ORIGINAL(std::FILE*, fdopen, int, const char*)
extern "C" std::FILE* fdopen(int descriptor, const char* mode) {
    return KRUTIL_CALL(fdopen, descriptor, mode);
}

KRUTIL_ORIGINAL(int, mkostemp, char*, int)
extern "C" int mkostemp(char* name, int flags) {
    return KRUTIL_CALL(mkostemp, name, flags);
}

KRUTIL_ORIGINAL(int, tcsetattr, int, int, const termios*)
extern "C" int tcsetattr(int descriptor, int actions, const termios* settings) {
    return KRUTIL_CALL(tcsetattr, descriptor, actions, settings);
}

// What makes the descriptor of a process, which has no function of its own. The others are of the standard library.
KRUTIL_ORIGINAL(long, syscall, long, long, long, long, long, long, long)
extern "C" long syscall(long number, ...) noexcept {
    va_list list;
    va_start(list, number);
    long all[6];
    std::generate(std::begin(all), std::end(all), [&list] { return va_arg(list, long); });
    va_end(list);
    return number == SYS_pidfd_open ? KRUTIL_CALL(syscall, number, all[0], all[1], all[2], all[3], all[4], all[5])
                                    : originalOfsyscall()(number, all[0], all[1], all[2], all[3], all[4], all[5]);
}

// A process's own children can be waited for; only the waiting may be interrupted.
KRUTIL_ORIGINAL(pid_t, waitpid, pid_t, int*, int)
extern "C" pid_t waitpid(pid_t child, int* status, int options) {
    return (options & WNOHANG) == 0 && isInterrupted("waitpid", KRUTIL_RETURNS_TO)
               ? -1
               : originalOfwaitpid()(child, status, options);
}

KRUTIL_ORIGINAL(int, rename, const char*, const char*)
extern "C" int rename(const char* from, const char* to) {
    return KRUTIL_CALL(rename, from, to);
}

KRUTIL_ORIGINAL(int, mkdir, const char*, mode_t)
extern "C" int mkdir(const char* path, mode_t mode) {
    return KRUTIL_CALL(mkdir, path, mode);
}

KRUTIL_ORIGINAL(int, socketpair, int, int, int, int*)
extern "C" int socketpair(int domain, int type, int protocol, int* pair) {
    return narrowed(KRUTIL_CALL(socketpair, domain, type, protocol, pair), pair);
}

KRUTIL_ORIGINAL(int, pipe, int*)
extern "C" int pipe(int* pair) {
    return narrowed(KRUTIL_CALL(pipe, pair), pair);
}

KRUTIL_ORIGINAL(int, pipe2, int*, int)
extern "C" int pipe2(int* pair, int flags) {
    return narrowed(KRUTIL_CALL(pipe2, pair, flags), pair);
}

KRUTIL_ORIGINAL(int, eventfd, unsigned int, int)
extern "C" int eventfd(unsigned int value, int flags) {
    return KRUTIL_CALL(eventfd, value, flags);
}

KRUTIL_ORIGINAL(int, timerfd_create, int, int)
extern "C" int timerfd_create(int clock, int flags) {
    return KRUTIL_CALL(timerfd_create, clock, flags);
}

KRUTIL_ORIGINAL(int, epoll_create1, int)
extern "C" int epoll_create1(int flags) {
    return KRUTIL_CALL(epoll_create1, flags);
}

KRUTIL_ORIGINAL(int, memfd_create, const char*, unsigned int)
extern "C" int memfd_create(const char* name, unsigned int flags) {
    return KRUTIL_CALL(memfd_create, name, flags);
}

KRUTIL_ORIGINAL(int, dup2, int, int)
extern "C" int dup2(int from, int to) {
    return KRUTIL_CALL(dup2, from, to);
}

KRUTIL_ORIGINAL(int, ftruncate, int, off_t)
extern "C" int ftruncate(int descriptor, off_t size) {
    return KRUTIL_CALL(ftruncate, descriptor, size);
}

KRUTIL_ORIGINAL(pid_t, fork)
extern "C" pid_t fork() {
    return KRUTIL_CALL(fork);
}

KRUTIL_ORIGINAL(void*, mmap, void*, std::size_t, int, int, int, off_t)
extern "C" void* mmap(void* at, std::size_t size, int protection, int flags, int descriptor, off_t offset) {
    return KRUTIL_CALL(mmap, at, size, protection, flags, descriptor, offset);
}

KRUTIL_ORIGINAL(int, open, const char*, int, mode_t)
extern "C" int open(const char* path, int flags, ...) {
    va_list arguments;
    va_start(arguments, flags);
    const mode_t mode = va_arg(arguments, mode_t);
    va_end(arguments);
    return KRUTIL_CALL(open, path, flags, mode);
}

KRUTIL_ORIGINAL(int, pthread_create, pthread_t*, const pthread_attr_t*, void* (*)(void*), void*)
extern "C" int pthread_create(pthread_t* thread, const pthread_attr_t* attributes, void* (*start)(void*),
                              void* argument) {
    // This one returns its error.
    const int result = KRUTIL_CALL(pthread_create, thread, attributes, start, argument);
    return result < 0 ? errno : result;
}

KRUTIL_ORIGINAL(int, poll, pollfd*, nfds_t, int)
extern "C" int poll(pollfd* descriptors, nfds_t count, int timeout) {
    return timeout != 0 && isInterrupted("poll", KRUTIL_RETURNS_TO) ? -1
                                                                    : KRUTIL_CALL(poll, descriptors, count, timeout);
}

KRUTIL_ORIGINAL(int, ppoll, pollfd*, nfds_t, const timespec*, const sigset_t*)
extern "C" int ppoll(pollfd* descriptors, nfds_t count, const timespec* timeout, const sigset_t* mask) {
    return isInterrupted("ppoll", KRUTIL_RETURNS_TO) ? -1 : KRUTIL_CALL(ppoll, descriptors, count, timeout, mask);
}

KRUTIL_ORIGINAL(int, epoll_wait, int, epoll_event*, int, int)
extern "C" int epoll_wait(int descriptor, epoll_event* events, int count, int timeout) {
    return isInterrupted("epoll_wait", KRUTIL_RETURNS_TO) ? -1
                                                          : KRUTIL_CALL(epoll_wait, descriptor, events, count, timeout);
}

KRUTIL_ORIGINAL(ssize_t, read, int, void*, std::size_t)
extern "C" ssize_t read(int descriptor, void* bytes, std::size_t size) {
    return isInterrupted("read", KRUTIL_RETURNS_TO, descriptor)
               ? -1
               : KRUTIL_MOVE(read, descriptor, bytes, shortened(KRUTIL_RETURNS_TO, descriptor, size));
}

KRUTIL_ORIGINAL(ssize_t, write, int, const void*, std::size_t)
extern "C" ssize_t write(int descriptor, const void* bytes, std::size_t size) {
    return isInterrupted("write", KRUTIL_RETURNS_TO, descriptor)
               ? -1
               : KRUTIL_MOVE(write, descriptor, bytes, shortened(KRUTIL_RETURNS_TO, descriptor, size));
}

KRUTIL_ORIGINAL(ssize_t, recv, int, void*, std::size_t, int)
extern "C" ssize_t recv(int descriptor, void* bytes, std::size_t size, int flags) {
    return isInterrupted("recv", KRUTIL_RETURNS_TO, descriptor)
               ? -1
               : KRUTIL_MOVE(recv, descriptor, bytes, shortened(KRUTIL_RETURNS_TO, descriptor, size), flags);
}

KRUTIL_ORIGINAL(ssize_t, send, int, const void*, std::size_t, int)
extern "C" ssize_t send(int descriptor, const void* bytes, std::size_t size, int flags) {
    return isInterrupted("send", KRUTIL_RETURNS_TO, descriptor)
               ? -1
               : KRUTIL_MOVE(send, descriptor, bytes, shortened(KRUTIL_RETURNS_TO, descriptor, size), flags);
}

KRUTIL_ORIGINAL(ssize_t, readv, int, const iovec*, int)
extern "C" ssize_t readv(int descriptor, const iovec* pieces, int count) {
    const Pieces some(KRUTIL_RETURNS_TO, descriptor, pieces, static_cast<std::size_t>(count));
    return isInterrupted("readv", KRUTIL_RETURNS_TO, descriptor)
               ? -1
               : KRUTIL_MOVE(readv, descriptor, some.first, static_cast<int>(some.count));
}

KRUTIL_ORIGINAL(ssize_t, writev, int, const iovec*, int)
extern "C" ssize_t writev(int descriptor, const iovec* pieces, int count) {
    const Pieces some(KRUTIL_RETURNS_TO, descriptor, pieces, static_cast<std::size_t>(count));
    return isInterrupted("writev", KRUTIL_RETURNS_TO, descriptor)
               ? -1
               : KRUTIL_MOVE(writev, descriptor, some.first, static_cast<int>(some.count));
}

KRUTIL_ORIGINAL(ssize_t, recvmsg, int, msghdr*, int)
extern "C" ssize_t recvmsg(int descriptor, msghdr* message, int flags) {
    if (isInterrupted("recvmsg", KRUTIL_RETURNS_TO, descriptor)) {
        return -1;
    }
    const Pieces some(KRUTIL_RETURNS_TO, descriptor, message->msg_iov, message->msg_iovlen);
    const msghdr whole = *message;
    message->msg_iov = const_cast<iovec*>(some.first);
    message->msg_iovlen = some.count;
    const ssize_t result = KRUTIL_MOVE(recvmsg, descriptor, message, flags);
    message->msg_iov = whole.msg_iov;
    message->msg_iovlen = whole.msg_iovlen;
    return result;
}

KRUTIL_ORIGINAL(ssize_t, sendmsg, int, const msghdr*, int)
extern "C" ssize_t sendmsg(int descriptor, const msghdr* message, int flags) {
    const Pieces some(KRUTIL_RETURNS_TO, descriptor, message->msg_iov, message->msg_iovlen);
    msghdr shorter = *message;
    shorter.msg_iov = const_cast<iovec*>(some.first);
    shorter.msg_iovlen = some.count;
    return isInterrupted("sendmsg", KRUTIL_RETURNS_TO, descriptor) ? -1
                                                                   : KRUTIL_MOVE(sendmsg, descriptor, &shorter, flags);
}
