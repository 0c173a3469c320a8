// Signs of life, with an end that is played byte by byte.
#include <future>

#include "platform/session/support/TestSessions.hpp"
#include "platform/session/support/WireBytes.hpp"

namespace testing_sessions {
namespace {

using msg_svc::protobuf::SessionHello;
using msg_svc::protobuf::SessionVerdict;

SessionConfig living(Role role) {
    SessionConfig config = configOf(role);
    config.keepAlive = std::chrono::milliseconds(role == Role::Client ? 5 : 0);
    return config;
}

// A session whose peer is the test, and lists the feature.
class LivingWithBytes {
  public:
    explicit LivingWithBytes(Role role) {
        const Ends ends = socketPair();
        peer = std::make_unique<wire::ByteEnd>(ends.otherIn, ends.otherOut);
        auto opening = std::async(std::launch::async, [&] { return Session::open(ends.in, ends.out, living(role)); });
        SessionHello hello = wire::hello(role == Role::Client ? SessionHello::ENGINE : SessionHello::CLIENT);
        SessionVerdict verdict = wire::acceptance();
        for (auto* const feature : {hello.add_features(), verdict.add_features()}) {
            feature->set_name("KEEPALIVE");
            feature->set_value("frames");
        }
        hello.mutable_features(0)->set_handling(1);
        peer->readHello();
        peer->write(wire::helloBytes(hello));
        EXPECT_EQ(peer->readVerdict().SerializeAsString(), verdict.SerializeAsString());
        peer->write(wire::verdictBytes(verdict));
        session = opening.get();
        session->start(saw);
    }

    Recorder saw;
    std::unique_ptr<wire::ByteEnd> peer;
    std::unique_ptr<Session> session;
};

class KeepAliveTest : public testing::Test {
  protected:
    Registered protocol_{"test"};
};

TEST_F(KeepAliveTest, AClientSendsOneAtEachInterval) {
    LivingWithBytes client(Role::Client);
    for (int i = 0; i < 3; ++i) {
        EXPECT_EQ(client.peer->read(24), wire::keepAlive());
    }
    // They are told apart from the goodbye, and go on after it.
    client.session->sayGoodbye();
    std::string next;
    while ((next = client.peer->read(24)) == wire::keepAlive()) {
    }
    EXPECT_EQ(next, wire::goodbye());
    EXPECT_EQ(client.peer->read(24), wire::keepAlive());
    // An answer leads to nothing.
    client.peer->write(wire::keepAlive());
    EXPECT_EQ(client.peer->read(24), wire::keepAlive());
}

TEST_F(KeepAliveTest, AnEngineAnswersEach) {
    LivingWithBytes engine(Role::Engine);
    engine.peer->write(wire::keepAlive() + wire::keepAlive());
    EXPECT_EQ(engine.peer->read(48), wire::keepAlive() + wire::keepAlive());
    // Also after the goodbye, until its own last event.
    engine.peer->write(wire::goodbye() + wire::keepAlive());
    EXPECT_EQ(engine.peer->read(24), wire::keepAlive());
    engine.session->send(0, shutdownEvent());
    const std::string last = engine.peer->read(24);
    EXPECT_NE(last, wire::keepAlive());
    engine.peer->write(wire::keepAlive());
    engine.session->close(std::chrono::seconds(10));
    EXPECT_EQ(engine.peer->readAll().find(wire::keepAlive()), std::string::npos);
}

TEST_F(KeepAliveTest, TwoEndsSettleOnThemWhereTheClientWants) {
    const SessionPair living_(living(Role::Client), configOf(Role::Engine));
    EXPECT_EQ(living_.client->features().at("KEEPALIVE"), "frames");
    EXPECT_EQ(living_.engine->features().at("KEEPALIVE"), "frames");
    const SessionPair quiet;
    EXPECT_FALSE(quiet.client->features().contains("KEEPALIVE"));
    EXPECT_FALSE(quiet.engine->features().contains("KEEPALIVE"));
}

TEST_F(KeepAliveTest, OneThatIsNotSettledOnIsAViolation) {
    SessionWithBytes engine(configOf(Role::Engine));
    engine.peer->write(wire::keepAlive());
    EXPECT_THAT(engine.saw.waitForEnd(),
                isEnd(Reason::Violation, "frame kind: expected 1 (tagged), 2 (data), 3 (goodbye) or 4 (abort), got 7"));
}

TEST_F(KeepAliveTest, OneThatSaysSomethingIsAViolation) {
    const auto endAfter = [](const std::string& bytes) {
        LivingWithBytes engine(Role::Engine);
        engine.peer->write(bytes);
        return engine.saw.waitForEnd();
    };
    EXPECT_THAT(endAfter(wire::header({7, false, 0, 0, 0, 0, 1})),
                isEnd(Reason::Violation, "keep-alive frame: expected no content, got 1 bytes"));
    EXPECT_THAT(
        endAfter(wire::header({7, false, 0, 0, 3, 0, 0})),
        isEnd(Reason::Violation, "keep-alive frame: expected last bit, frame type, tag size, stream ID and index 0"));
    EXPECT_THAT(endAfter(wire::data(1, 1, false, "x") + wire::keepAlive()),
                isEnd(Reason::Violation, "keep-alive frame in the middle of a message: expected frame 2"));
    EXPECT_THAT(endAfter(wire::header({8, false, 0, 0, 0, 0, 0})),
                isEnd(Reason::Violation,
                      "frame kind: expected 1 (tagged), 2 (data), 3 (goodbye), 4 (abort) or 7 (keep-alive), got 8"));
}

}  // namespace
}  // namespace testing_sessions
