#include "krutil/replay/SaidStream.hpp"

#include <fcntl.h>
#include <google/protobuf/stubs/strutil.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <system_error>
#include <utility>

#include "common/FrameBytes.hpp"
#include "krutil/base/ExitCode.hpp"

namespace krutil_client {
namespace {

namespace posix = foundation::core::posix;
using apps::FrameHeader;

constexpr std::string_view expectedMagic = "\x89KRUTIL\n";
constexpr std::size_t helloHead = 16;
constexpr std::size_t verdictHead = 4;
constexpr std::size_t longestHandshakeBody = 65'536;
constexpr std::size_t readSize = 262'144;

std::string_view firstLine(std::string_view text) {
    return text.substr(0, std::min<std::size_t>(text.find('\n'), 60));
}

void doNotBlock(const posix::OwnedDescriptor& descriptor) {
    ::fcntl(descriptor.get(), F_SETFL, ::fcntl(descriptor.get(), F_GETFL) | O_NONBLOCK);
}

}  // namespace

SaidStream::SaidStream(posix::OwnedDescriptor in, posix::OwnedDescriptor out, std::string peer, Interrupt& interrupt,
                       std::function<void(Said)> hear)
    : inDescriptor_(std::move(in)),
      outDescriptor_(std::move(out)),
      peer_(std::move(peer)),
      interrupt_(interrupt),
      hear_(std::move(hear)) {
    doNotBlock(inDescriptor_);
    doNotBlock(outDescriptor_);
}

void SaidStream::readHello(Clock::time_point deadline) {
    await(deadline, expectedMagic.size(), "first message");
    if (!received().starts_with(expectedMagic)) {
        throw Failure(ExitCode::Violation, peer_ + " does not speak this protocol: it began with \"" +
                                               escapedText(firstLine(received())) + "\"");
    }
    takeBody(deadline, helloHead, "first message");
}

SaidStream::Verdict SaidStream::readVerdict(Clock::time_point deadline) {
    Verdict verdict{takeBody(deadline, verdictHead, "verdict")};
    if (!verdict.message.ParseFromString(verdict.bytes.substr(verdictHead))) {
        throw Failure(ExitCode::Violation, peer_ + "'s verdict cannot be read");
    }
    speaking_ = true;
    return verdict;
}

void SaidStream::await(Clock::time_point deadline, std::size_t size, const char* what) {
    if (!run(deadline, [this, size] { return have() >= size; })) {
        throw Failure(ExitCode::Stream, peer_ + " sent no " + what + (ended_ ? ": its stream ended" : " in time"));
    }
}

std::string SaidStream::takeBody(Clock::time_point deadline, std::size_t head, const char* what) {
    await(deadline, head, what);
    const std::size_t size = apps::littleEndian(received().substr(head - 4, 4));
    if (size > longestHandshakeBody) {
        throw Failure(ExitCode::Violation, "length of " + peer_ + "'s " + what + ": expected at most " +
                                               std::to_string(longestHandshakeBody) + " bytes, got " +
                                               std::to_string(size));
    }
    await(deadline, head + size, what);
    std::string bytes(received().substr(0, head + size));
    taken_ += bytes.size();
    return bytes;
}

// Whole frames among what has come.
void SaidStream::takeFrames() {
    while (speaking_ && have() >= FrameHeader::size) {
        const FrameHeader header = apps::headerOf(received());
        const std::size_t behind = have() - FrameHeader::size;
        if (behind < header.tagSize || behind - header.tagSize < header.contentSize) {
            break;
        }
        const std::size_t size = FrameHeader::size + header.tagSize + header.contentSize;
        auto said = listener_.take(received().substr(0, size));
        taken_ += size;
        if (said) {
            hear_(std::move(*said));
        }
    }
    if (taken_ >= readSize || taken_ == in_.size()) {
        in_.erase(0, std::exchange(taken_, 0));
    }
}

bool SaidStream::run(Clock::time_point deadline, const std::function<bool()>& done) {
    takeFrames();
    while (!done() && !(ended_ && hasWritten())) {
        const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now());
        if (left.count() <= 0) {
            return false;
        }
        // A descriptor that nothing is wanted of is left out: its errors would be reported all the time.
        std::array<pollfd, 3> watched{pollfd{ended_ ? -1 : inDescriptor_.get(), POLLIN, 0},
                                      pollfd{hasWritten() ? -1 : outDescriptor_.get(), POLLOUT, 0},
                                      pollfd{interrupt_.fd(), POLLIN, 0}};
        const auto wait = std::min<std::chrono::milliseconds::rep>(left.count(), 1'000'000);
        if (::poll(watched.data(), watched.size(), static_cast<int>(wait)) <= 0) {
            continue;
        }
        if (watched[2].revents != 0) {
            interrupt_.dispatch();
        }
        if (watched[1].revents != 0) {
            writeSome();
        }
        if (watched[0].revents != 0) {
            readSome();
        }
        takeFrames();
    }
    return done();
}

bool SaidStream::finish(Clock::time_point deadline) {
    run(deadline, [this] { return hasWritten(); });
    ::shutdown(outDescriptor_.get(), SHUT_WR);
    outDescriptor_.reset();
    out_.clear();
    // A socket that is closed with something unread would tell the other end of an error.
    speaking_ = false;
    return run(deadline, [this] {
        in_.clear();
        taken_ = 0;
        return ended_;
    });
}

void SaidStream::writeSome() {
    // SIGPIPE is ignored.
    const ssize_t written = ::write(outDescriptor_.get(), out_.data() + written_, out_.size() - written_);
    if (written > 0) {
        written_ += static_cast<std::size_t>(written);
    } else if (errno == EPIPE || errno == ECONNRESET) {
        // The other end may have said why.
        written_ = out_.size();
    } else if (errno != EAGAIN && errno != EINTR) {
        throw Failure(ExitCode::Stream, "cannot write to " + peer_ + ": " + std::generic_category().message(errno));
    }
    if (written_ == out_.size()) {
        out_.clear();
        written_ = 0;
    }
}

void SaidStream::readSome() {
    const std::size_t before = in_.size();
    in_.resize(before + readSize);
    const ssize_t got = ::read(inDescriptor_.get(), in_.data() + before, readSize);
    const int error = errno;
    in_.resize(before + (got > 0 ? static_cast<std::size_t>(got) : 0));
    ended_ = got == 0 || (got < 0 && error != EAGAIN && error != EINTR);
}

std::string helloWith(const std::string& hello,
                      const std::function<bool(const msg_svc::protobuf::SessionFeature&)>& keeps) {
    msg_svc::protobuf::SessionHello message;
    if (hello.size() < helloHead || !message.ParseFromString(hello.substr(helloHead))) {
        throw Failure(ExitCode::Usage, "cannot replay the recording: a first message in it cannot be read");
    }
    auto& features = *message.mutable_features();
    for (int i = features.size(); i > 0; --i) {
        if (!keeps(features[i - 1])) {
            features.DeleteSubrange(i - 1, 1);
        }
    }
    const std::string body = message.SerializeAsString();
    std::string bytes = hello.substr(0, helloHead - 4);
    for (unsigned shift = 0; shift < 32; shift += 8) {
        bytes += static_cast<char>(static_cast<unsigned char>(body.size() >> shift));
    }
    return bytes + body;
}

bool isOfSession(const msg_svc::protobuf::SessionFeature& feature) {
    return feature.name() == "SHM" || feature.name() == "KEEPALIVE";
}

std::string escapedText(std::string_view text) {
    return google::protobuf::CEscape(std::string(text));
}

}  // namespace krutil_client
