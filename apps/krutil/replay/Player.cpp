#include "krutil/replay/Player.hpp"

#include <fcntl.h>
#include <google/protobuf/stubs/strutil.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <functional>
#include <map>
#include <optional>
#include <string_view>
#include <system_error>
#include <utility>

#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "krutil/base/ExitCode.hpp"
#include "msg_svc.protobuf.SessionHandshake.pb.h"

namespace krutil_client {
namespace {

namespace posix = foundation::core::posix;
using Clock = std::chrono::steady_clock;

constexpr std::string_view expectedMagic = "\x89KRUTIL\n";
constexpr std::size_t helloHead = 16;
constexpr std::size_t verdictHead = 4;
constexpr std::size_t longestHandshakeBody = 65'536;
constexpr std::size_t readSize = 262'144;

// Text of a peer.
std::string escaped(std::string_view text) {
    return google::protobuf::CEscape(std::string(text));
}

std::string_view firstLine(std::string_view text) {
    return text.substr(0, std::min<std::size_t>(text.find('\n'), 60));
}

std::size_t sizeAt(std::string_view bytes, std::size_t at) {
    std::size_t size = 0;
    for (std::size_t i = 4; i > 0; --i) {
        size = size << 8U | static_cast<unsigned char>(bytes[at + i - 1]);
    }
    return size;
}

void setSize(std::string& bytes, std::size_t at, std::size_t size) {
    for (std::size_t i = 0; i < 4; ++i) {
        bytes[at + i] = static_cast<char>(static_cast<unsigned char>(size >> (8 * i)));
    }
}

// No descriptors are passed here.
std::string withoutSharedMemory(const std::string& hello) {
    msg_svc::protobuf::SessionHello message;
    if (hello.size() < helloHead || !message.ParseFromString(hello.substr(helloHead))) {
        throw Failure(ExitCode::Usage, "cannot replay the recording: the client's first message cannot be read");
    }
    auto& features = *message.mutable_features();
    for (int i = features.size(); i > 0; --i) {
        if (features[i - 1].name() == "SHM") {
            features.DeleteSubrange(i - 1, 1);
        }
    }
    const std::string body = message.SerializeAsString();
    std::string bytes = hello.substr(0, helloHead) + body;
    setSize(bytes, helloHead - 4, body.size());
    return bytes;
}

struct Exchange {
    bool open = false;
    long missing = 0;  ///< milestones that the engine has still to say
};

class Player {
  public:
    Player(int stream, const Talk& talk, std::chrono::milliseconds patience, Interrupt& interrupt)
        : stream_(stream), talk_(talk), patience_(patience), interrupt_(interrupt) {
        ::fcntl(stream, F_SETFL, ::fcntl(stream, F_GETFL) | O_NONBLOCK);
    }

    void shakeHands(std::chrono::milliseconds timeout) {
        out_ = withoutSharedMemory(talk_.hello);
        const auto deadline = Clock::now() + timeout;
        const auto await = [this, deadline](std::size_t size, const char* what) {
            if (!run(deadline, [this, size] { return have() >= size; })) {
                throw Failure(ExitCode::Stream,
                              "the engine sent no " + std::string(what) + (ended_ ? ": its stream ended" : " in time"));
            }
        };
        await(expectedMagic.size(), "first message");
        if (!received().starts_with(expectedMagic)) {
            throw Failure(ExitCode::Violation, "the engine does not speak this protocol: it began with \"" +
                                                   escaped(firstLine(received())) + "\"");
        }
        await(helloHead, "first message");
        takeBody(helloHead, "first message", await);
        await(verdictHead, "verdict");
        const std::string verdict = takeBody(verdictHead, "verdict", await);
        msg_svc::protobuf::SessionVerdict message;
        if (!message.ParseFromString(verdict.substr(verdictHead))) {
            throw Failure(ExitCode::Violation, "the engine's verdict cannot be read");
        }
        if (!message.accepted()) {
            throw Failure(ExitCode::Refused, "the engine refuses the session: " + escaped(message.refusal()));
        }
        // Both ends list the same.
        out_ += verdict;
        speaking_ = true;
    }

    Played say() {
        std::size_t counted = 0;
        std::uint64_t before = talk_.client.empty() ? 0 : talk_.client.front().said.nanoseconds;
        bool goodbye = false;
        for (const Talk::Sent& sent : talk_.client) {
            for (; counted < sent.after; ++counted) {
                expect(talk_.engine[counted]);
            }
            awaitExpected(sent.said.nanoseconds - std::min(before, sent.said.nanoseconds));
            before = sent.said.nanoseconds;
            if (sent.said.kind == Said::Kind::Abort || ended_) {
                break;
            }
            out_ += framesOf(sent.said);
            if (sent.said.stream != 0) {
                exchanges_[sent.said.stream] = {true, 0};
            }
            goodbye = goodbye || sent.said.kind == Said::Kind::Goodbye;
        }
        for (; counted < talk_.engine.size(); ++counted) {
            expect(talk_.engine[counted]);
        }
        const std::uint64_t last = talk_.engine.empty() ? before : talk_.engine.back().nanoseconds;
        const std::uint64_t left = last - std::min(before, last);
        awaitExpected(left);
        if (!goodbye) {
            out_ += framesOf({Said::Kind::Goodbye, 0, {}, 0, 0});
        }
        if (!run(Clock::now() + std::chrono::nanoseconds(left) + patience_, [this] { return ended_; })) {
            played_.end = "the engine did not close its stream in time";
        } else if (!orderly_ && played_.end.empty()) {
            played_.end = "the engine's stream ended before its shutdown event";
        }
        return std::move(played_);
    }

  private:
    std::size_t have() const noexcept { return in_.size() - taken_; }
    std::string_view received() const { return std::string_view(in_).substr(taken_); }

    template <class Await>
    std::string takeBody(std::size_t head, const char* what, const Await& await) {
        const std::size_t size = sizeAt(received(), head - 4);
        if (size > longestHandshakeBody) {
            throw Failure(ExitCode::Violation, "length of the engine's " + std::string(what) + ": expected at most " +
                                                   std::to_string(longestHandshakeBody) + " bytes, got " +
                                                   std::to_string(size));
        }
        await(head + size, what);
        std::string bytes(received().substr(0, head + size));
        taken_ += bytes.size();
        return bytes;
    }

    static bool isMilestone(const Said& said) {
        return said.kind == Said::Kind::Message && said.stream != 0 && !said.isText();
    }

    void expect(const Said& said) {
        if (isMilestone(said)) {
            ++exchanges_[said.stream].missing;
        }
    }

    void hear(Said said) {
        if (isMilestone(said)) {
            --exchanges_[said.stream].missing;
            exchanges_[said.stream].open = exchanges_[said.stream].open && !said.endsExchange();
        }
        orderly_ = orderly_ || said.tag() == "krutil:QVMShutdownEvent";
        if (said.kind == Said::Kind::Abort) {
            played_.end = "the engine broke off: " + escaped(said.frames.front().content);
        } else {
            played_.engine.push_back(std::move(said));
        }
    }

    void awaitExpected(std::uint64_t nanoseconds) {
        const bool heard = run(Clock::now() + std::chrono::nanoseconds(nanoseconds) + patience_, [this] {
            return std::all_of(exchanges_.begin(), exchanges_.end(),
                               [](const auto& each) { return !each.second.open || each.second.missing <= 0; });
        });
        // What has not come is not waited for a second time.
        for (auto& [stream, exchange] : exchanges_) {
            exchange.missing = heard ? exchange.missing : 0;
        }
    }

    // Whole frames among what has come.
    void takeFrames() {
        while (speaking_ && have() >= SaidHeader::size) {
            const SaidHeader header = SaidHeader::of(received());
            const std::size_t behind = have() - SaidHeader::size;
            if (behind < header.tagSize || behind - header.tagSize < header.contentSize) {
                break;
            }
            const std::size_t size = SaidHeader::size + header.tagSize + header.contentSize;
            auto said = listener_.take(received().substr(0, size));
            taken_ += size;
            if (said) {
                hear(std::move(*said));
            }
        }
        if (taken_ >= readSize || taken_ == in_.size()) {
            in_.erase(0, std::exchange(taken_, 0));
        }
    }

    // Writes and reads until `done`, the deadline or the end of the stream. Returns whether it is done.
    bool run(Clock::time_point deadline, const std::function<bool()>& done) {
        takeFrames();
        while (!done() && !ended_) {
            const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now());
            if (left.count() <= 0) {
                return false;
            }
            std::array<pollfd, 2> watched{
                pollfd{stream_.get(), static_cast<short>(out_.empty() ? POLLIN : POLLIN | POLLOUT), 0},
                pollfd{interrupt_.fd(), POLLIN, 0}};
            const auto wait = std::min<std::chrono::milliseconds::rep>(left.count(), 1'000'000);
            if (::poll(watched.data(), watched.size(), static_cast<int>(wait)) <= 0) {
                continue;
            }
            if (watched[1].revents != 0) {
                interrupt_.dispatch();
            }
            if ((watched[0].revents & POLLOUT) != 0) {
                write();
            }
            if ((watched[0].revents & (POLLIN | POLLHUP | POLLERR)) != 0) {
                read();
            }
            takeFrames();
        }
        return done();
    }

    void write() {
        const ssize_t written = ::send(stream_.get(), out_.data() + written_, out_.size() - written_, MSG_NOSIGNAL);
        if (written > 0) {
            written_ += static_cast<std::size_t>(written);
        } else if (errno != EAGAIN && errno != EINTR) {
            // The engine may have said why.
            written_ = out_.size();
        }
        if (written_ == out_.size()) {
            out_.clear();
            written_ = 0;
        }
    }

    void read() {
        const std::size_t before = in_.size();
        in_.resize(before + readSize);
        const ssize_t got = ::read(stream_.get(), in_.data() + before, readSize);
        const int error = errno;
        in_.resize(before + (got > 0 ? static_cast<std::size_t>(got) : 0));
        ended_ = got == 0 || (got < 0 && error != EAGAIN && error != EINTR);
    }

    const posix::OwnedDescriptor stream_;
    const Talk& talk_;
    const std::chrono::milliseconds patience_;
    Interrupt& interrupt_;
    std::string out_;
    std::size_t written_ = 0;  ///< of `out_`
    std::string in_;
    std::size_t taken_ = 0;  ///< of `in_`
    bool speaking_ = false;  ///< the handshake is over
    bool ended_ = false;
    bool orderly_ = false;
    Listener listener_;
    std::map<std::uint32_t, Exchange> exchanges_;  ///< the last one on each stream
    Played played_;
};

}  // namespace

Played play(int stream, const Talk& talk, std::chrono::milliseconds handshakeTimeout,
            std::chrono::milliseconds patience, Interrupt& interrupt, const std::function<void()>& begun) {
    Player player(stream, talk, patience, interrupt);
    player.shakeHands(handshakeTimeout);
    begun();
    return player.say();
}

}  // namespace krutil_client
