#include "programs/support/Relay.hpp"

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <system_error>
#include <vector>

#include "support/Patience.hpp"

namespace programs_test {
namespace {

using test_support::patience;

int checked(int result, const char* what) {
    if (result < 0) {
        throw std::system_error(errno, std::generic_category(), what);
    }
    return result;
}

int newSocket() {
    return checked(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0), "socket");
}

sockaddr_un addressOf(const std::string& path) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    path.copy(address.sun_path, sizeof address.sun_path - 1);
    return address;
}

bool sendAll(int to, const char* data, std::size_t size) {
    while (size > 0) {
        const auto sent = ::send(to, data, size, MSG_NOSIGNAL);
        if (sent < 0) {
            return false;
        }
        data += sent;
        size -= static_cast<std::size_t>(sent);
    }
    return true;
}

}  // namespace

Relay::Relay(const std::string& path, const std::string& engine)
    : path_(path), enginePath_(engine), listening_(newSocket()) {
    const sockaddr_un address = addressOf(path_);
    checked(::bind(listening_, reinterpret_cast<const sockaddr*>(&address), sizeof address), "bind");
    checked(::listen(listening_, 1), "listen");
    for (Direction& each : directions_) {
        each.wake = checked(::eventfd(0, EFD_CLOEXEC), "eventfd");
    }
    thread_ = std::thread([this] { acceptAndPass(); });
}

Relay::~Relay() {
    cut();
    // Ends a wait for a client that has not come.
    ::shutdown(listening_, SHUT_RDWR);
    thread_.join();
    for (const int descriptor : {listening_, client_, engine_, directions_[0].wake, directions_[1].wake}) {
        if (descriptor >= 0) {
            ::close(descriptor);
        }
    }
    ::unlink(path_.c_str());
}

void Relay::passInPieces(std::size_t bytes) {
    const std::lock_guard lock(mutex_);
    piece_ = bytes;
}

void Relay::passAtMost(Way way, std::uint64_t bytes) {
    const std::lock_guard lock(mutex_);
    direction(way).limit = bytes;
    ::eventfd_write(direction(way).wake, 1);
}

void Relay::hold(Way way) {
    const std::lock_guard lock(mutex_);
    direction(way).limit = 0;
    ::eventfd_write(direction(way).wake, 1);
}

void Relay::record() {
    const std::lock_guard lock(mutex_);
    recording_ = true;
}

std::string Relay::recorded(Way way) {
    const std::lock_guard lock(mutex_);
    return direction(way).recorded;
}

void Relay::holdAfterFrame(Way way, const std::string& tag) {
    const std::lock_guard lock(mutex_);
    direction(way).lastTag = tag;
    direction(way).lookFrom = direction(way).recorded.size();
}

void Relay::waitUntilHeld(Way way) {
    std::unique_lock lock(mutex_);
    const Direction& each = direction(way);
    EXPECT_TRUE(passed_.wait_for(lock, patience, [&each] { return each.passed >= each.limit; }))
        << each.passed << " of " << each.limit << " bytes have passed";
}

void Relay::cut() {
    const std::lock_guard lock(mutex_);
    cut_ = true;
    ::shutdown(client_, SHUT_RDWR);
    ::shutdown(engine_, SHUT_RDWR);
    for (const Direction& each : directions_) {
        ::eventfd_write(each.wake, 1);
    }
}

void Relay::end(Way way) {
    const std::lock_guard lock(mutex_);
    ::shutdown(way == Way::ToEngine ? engine_ : client_, SHUT_WR);
}

void Relay::acceptAndPass() {
    const int client = ::accept4(listening_, nullptr, nullptr, SOCK_CLOEXEC);
    if (client < 0) {
        return;
    }
    const int engine = newSocket();
    {
        const std::lock_guard lock(mutex_);
        client_ = client;
        engine_ = engine;
    }
    const sockaddr_un address = addressOf(enginePath_);
    if (::connect(engine, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
        cut();
        return;
    }
    std::thread back([=, this] { pass(Way::ToClient, engine, client); });
    pass(Way::ToEngine, client, engine);
    back.join();
}

std::size_t Relay::allowed(Way way) {
    const std::lock_guard lock(mutex_);
    const Direction& each = direction(way);
    return each.limit > each.passed ? std::min<std::uint64_t>(each.limit - each.passed, piece_) : 0;
}

// How many of the bytes that wait may pass, now that they are known.
std::size_t Relay::look(Way way, std::string_view waiting) {
    const std::lock_guard lock(mutex_);
    Direction& each = direction(way);
    if (!each.lastTag.empty()) {
        const std::string known = each.recorded + std::string(waiting);
        // The size of the content stands before the tag.
        std::uint64_t content = 0;
        const auto tag = known.find(each.lastTag, each.lookFrom + sizeof content);
        if (tag != std::string::npos) {
            std::memcpy(&content, known.data() + tag - sizeof content, sizeof content);
            each.limit = each.passed + tag + each.lastTag.size() + content - each.recorded.size();
            each.lastTag.clear();
        }
    }
    return each.limit > each.passed ? std::min<std::uint64_t>(each.limit - each.passed, waiting.size()) : 0;
}

void Relay::pass(Way way, int from, int to) {
    std::vector<char> buffer(1U << 16);
    for (;;) {
        const std::size_t most = std::min(allowed(way), buffer.size());
        // One that may pass nothing still sees that its end has gone.
        std::array<pollfd, 2> watched{pollfd{direction(way).wake, POLLIN, 0},
                                      pollfd{from, static_cast<short>(most > 0 ? POLLIN : 0), 0}};
        ::poll(watched.data(), watched.size(), -1);
        if (watched[0].revents != 0) {
            eventfd_t ignored = 0;
            ::eventfd_read(watched[0].fd, &ignored);
        }
        {
            const std::lock_guard lock(mutex_);
            if (cut_) {
                return;
            }
        }
        if (watched[1].revents == 0) {
            continue;
        }
        auto got = most > 0 ? ::recv(from, buffer.data(), most, MSG_PEEK) : 0;
        if (got > 0) {
            const std::size_t may = look(way, {buffer.data(), static_cast<std::size_t>(got)});
            if (may == 0) {
                continue;
            }
            got = ::recv(from, buffer.data(), may, 0);
            // Before anybody can act on it.
            const std::lock_guard lock(mutex_);
            if (recording_ && got > 0) {
                direction(way).recorded.append(buffer.data(), static_cast<std::size_t>(got));
            }
        }
        if (got <= 0) {
            cut();
            return;
        }
        if (!sendAll(to, buffer.data(), static_cast<std::size_t>(got))) {
            // That end has gone. What it has said before passes yet, and then the other direction cuts.
            return;
        }
        const std::lock_guard lock(mutex_);
        direction(way).passed += static_cast<std::uint64_t>(got);
        passed_.notify_all();
    }
}

}  // namespace programs_test
