// Handshakes on streams that carry something else, end, or take little; and what becomes of the descriptors.
#include <fcntl.h>
#include <sys/resource.h>
#include <unistd.h>

#include <atomic>
#include <csignal>
#include <utility>

#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "platform/session/support/HandshakeFixture.hpp"

namespace testing_sessions {
namespace {

using capabilities::Capability;
using msg_svc::protobuf::SessionHello;
using msg_svc::protobuf::SessionVerdict;
using session::FeatureRequest;
using session::HandshakeRefused;
using session::ProtocolViolation;
using session::StreamLost;

// Garbage.

TEST_F(HandshakeTest, OtherFirstBytesAreAViolationThatShowsThem) {
    EXPECT_EQ(openAgainst<ProtocolViolation>("bash: krutil-qvm: command not found\n"),
              "the peer does not speak this protocol: expected a first message that begins with \"\\x89KRUTIL\\n\", "
              "got \"bash: krutil-qvm: command not found\\n\"");
}

TEST_F(HandshakeTest, TextBeforeASessionIsToldApart) {
    try {
        const Ends ends = socketPair();
        wire::ByteEnd peer(ends.otherIn, ends.otherOut);
        peer.write("Last login: \x1b[1mtoday\n" + wire::helloBytes(wire::hello(SessionHello::ENGINE)));
        Session::open(ends.in, ends.out, configOf(Role::Client));
        ADD_FAILURE();
    } catch (const session::StrayText& error) {
        EXPECT_EQ(error.text(), "\"Last login: \\x1b[1mtoday\\n\"");
        EXPECT_STREQ(error.what(),
                     "the peer does not speak this protocol: expected a first message that begins with "
                     "\"\\x89KRUTIL\\n\", got \"Last login: \\x1b[1mtoday\\n\"");
    }
}

TEST_F(HandshakeTest, APeerThatSaysNothingIsToldApart) {
    const auto openAtEnd = [](const std::string& said) {
        const Ends ends = socketPair();
        {
            wire::ByteEnd peer(ends.otherIn, ends.otherOut);
            peer.write(said);
        }
        Session::open(ends.in, ends.out, configOf(Role::Engine));
    };
    EXPECT_EQ(textOf<session::PeerSilent>([&] { openAtEnd(""); }),
              "the peer closed the stream during the handshake: 0 of 16 bytes of the peer's first message had arrived");
    try {
        openAtEnd("\x89");
        ADD_FAILURE();
    } catch (const session::PeerSilent& error) {
        ADD_FAILURE() << error.what();
    } catch (const StreamLost& error) {
        EXPECT_STREQ(error.what(),
                     "the peer closed the stream during the handshake: 1 of 16 bytes of the peer's first message had "
                     "arrived");
    }
}

TEST_F(HandshakeTest, APeerThatIsRefusedUnheardIsToldWhy) {
    const Ends ends = socketPair();
    Session::refuse(ends.otherIn, configOf(Role::Engine), "come back\x1b later");
    EXPECT_EQ(textOf<HandshakeRefused>([&] { Session::open(ends.in, ends.out, configOf(Role::Client)); }),
              "the session is refused by the engine: come back\xEF\xBF\xBD later");
}

TEST_F(HandshakeTest, FirstWrongByteIsEnough) {
    // Nothing else ever comes, and the stream stays open.
    EXPECT_EQ(openAgainst<ProtocolViolation>("\x89KRAUT", false),
              "the peer does not speak this protocol: expected a first message that begins with \"\\x89KRUTIL\\n\", "
              "got \"\\x89KRAUT\"");
}

TEST_F(HandshakeTest, HelloThatIsTooLongIsAViolation) {
    EXPECT_EQ(openAgainst<ProtocolViolation>("\x89KRUTIL\n" + wire::little(1, 4) + wire::little(65'537, 4)),
              "length of the peer's hello: expected at most 65536 bytes, got 65537");
    EXPECT_EQ(openAgainst<ProtocolViolation>("\x89KRUTIL\n" + wire::little(1, 4) + wire::little(0xFFFFFFFF, 4)),
              "length of the peer's hello: expected at most 65536 bytes, got 4294967295");
}

TEST_F(HandshakeTest, HelloThatDoesNotParseIsAViolation) {
    EXPECT_EQ(openAgainst<ProtocolViolation>(wire::helloBytes(std::string("\x0A\xFF\xFF", 3))),
              "the peer's hello: its 3 bytes are not a message of its type");
}

TEST_F(HandshakeTest, HelloWithoutLimitsIsAViolation) {
    SessionHello hello = wire::hello(SessionHello::ENGINE);
    hello.clear_limits();
    EXPECT_EQ(openAgainst<ProtocolViolation>(wire::helloBytes(hello)),
              "the peer's hello: expected the limits of the peer, got none");
}

TEST_F(HandshakeTest, PeerThatDoesNotKnowOfPartsHasNoLimitOfThem) {
    const Ends ends = socketPair();
    wire::ByteEnd peer(ends.otherIn, ends.otherOut);
    SessionHello hello = wire::hello(SessionHello::ENGINE);
    hello.mutable_limits()->clear_parts();
    peer.write(wire::helloBytes(hello) + wire::verdictBytes(wire::acceptance()));
    const auto session = Session::open(ends.in, ends.out, configOf(Role::Client));
    EXPECT_EQ(session->peer().limits.parts, session::WireWalk::anyParts);
}

TEST_F(HandshakeTest, UnknownFieldsAndCapabilitiesOfALaterPeerAreIgnored) {
    const Ends ends = socketPair();
    wire::ByteEnd peer(ends.otherIn, ends.otherOut);
    SessionHello hello = wire::hello(SessionHello::ENGINE);
    hello.add_capabilities(6);
    hello.add_capabilities(64);
    hello.add_capabilities(1ULL << 60);
    peer.write(wire::helloBytes(hello.SerializeAsString() + "\xF8\x07\x01") + wire::verdictBytes(wire::acceptance()));
    const auto session = Session::open(ends.in, ends.out, configOf(Role::Client));
    EXPECT_EQ(session->peer().capabilities, (capabilities::CapabilityList{Capability::Debugging}));
}

TEST_F(HandshakeTest, VerdictThatIsTooLongIsAViolation) {
    EXPECT_EQ(
        openAgainst<ProtocolViolation>(wire::helloBytes(wire::hello(SessionHello::ENGINE)) + wire::little(70'000, 4)),
        "length of the peer's verdict: expected at most 65536 bytes, got 70000");
}

TEST_F(HandshakeTest, VerdictThatDoesNotParseIsAViolation) {
    EXPECT_EQ(openAgainst<ProtocolViolation>(wire::helloBytes(wire::hello(SessionHello::ENGINE)) + wire::little(2, 4) +
                                             "\x12\xFF"),
              "the peer's verdict: its 2 bytes are not a message of its type");
}

// Lost streams and time limits.

TEST_F(HandshakeTest, StreamThatEndsTellsHowFarItCame) {
    EXPECT_EQ(openAgainst<StreamLost>(""),
              "the peer closed the stream during the handshake: 0 of 16 bytes of the peer's first message had arrived");
    EXPECT_EQ(openAgainst<StreamLost>("\x89KRU"),
              "the peer closed the stream during the handshake: 4 of 16 bytes of the peer's first message had arrived");
    const std::string hello = wire::helloBytes(wire::hello(SessionHello::ENGINE));
    EXPECT_EQ(openAgainst<StreamLost>(hello.substr(0, 20)), "the peer closed the stream during the handshake: 4 of " +
                                                                std::to_string(hello.size() - 16) +
                                                                " bytes of the peer's hello had arrived");
    EXPECT_EQ(openAgainst<StreamLost>(hello),
              "the peer closed the stream during the handshake: 0 of 4 bytes of the peer's verdict had arrived");
}

TEST_F(HandshakeTest, EveryCutOfAHandshakeIsALostStream) {
    const std::string bytes =
        wire::helloBytes(wire::hello(SessionHello::ENGINE)) + wire::verdictBytes(wire::acceptance());
    for (std::size_t cut = 0; cut < bytes.size(); ++cut) {
        const std::string text = openAgainst<StreamLost>(bytes.substr(0, cut));
        ASSERT_TRUE(text.starts_with("the peer closed the stream during the handshake: ")) << text;
    }
}

TEST_F(HandshakeTest, SilentPeerTimesOut) {
    const Ends ends = socketPair();
    wire::ByteEnd peer(ends.otherIn, ends.otherOut);
    peer.write("\x89KRU");
    SessionConfig config = configOf(Role::Client);
    config.handshakeTimeout = std::chrono::milliseconds(50);
    EXPECT_EQ(textOf<StreamLost>([&] { Session::open(ends.in, ends.out, config); }),
              "the handshake timed out after 50 milliseconds: 4 of 16 bytes of the peer's first message had arrived");
}

TEST_F(HandshakeTest, AStreamThatTakesNothingIsNotWaitedForToTheEnd) {
    const Ends ends = pipes();
    const foundation::core::posix::OwnedDescriptor silent(ends.otherOut);
    ::close(ends.otherIn);
    SessionConfig config = configOf(Role::Client);
    config.handshakeTimeout = std::chrono::hours(1);
    EXPECT_EQ(textOf<StreamLost>([&] { Session::open(ends.in, ends.out, config); }),
              "cannot write to the stream during the handshake: Broken pipe");
}

TEST_F(HandshakeTest, APeerThatIsTooLateIsToldSo) {
    const Ends ends = socketPair();
    SessionConfig config = configOf(Role::Engine);
    config.handshakeTimeout = std::chrono::milliseconds(50);
    wire::ByteEnd peer(ends.otherIn, ends.otherOut);
    const std::string text = textOf<StreamLost>([&] { Session::open(ends.in, ends.out, config); });
    peer.readHello();
    const SessionVerdict verdict = peer.readVerdict();
    EXPECT_FALSE(verdict.accepted());
    EXPECT_EQ(verdict.refusal(),
              "the handshake timed out after 50 milliseconds: 0 of 16 bytes of the peer's first message had arrived");
    EXPECT_EQ(verdict.refusal(), text);
    EXPECT_EQ(peer.readAll(), "");
}

// An admission that is withdrawn after the peer has sent `bytes`; what this end sends behind its hello.
class WithdrawnTest : public HandshakeTest {
  protected:
    std::string sentAfterHello(const std::string& bytes, const std::string& refusal) {
        const Ends ends = socketPair();
        const Ends word = socketPair();
        wire::ByteEnd peer(ends.otherIn, ends.otherOut);
        wire::ByteEnd decider(word.otherIn, word.otherOut);
        const foundation::core::posix::OwnedDescriptor own(word.in);
        SessionConfig config = configOf(Role::Engine);
        config.admission.word = word.in;
        config.admission.refusal = [&, asked = false]() mutable {
            ++asked_;
            // Asked for the acceptance first where the peer has come that far.
            const bool accepting = !bytes.empty() && !std::exchange(asked, true);
            return accepting ? std::string() : refusal;
        };
        auto opening = std::async(std::launch::async, [&] {
            return textOf<HandshakeRefused>([&] { Session::open(ends.in, ends.out, config); });
        });
        peer.readHello();
        peer.write(bytes);
        std::string sent = bytes.empty() ? std::string() : peer.read(wire::verdictBytes(wire::acceptance()).size());
        decider.write("!");
        text_ = opening.get();
        return sent + peer.readAll();
    }

    int asked_ = 0;
    std::string text_;
};

TEST_F(WithdrawnTest, APeerThatHasSaidNothingIsToldWhy) {
    SessionVerdict refusing;
    refusing.set_refusal("others came");
    EXPECT_EQ(sentAfterHello("", "others came"), wire::verdictBytes(refusing));
    EXPECT_EQ(text_, "the session is refused: others came");
    EXPECT_EQ(asked_, 1);
}

TEST_F(WithdrawnTest, NothingFollowsAVerdictThatAccepts) {
    EXPECT_EQ(sentAfterHello(wire::helloBytes(wire::hello(SessionHello::CLIENT)), "others came"),
              wire::verdictBytes(wire::acceptance()));
    EXPECT_EQ(text_, "the session is refused: others came");
    EXPECT_EQ(asked_, 2);
}

TEST_F(HandshakeTest, AWordThatRefusesNothingIsAskedForOnce) {
    const Ends word = socketPair();
    wire::ByteEnd decider(word.otherIn, word.otherOut);
    const foundation::core::posix::OwnedDescriptor own(word.in);
    decider.close();
    SessionConfig config = configOf(Role::Engine);
    std::atomic<int> asked = 0;
    config.admission = {[&] {
                            ++asked;
                            return std::string();
                        },
                        word.in};
    const Ends ends = socketPair();
    wire::ByteEnd peer(ends.otherIn, ends.otherOut);
    auto opening = std::async(std::launch::async, [&] { return Session::open(ends.in, ends.out, config); });
    peer.shakeHands();
    EXPECT_TRUE(opening.get());
    // And once before the peer was accepted.
    EXPECT_EQ(asked, 2);
}

TEST_F(HandshakeTest, APeerThatIsNotAdmittedIsToldWhy) {
    SessionConfig engineConfig = configOf(Role::Engine);
    engineConfig.admission.refusal = [] { return std::string("no room\x1b here"); };
    const Outcome outcome = openBoth(configOf(Role::Client), engineConfig);
    EXPECT_EQ(outcome.engineText, "the session is refused: no room\xEF\xBF\xBD here");
    EXPECT_EQ(outcome.clientText, "the session is refused by the engine: no room\xEF\xBF\xBD here");
}

TEST_F(HandshakeTest, UnknownProtocolNameIsOutOfRangeAndTheDescriptorsAreClosed) {
    const Ends ends = socketPair();
    wire::ByteEnd peer(ends.otherIn, ends.otherOut);
    SessionConfig config = configOf(Role::Client);
    config.protocol = "unheard of";
    EXPECT_EQ(textOf<std::out_of_range>([&] { Session::open(ends.in, ends.out, config); }),
              "ProtocolRegistry: no protocol named \"unheard of\" is registered in this process");
    EXPECT_EQ(peer.readAll(), "");
    EXPECT_EQ(::fcntl(ends.in, F_GETFD), -1);
}

TEST_F(HandshakeTest, DescriptorThatIsNotOneIsRefused) {
    EXPECT_EQ(textOf<StreamLost>([] { Session::open(-1, -1, configOf(Role::Client)); }),
              "cannot use descriptor -1 for a session: Bad file descriptor");
}

// Each direction of a stream needs one of its own.
TEST_F(HandshakeTest, StreamForWhichThereIsNoSecondDescriptorIsRefused) {
#if defined(KRUTIL_SANITIZED)
    GTEST_SKIP() << "the undefined-behaviour sanitizer needs a descriptor to look at an object's type";
#endif
    const Ends ends = socketPair();
    const foundation::core::posix::OwnedDescriptor other(ends.otherIn);
    struct rlimit before {};
    ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &before), 0);
    const struct rlimit none { 1, before.rlim_max };
    ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &none), 0);
    const std::string said = textOf<StreamLost>([&] { Session::open(ends.in, ends.in, configOf(Role::Client)); });
    ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &before), 0);
    EXPECT_EQ(said, "cannot use descriptor " + std::to_string(ends.in) + " for a session: Too many open files");
}

TEST_F(HandshakeTest, DescriptorsBecomeNonBlockingAndCloseOnExec) {
    const Ends ends = pipes();
    ::fcntl(ends.in, F_SETFD, 0);
    ::fcntl(ends.out, F_SETFD, 0);
    const SessionPair pair(configOf(Role::Client), configOf(Role::Engine), ends);
    for (const int descriptor : {ends.in, ends.out}) {
        EXPECT_EQ(::fcntl(descriptor, F_GETFD) & FD_CLOEXEC, FD_CLOEXEC);
        EXPECT_EQ(::fcntl(descriptor, F_GETFL) & O_NONBLOCK, O_NONBLOCK);
    }
}

TEST_F(HandshakeTest, BrokenPipesAreIgnoredOnlyWhereTheProgramSaidNothing) {
    struct sigaction before {};
    struct sigaction after {};
    const auto open = [] { SessionPair pair; };
    ::signal(SIGPIPE, SIG_DFL);
    open();
    ::sigaction(SIGPIPE, nullptr, &after);
    EXPECT_EQ(after.sa_handler, SIG_IGN);
    before.sa_handler = [](int) {};
    ::sigaction(SIGPIPE, &before, nullptr);
    open();
    ::sigaction(SIGPIPE, nullptr, &after);
    EXPECT_EQ(after.sa_handler, before.sa_handler);
    ::signal(SIGPIPE, SIG_IGN);
}

TEST_F(HandshakeTest, HellosOfBothEndsMayExceedWhatThePipesTake) {
    const Ends ends = pipes();
    for (const int descriptor : {ends.out, ends.otherOut}) {
        ASSERT_GT(::fcntl(descriptor, F_SETPIPE_SZ, 4096), 0);
    }
    std::vector<FeatureRequest> features;
    for (int i = 0; i < 500; ++i) {
        features.push_back(optional("feature " + std::to_string(i), std::string(100, 'v')));
    }
    const Registered protocol("long", features);
    SessionConfig clientConfig = configOf(Role::Client);
    SessionConfig engineConfig = configOf(Role::Engine);
    clientConfig.protocol = engineConfig.protocol = "long";
    const SessionPair pair(clientConfig, engineConfig, ends);
    EXPECT_EQ(pair.client->features().size(), 500U);
    EXPECT_EQ(pair.client->features(), pair.engine->features());
}

TEST_F(HandshakeTest, OwnHelloThatIsTooLongIsALengthError) {
    const Registered protocol("too long", {optional("X", std::string(70'000, 'v'))});
    SessionConfig config = configOf(Role::Client);
    config.protocol = "too long";
    const Ends ends = socketPair();
    const wire::ByteEnd peer(ends.otherIn, ends.otherOut);
    EXPECT_TRUE(textOf<std::length_error>([&] {
                    Session::open(ends.in, ends.out, config);
                }).starts_with("Session::open: expected a hello of at most 65536 bytes, got 70"));
}

}  // namespace
}  // namespace testing_sessions
