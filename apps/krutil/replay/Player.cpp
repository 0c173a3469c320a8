#include "krutil/replay/Player.hpp"

#include <fcntl.h>

#include <algorithm>
#include <cerrno>
#include <map>
#include <system_error>
#include <utility>

#include "krutil/base/ExitCode.hpp"
#include "krutil/replay/SaidStream.hpp"

namespace krutil_client {
namespace {

namespace posix = foundation::core::posix;
using Clock = SaidStream::Clock;

struct Exchange {
    bool open = false;
    long missing = 0;  ///< milestones that the engine has still to say
};

posix::OwnedDescriptor duplicateOf(int stream) {
    posix::OwnedDescriptor made(::fcntl(stream, F_DUPFD_CLOEXEC, 0));
    if (!made) {
        throw Failure(ExitCode::Stream,
                      "no descriptor to write to the engine: " + std::generic_category().message(errno));
    }
    return made;
}

class Player {
  public:
    Player(int stream, const Talk& talk, std::chrono::milliseconds patience, Interrupt& interrupt)
        : talk_(talk),
          patience_(patience),
          stream_(posix::OwnedDescriptor(stream), duplicateOf(stream), "the engine", interrupt,
                  [this](Said said) { hear(std::move(said)); }) {}

    void shakeHands(std::chrono::milliseconds timeout) {
        const auto deadline = Clock::now() + timeout;
        stream_.write(helloWith(talk_.clientHello, [](const auto& feature) { return !isOfSession(feature); }));
        stream_.readHello(deadline);
        const auto [bytes, verdict] = stream_.readVerdict(deadline);
        if (!verdict.accepted()) {
            throw Failure(ExitCode::Refused, "the engine refuses the session: " + escapedText(verdict.refusal()));
        }
        // Both ends list the same.
        stream_.write(bytes);
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
            if (sent.said.kind == Said::Kind::Abort || stream_.ended()) {
                break;
            }
            stream_.write(framesOf(sent.said));
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
            stream_.write(framesOf({Said::Kind::Goodbye, 0, {}, 0, 0}));
        }
        if (!stream_.run(Clock::now() + std::chrono::nanoseconds(left) + patience_,
                         [this] { return stream_.ended(); })) {
            played_.end = "the engine did not close its stream in time";
        } else if (!orderly_ && played_.end.empty()) {
            played_.end = "the engine's stream ended before its shutdown event";
        }
        return std::move(played_);
    }

  private:
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
            played_.end = "the engine broke off: " + escapedText(said.frames.front().content);
        } else {
            played_.engine.push_back(std::move(said));
        }
    }

    void awaitExpected(std::uint64_t nanoseconds) {
        const bool heard = stream_.run(Clock::now() + std::chrono::nanoseconds(nanoseconds) + patience_, [this] {
            return std::all_of(exchanges_.begin(), exchanges_.end(),
                               [](const auto& each) { return !each.second.open || each.second.missing <= 0; });
        });
        // What has not come is not waited for a second time.
        for (auto& [stream, exchange] : exchanges_) {
            exchange.missing = heard ? exchange.missing : 0;
        }
    }

    const Talk& talk_;
    const std::chrono::milliseconds patience_;
    bool orderly_ = false;
    std::map<std::uint32_t, Exchange> exchanges_;  ///< the last one on each stream
    Played played_;
    SaidStream stream_;  ///< speaks to what is above
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
