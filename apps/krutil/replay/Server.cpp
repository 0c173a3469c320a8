#include "krutil/replay/Server.hpp"

#include <algorithm>
#include <deque>
#include <map>
#include <optional>
#include <utility>

#include "krutil/base/ExitCode.hpp"
#include "krutil/replay/Comparison.hpp"
#include "krutil/replay/Identifiers.hpp"
#include "krutil/replay/SaidStream.hpp"

namespace krutil_client {
namespace {

namespace posix = foundation::core::posix;
using Clock = SaidStream::Clock;

// How long a client may take to close its end when the session is over.
constexpr std::chrono::seconds patienceForClose{1};

class Server {
  public:
    Server(posix::OwnedDescriptor in, posix::OwnedDescriptor out, const Talk& talk, std::chrono::milliseconds patience,
           Interrupt& interrupt, const std::function<void(const std::string&)>& report)
        : talk_(talk),
          patience_(patience),
          report_(report),
          stream_(std::move(in), std::move(out), "the client", interrupt,
                  [this](Said said) { heard_.push_back(std::move(said)); }) {}

    void shakeHands(std::chrono::milliseconds timeout) {
        const auto deadline = Clock::now() + timeout;
        // Nothing but what was settled then, so that it is settled again or refused.
        stream_.write(helloWith(talk_.engineHello, [this](const auto& feature) {
            const auto& settled = talk_.verdict.features();
            return !isOfSession(feature) && std::any_of(settled.begin(), settled.end(), [&feature](const auto& each) {
                return each.name() == feature.name() && each.value() == feature.value();
            });
        }));
        stream_.readHello(deadline);
        const auto [bytes, verdict] = stream_.readVerdict(deadline);
        // Both ends list the same, and refuse for the same reasons.
        stream_.write(bytes);
        if (!verdict.accepted()) {
            stream_.finish(Clock::now() + patienceForClose);
            throw Failure(ExitCode::Refused, "the client refuses the session: " + escapedText(verdict.refusal()));
        }
    }

    Served say() {
        std::uint64_t before = talk_.client.empty() ? 0 : talk_.client.front().said.nanoseconds;
        bool goesOn = true;
        for (std::size_t i = 0; i < talk_.client.size() && goesOn; ++i) {
            sayUpTo(talk_.client[i].after);
            const Said& expected = talk_.client[i].said;
            const auto recordedTime =
                std::chrono::nanoseconds(expected.nanoseconds - std::min(before, expected.nanoseconds));
            before = expected.nanoseconds;
            goesOn = hear(expected, recordedTime);
        }
        const std::size_t all = talk_.client.size();
        report_(std::to_string(same_) + " of " + std::to_string(all) + (all == 1 ? " message" : " messages") +
                " of the client as in the recording");
        if (goesOn) {
            sayUpTo(talk_.engine.size());
        } else if (!stream_.ended()) {
            stream_.write(framesOf(shutdown()));
        }
        stream_.finish(Clock::now() + patienceForClose);
        return served_;
    }

  private:
    static Said shutdown() { return {Said::Kind::Message, 0, {{true, 29, "krutil:QVMShutdownEvent", {}}}, 0, 0}; }

    // What the engine had said by the time that it had said so many messages.
    void sayUpTo(std::size_t count) {
        for (; said_ < count; ++said_) {
            Said said = identifiers_.forClient(talk_.engine[said_]);
            if (const auto stream = streams_.find(said.stream); stream != streams_.end()) {
                said.stream = stream->second;
            }
            stream_.write(framesOf(said));
        }
    }

    // Takes the client's next message. Returns whether the recording tells how to go on.
    bool hear(const Said& expected, std::chrono::nanoseconds recordedTime) {
        stream_.run(Clock::now() + recordedTime + patience_, [this] { return !heard_.empty(); });
        const std::string where = "message " + std::to_string(++number_) + " of the client, " + nameOf(expected) +
                                  " (byte " + std::to_string(expected.offset) + ")";
        if (heard_.empty()) {
            tell(where + (stream_.ended() ? ": got the end of its stream" : ": got nothing in time"));
            served_.gone = stream_.ended();
            return false;
        }
        Said said = std::move(heard_.front());
        heard_.pop_front();
        if (said.kind != expected.kind || said.tag() != expected.tag()) {
            tell(where + ": got " + nameOf(said) +
                 (said.kind == Said::Kind::Abort ? ": " + escapedText(said.frames.front().content) : std::string()));
            return false;
        }
        streams_[expected.stream] = said.stream;
        identifiers_.match(expected, said);
        const auto differences = compareFrames(expected, identifiers_.asRecorded(std::move(said)), Addresses::Count);
        for (const std::string& difference : differences) {
            tell(where + difference);
        }
        same_ += differences.empty() ? 1U : 0U;
        return true;
    }

    void tell(const std::string& sentence) {
        served_.differs = true;
        report_(sentence);
    }

    const Talk& talk_;
    const std::chrono::milliseconds patience_;
    const std::function<void(const std::string&)>& report_;
    std::deque<Said> heard_;  ///< and not compared yet
    std::size_t said_ = 0;    ///< messages of the engine
    std::size_t number_ = 0;  ///< messages of the client
    std::size_t same_ = 0;    ///< of these, as in the recording
    Identifiers identifiers_;
    std::map<std::uint32_t, std::uint32_t> streams_{{0, 0}};  ///< of the recording, and of the client
    Served served_;
    SaidStream stream_;  ///< speaks to what is above
};

}  // namespace

Served serve(posix::OwnedDescriptor in, posix::OwnedDescriptor out, const Talk& talk,
             std::chrono::milliseconds handshakeTimeout, std::chrono::milliseconds patience, Interrupt& interrupt,
             const std::function<void(const std::string&)>& report) {
    Server server(std::move(in), std::move(out), talk, patience, interrupt, report);
    server.shakeHands(handshakeTimeout);
    return server.say();
}

}  // namespace krutil_client
