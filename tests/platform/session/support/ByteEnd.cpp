#include "platform/session/support/ByteEnd.hpp"

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <utility>

#include "platform/session/support/WireBytes.hpp"

namespace wire {
namespace {

using msg_svc::protobuf::SessionHello;
using msg_svc::protobuf::SessionVerdict;

constexpr int patience = 30'000;

std::uint32_t number(const std::string& bytes, std::size_t position) {
    std::uint32_t value = 0;
    for (std::size_t i = 0; i < 4; ++i) {
        value |= static_cast<std::uint32_t>(static_cast<unsigned char>(bytes.at(position + i))) << (8 * i);
    }
    return value;
}

bool ready(int descriptor, short events) {
    pollfd polled{descriptor, events, 0};
    const bool is = ::poll(&polled, 1, patience) > 0;
    EXPECT_TRUE(is) << "the other end keeps the test waiting";
    return is;
}

}  // namespace

ByteEnd::ByteEnd(int in, int out) : in_(in), out_(out) {}

ByteEnd::~ByteEnd() {
    close();
}

void ByteEnd::close() {
    const int out = std::exchange(out_, -1);
    const int in = std::exchange(in_, -1);
    if (in >= 0) {
        ::close(in);
    }
    if (out >= 0 && out != in) {
        ::close(out);
    }
}

void ByteEnd::closeWriting() {
    ::shutdown(out_, SHUT_WR);
}

void ByteEnd::write(const std::string& bytes) {
    for (std::size_t done = 0; done < bytes.size();) {
        if (!ready(out_, POLLOUT)) {
            return;
        }
        const ssize_t count = ::write(out_, bytes.data() + done, bytes.size() - done);
        if (count < 0) {
            ASSERT_EQ(errno, EPIPE);
            return;
        }
        done += static_cast<std::size_t>(count);
    }
}

std::size_t ByteEnd::writeSome(const std::string& bytes) {
    pollfd polled{out_, POLLOUT, 0};
    if (::poll(&polled, 1, 50) <= 0) {
        return 0;
    }
    const ssize_t count = ::send(out_, bytes.data(), bytes.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
    return count < 0 ? 0 : static_cast<std::size_t>(count);
}

std::string ByteEnd::read(std::size_t count) {
    std::string bytes;
    std::array<char, 65536> some{};
    while (bytes.size() < count && ready(in_, POLLIN)) {
        const ssize_t got = ::read(in_, some.data(), std::min(some.size(), count - bytes.size()));
        if (got <= 0) {
            break;
        }
        bytes.append(some.data(), static_cast<std::size_t>(got));
    }
    return bytes;
}

void ByteEnd::writeWith(const std::string& bytes, const std::vector<int>& descriptors) {
    std::vector<char> room(CMSG_SPACE(descriptors.size() * sizeof(int)));
    iovec piece{const_cast<char*>(bytes.data()), bytes.size()};
    msghdr message{};
    message.msg_iov = &piece;
    message.msg_iovlen = 1;
    message.msg_control = room.data();
    message.msg_controllen = room.size();
    cmsghdr* const control = CMSG_FIRSTHDR(&message);
    control->cmsg_level = SOL_SOCKET;
    control->cmsg_type = SCM_RIGHTS;
    control->cmsg_len = CMSG_LEN(descriptors.size() * sizeof(int));
    std::memcpy(CMSG_DATA(control), descriptors.data(), descriptors.size() * sizeof(int));
    ASSERT_EQ(::sendmsg(out_, &message, MSG_NOSIGNAL), static_cast<ssize_t>(bytes.size()));
}

std::string ByteEnd::readWith(std::size_t count, std::vector<foundation::core::posix::OwnedDescriptor>& descriptors) {
    std::string bytes(count, '\0');
    std::size_t have = 0;
    while (have < count && ready(in_, POLLIN)) {
        std::vector<char> room(CMSG_SPACE(64 * sizeof(int)));
        iovec piece{bytes.data() + have, count - have};
        msghdr message{};
        message.msg_iov = &piece;
        message.msg_iovlen = 1;
        message.msg_control = room.data();
        message.msg_controllen = room.size();
        const ssize_t got = ::recvmsg(in_, &message, MSG_CMSG_CLOEXEC);
        if (got <= 0) {
            break;
        }
        have += static_cast<std::size_t>(got);
        for (cmsghdr* control = CMSG_FIRSTHDR(&message); control != nullptr; control = CMSG_NXTHDR(&message, control)) {
            std::vector<int> numbers((control->cmsg_len - CMSG_LEN(0)) / sizeof(int));
            std::memcpy(numbers.data(), CMSG_DATA(control), numbers.size() * sizeof(int));
            for (const int number : numbers) {
                descriptors.emplace_back(number);
            }
        }
    }
    bytes.resize(have);
    return bytes;
}

std::string ByteEnd::readAll() {
    return read(~std::size_t{0});
}

SessionHello ByteEnd::readHello() {
    const std::string head = read(16);
    EXPECT_EQ(head.substr(0, 8), "\x89KRUTIL\n");
    EXPECT_EQ(number(head, 8), 1U);
    SessionHello hello;
    EXPECT_TRUE(hello.ParseFromString(read(number(head, 12))));
    return hello;
}

SessionVerdict ByteEnd::readVerdict() {
    SessionVerdict verdict;
    EXPECT_TRUE(verdict.ParseFromString(read(number(read(4), 0))));
    return verdict;
}

void ByteEnd::shakeHands(bool sharedMemory) {
    SessionHello mine = readHello();
    auto& features = *mine.mutable_features();
    features.erase(std::remove_if(features.begin(), features.end(),
                                  [sharedMemory](const auto& feature) {
                                      return feature.name() == "KEEPALIVE" ||
                                             (feature.name() == "SHM" && !sharedMemory);
                                  }),
                   features.end());
    mine.set_role(mine.role() == SessionHello::CLIENT ? SessionHello::ENGINE : SessionHello::CLIENT);
    write(helloBytes(mine));
    const SessionVerdict verdict = readVerdict();
    EXPECT_TRUE(verdict.accepted()) << verdict.refusal();
    write(verdictBytes(verdict));
}

std::string helloBytes(const std::string& body, std::uint32_t layout) {
    return "\x89KRUTIL\n" + little(layout, 4) + little(body.size(), 4) + body;
}

std::string helloBytes(const SessionHello& hello, std::uint32_t layout) {
    return helloBytes(hello.SerializeAsString(), layout);
}

std::string verdictBytes(const SessionVerdict& verdict) {
    const std::string body = verdict.SerializeAsString();
    return little(body.size(), 4) + body;
}

SessionHello hello(SessionHello::Role role) {
    SessionHello hello;
    hello.set_role(role);
    hello.set_protocol("test");
    hello.set_versionmajor(1);
    hello.mutable_limits()->set_tag(128);
    hello.mutable_limits()->set_taggedframe(4U << 20);
    hello.mutable_limits()->set_arraymessage(64U << 20);
    hello.mutable_limits()->set_message(4ULL << 30);
    hello.mutable_limits()->set_frames(65'536);
    hello.mutable_limits()->set_parts(262'144);
    return hello;
}

SessionVerdict acceptance() {
    SessionVerdict verdict;
    verdict.set_accepted(true);
    return verdict;
}

}  // namespace wire
