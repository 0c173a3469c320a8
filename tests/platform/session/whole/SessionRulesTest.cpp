// What a session refuses, on the way in and on the way out.

#include <boost/make_shared.hpp>

#include "foundation/msg_svc/transport/layers/session/SessionChecker.hpp"
#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"
#include "msg_svc.protobuf.IDType.pb.h"
#include "platform/session/support/TestSessions.hpp"
#include "platform/session/support/WireBytes.hpp"

namespace testing_sessions {
namespace {

using session::LimitExceeded;
using session::Limits;
using testing::ElementsAre;

// What a real end of a role refuses, and with which sentence.
struct Violation {
    const char* name;
    Role role;
    std::string bytes;
    std::string text;
    // For clients: the exchange on stream 1 is open.
    bool asked = false;
};

std::ostream& operator<<(std::ostream& out, const Violation& violation) {
    return out << violation.name;
}

// Test names have letters and digits only.
std::string nameOf(const testing::TestParamInfo<Violation>& info) {
    std::string name;
    bool upper = true;
    for (const char* c = info.param.name; *c != '\0'; ++c) {
        if (*c != ' ') {
            name += upper ? static_cast<char>(std::toupper(*c)) : *c;
        }
        upper = *c == ' ';
    }
    return name;
}

class SessionViolationTest : public testing::TestWithParam<Violation> {
  protected:
    Registered protocol_{"test"};
};

TEST_P(SessionViolationTest, ClosesTheSessionAndTellsThePeer) {
    SessionWithBytes end(configOf(GetParam().role));
    if (GetParam().asked) {
        end.session->send(1, question("q"));
        end.peer->read(wire::tagged(1, 1, true, questionTag, "q").size());
    }
    end.peer->write(GetParam().bytes);
    EXPECT_THAT(end.saw.waitForEnd(), isEnd(Reason::Violation, GetParam().text));
    EXPECT_EQ(end.peer->readAll(), wire::abort(GetParam().text));
}

std::string root(std::uint64_t stream, const std::string& tag, const std::string& content = "") {
    return wire::tagged(stream, 1, true, tag, content);
}

const std::string question1 = root(1, questionTag);

// A recording of the same session is judged in the same words.
TEST_P(SessionViolationTest, IsFoundInARecording) {
    const Role sender = GetParam().role == Role::Client ? Role::Engine : Role::Client;
    session::SessionChecker checker(configOf(GetParam().role), {});
    if (GetParam().asked) {
        checker.take(Role::Client, question1);
    }
    EXPECT_EQ(textOf<session::ProtocolViolation>([&] {
                  for (const std::string& each : wire::framesOf(GetParam().bytes)) {
                      checker.take(sender, each);
                  }
              }),
              GetParam().text);
}

INSTANTIATE_TEST_SUITE_P(
    OfAClient, SessionViolationTest,
    testing::Values(
        Violation{"data frame as root", Role::Engine, wire::data(1, 1, true, "x"),
                  "message on stream 1: expected a tagged frame as its last one, got a data frame"},
        Violation{"unknown root", Role::Engine, root(1, "test:nothing\x1B"),
                  "message on stream 1: no serializer is registered for its tag \"test:nothing\\x1b\""},
        Violation{"root that is only referred to", Role::Engine, root(1, partTag),
                  "message on stream 1: \"test:part\" is only ever referred to and cannot be the last frame"},
        Violation{"array as root", Role::Engine, root(1, arrayTag),
                  "message on stream 1: \"test:array\" is only ever referred to and cannot be the last frame"},
        Violation{"reply to an engine", Role::Engine, root(1, answerTag),
                  "message on stream 1: \"test:answer\" goes to a client, not to an engine"},
        Violation{"event to an engine", Role::Engine, root(0, noticeTag),
                  "message on stream 0: \"test:notice\" goes to a client, not to an engine"},
        Violation{"shutdown event to an engine", Role::Engine, root(0, shutdownTag),
                  "message on stream 0: \"test:shutdown\" goes to a client, not to an engine"},
        Violation{"new exchange on stream 0", Role::Engine, root(0, questionTag),
                  "message on stream 0: \"test:question\" begins an exchange: expected a stream ID that is not 0 and "
                  "not in use"},
        Violation{"new exchange on a stream in use", Role::Engine, question1 + question1,
                  "message on stream 1: \"test:question\" begins an exchange: expected a stream ID that is not 0 and "
                  "not in use"},
        Violation{"event of no exchange", Role::Engine, question1 + root(2, capabilitiesTag),
                  "message on stream 2: \"test:capabilities\" is an event: expected the stream ID 0 or that of an open "
                  "exchange"},
        Violation{"message after the goodbye", Role::Engine, wire::goodbye() + question1,
                  "expected nothing after the client's goodbye, got another frame"},
        Violation{"second goodbye", Role::Engine, wire::goodbye() + wire::goodbye(),
                  "expected nothing after the client's goodbye, got another frame"},
        Violation{"serializer that throws", Role::Engine, root(1, questionTag, "fail to read"),
                  "cannot read \"test:question\": this cannot be read"},
        Violation{"serializer that throws what is no exception", Role::Engine, root(1, questionTag, "fail oddly"),
                  "cannot read \"test:question\": exception of an unknown type"},
        Violation{"serializer that makes no object", Role::Engine, root(1, questionTag, "make nothing"),
                  "cannot read \"test:question\": its serializer returned no object"},
        Violation{"header that is refused", Role::Engine, wire::header({1, true, 29, 1, 1, 7, 0}),
                  "frame index: expected 1, got 7"}),
    nameOf);

INSTANTIATE_TEST_SUITE_P(
    OfAnEngine, SessionViolationTest,
    testing::Values(
        Violation{"data frame as root", Role::Client, wire::data(0, 1, true, "x"),
                  "message on stream 0: expected a tagged frame as its last one, got a data frame"},
        Violation{"new exchange to a client", Role::Client, question1,
                  "message on stream 1: \"test:question\" goes to an engine, not to a client"},
        Violation{"reply to nothing", Role::Client, root(1, answerTag),
                  "message on stream 1: \"test:answer\" is a reply: expected the stream ID of an open exchange"},
        Violation{"reply on stream 0", Role::Client, root(0, answerTag),
                  "message on stream 0: \"test:answer\" is a reply: expected the stream ID of an open exchange", true},
        Violation{"second reply", Role::Client, root(1, answerTag) + root(1, answerTag),
                  "message on stream 1: \"test:answer\" is a reply: expected the stream ID of an open exchange", true},
        Violation{"event of no exchange", Role::Client, root(7, noticeTag),
                  "message on stream 7: \"test:notice\" is an event: expected the stream ID 0 or that of an open "
                  "exchange",
                  true},
        Violation{"event after the reply", Role::Client, root(1, answerTag) + root(1, noticeTag),
                  "message on stream 1: \"test:notice\" is an event: expected the stream ID 0 or that of an open "
                  "exchange",
                  true},
        Violation{"goodbye to a client", Role::Client, wire::goodbye(),
                  "goodbye frame: expected one from clients only, got one from the engine"},
        Violation{"event after the shutdown", Role::Client, root(0, shutdownTag) + root(0, noticeTag),
                  "expected nothing after the engine's shutdown event, got another frame"},
        Violation{"reply that cannot be read", Role::Client, root(1, answerTag, "fail to read"),
                  "cannot read \"test:answer\": this cannot be read", true}),
    nameOf);

class SessionRulesTest : public testing::Test {
  protected:
    Registered protocol_{"test"};
};

TEST_F(SessionRulesTest, MessagesBeforeTheViolationAreDelivered) {
    SessionWithBytes end(configOf(Role::Engine));
    end.peer->write(root(1, questionTag, "one") + root(2, questionTag, "two") + root(2, questionTag, "three"));
    end.saw.waitForEnd();
    EXPECT_EQ(end.saw.lines()[0], "question 1 one");
    EXPECT_EQ(end.saw.lines()[1], "question 2 two");
    EXPECT_EQ(end.saw.lines().size(), 3U);
}

TEST_F(SessionRulesTest, FailureOfOneEndReachesTheOtherAsItsReason) {
    SessionPair pair;
    pair.client->send(1, question("fail to read"));
    EXPECT_EQ(pair.engineSaw.waitForEnd().reason, Reason::Violation);
    EXPECT_THAT(
        pair.clientSaw.waitForEnd(),
        isEnd(Reason::Violation, "the peer closed the session: cannot read \"test:question\": this cannot be read"));
}

TEST_F(SessionRulesTest, ExceptionOfTheHandlerClosesTheSession) {
    SessionPair pair;
    pair.engineSaw.answerWith([](framing::StreamID, const Question&) { throw std::runtime_error("not today"); });
    pair.client->send(1, question("q"));
    EXPECT_EQ(pair.engineSaw.waitForEnd().text, "not today");
    EXPECT_EQ(pair.clientSaw.waitForEnd().text, "the peer closed the session: not today");
}

TEST_F(SessionRulesTest, HandlerThatThrowsWhatIsNoExceptionClosesTheSession) {
    SessionPair pair;
    pair.engineSaw.answerWith([](framing::StreamID, const Question&) { throw 42; });
    pair.client->send(1, question("q"));
    EXPECT_EQ(pair.engineSaw.waitForEnd().text, "the program's handler failed with an exception of an unknown type");
}

TEST_F(SessionRulesTest, AbortTellsThePeerAndNothingIsDeliveredAfterIt) {
    SessionPair pair;
    pair.engineSaw.answerWith([&](framing::StreamID, const Question&) { pair.engine->abort("enough\x1B"); });
    for (framing::StreamID stream = 1; stream <= 3; ++stream) {
        pair.client->send(stream, question("q"));
    }
    EXPECT_EQ(pair.engineSaw.waitForEnd().text, "enough\x1B");
    EXPECT_EQ(pair.clientSaw.waitForEnd().text, "the peer closed the session: enough\xEF\xBF\xBD");
    EXPECT_THAT(pair.engineSaw.lines(), ElementsAre("question 1 q", "end: violation: enough\x1B"));
}

TEST_F(SessionRulesTest, AbortReasonIsCutToItsLimit) {
    SessionPair pair;
    pair.engine->abort(std::string(100'000, '\xFF'));
    const std::string text = pair.clientSaw.waitForEnd().text;
    EXPECT_TRUE(text.starts_with("the peer closed the session: \xEF\xBF\xBD")) << text;
    EXPECT_LT(text.size(), 4096U + 30U);
}

TEST_F(SessionRulesTest, AbortWithinAMessageIsUnderstood) {
    SessionWithBytes end(configOf(Role::Engine));
    end.peer->write(wire::data(1, 1, false, "x") + wire::abort("sorry"));
    EXPECT_EQ(end.saw.waitForEnd().text, "the peer closed the session: sorry");
    EXPECT_EQ(end.peer->readAll(), "");
}

// The sender's own mistakes, refused before anything is sent.

TEST_F(SessionRulesTest, SenderRefusesWhatThePeerWouldRefuse) {
    SessionPair pair;
    const auto logic = [](auto call) { return textOf<std::logic_error>(call); };
    pair.client->send(1, question("open"));
    EXPECT_EQ(logic([&] { pair.client->send(1, question("q")); }),
              "Session::send: a new exchange needs a stream ID that is not 0 and not in use, got 1");
    EXPECT_EQ(logic([&] { pair.client->send(0, question("q")); }),
              "Session::send: a new exchange needs a stream ID that is not 0 and not in use, got 0");
    EXPECT_EQ(logic([&] { pair.client->send(0, notice("n")); }),
              "Session::send: a client does not send events of the type testing_protocol::Notice");
    EXPECT_EQ(logic([&] { pair.client->send(1, capabilityChange()); }),
              "Session::send: an event needs the stream ID 0, got 1");
    pair.engineSaw.waitForLines(1);
    EXPECT_EQ(logic([&] { pair.engine->send(2, question("q")); }), "Session::send: only a client begins exchanges");
    EXPECT_EQ(logic([&] { pair.engine->send(2, answer("a")); }),
              "Session::send: a reply needs the stream ID of an exchange that the peer began and that is still open, "
              "got 2");
    EXPECT_EQ(logic([&] { pair.engine->send(2, notice("n")); }),
              "Session::send: an event needs the stream ID 0 or that of an open exchange, got 2");
    EXPECT_EQ(logic([&] { pair.engine->sayGoodbye(); }), "Session::sayGoodbye: only a client says goodbye");
    pair.engine->send(1, answer("a"));
    EXPECT_EQ(logic([&] { pair.engine->send(1, answer("a")); }),
              "Session::send: a reply needs the stream ID of an exchange that the peer began and that is still open, "
              "got 1");
    pair.client->sayGoodbye();
    pair.client->sayGoodbye();
    EXPECT_EQ(logic([&] { pair.client->send(2, question("q")); }),
              "Session::send: no exchange can begin after the goodbye");
    EXPECT_EQ(logic([&] { pair.client->send(0, capabilityChange()); }),
              "Session::send: nothing can follow the goodbye");
    pair.engine->send(0, shutdownEvent());
    EXPECT_EQ(logic([&] { pair.engine->send(0, notice("n")); }),
              "Session::send: nothing can follow the shutdown event");
    EXPECT_THAT(pair.clientSaw.waitForLines(2), ElementsAre("answer 1 a", "event 0 shutdown"));
    EXPECT_THAT(pair.engineSaw.waitForLines(2), ElementsAre("question 1 open", "goodbye"));
}

TEST_F(SessionRulesTest, NullObjectsAreRefused) {
    SessionPair pair;
    EXPECT_EQ(
        textOf<std::invalid_argument>([&] { pair.client->send(1, boost::shared_ptr<const exchange::Message>()); }),
        "Session::send: expected an object, got a null pointer");
}

TEST_F(SessionRulesTest, ObjectWithoutASerializerIsOutOfRange) {
    SessionPair pair;
    EXPECT_EQ(textOf<std::out_of_range>([&] { pair.client->send(1, boost::make_shared<const Stranger>()); }),
              "Session::send: no serializer is registered for testing_protocol::Stranger");
}

TEST_F(SessionRulesTest, NothingIsSentOfAMessageWhoseSerializerThrows) {
    SessionWithBytes end(configOf(Role::Client));
    const auto bulk = std::make_shared<Bulk>();
    bulk->bytes = "bytes";
    EXPECT_EQ(textOf<std::runtime_error>([&] { end.session->send(1, question("fail to write", {bulk})); }),
              "this cannot be written");
    EXPECT_TRUE(bulk->dropped);
    // The stream ID was not taken either.
    end.session->send(1, question("q"));
    end.session->close();
    EXPECT_EQ(end.peer->readAll(), root(1, questionTag, "q"));
}

// Limits of the peer, which the sender keeps to.

class PeerLimitsTest : public SessionRulesTest {
  protected:
    // What a client is told that sends this to an engine with these limits; the session goes on.
    std::string refusal(const Limits& limits, const boost::shared_ptr<const exchange::Message>& message) {
        SessionConfig engineConfig = configOf(Role::Engine);
        engineConfig.limits = limits;
        SessionPair pair(configOf(Role::Client), engineConfig);
        const std::string text = textOf<LimitExceeded>([&] { pair.client->send(1, message); });
        pair.client->send(1, question("small"));
        EXPECT_THAT(pair.engineSaw.waitForLines(1), ElementsAre("question 1 small"));
        return text;
    }
};

TEST_F(PeerLimitsTest, TaggedFrame) {
    Limits limits;
    limits.taggedFrame = 1000;
    EXPECT_EQ(refusal(limits, question(std::string(1001, 'x'))),
              "\"test:question\" is larger than the engine accepts: its limit \"taggedFrame\" is 1000 bytes, the "
              "content of frame 1 has 1001");
}

TEST_F(PeerLimitsTest, Message) {
    Limits limits;
    limits.message = 1000;
    EXPECT_EQ(refusal(limits, question("12345", {bulkOf(600), bulkOf(383)})),
              "\"test:question\" is larger than the engine accepts: its limit \"message\" is 1000 bytes, the message "
              "has 1001");
}

TEST_F(PeerLimitsTest, Frames) {
    Limits limits;
    limits.frames = 2;
    EXPECT_EQ(refusal(limits, question("q", {bulkOf(1), bulkOf(1)})),
              "\"test:question\" is larger than the engine accepts: its limit \"frames\" is 2 frames, the message has "
              "3");
}

TEST_F(PeerLimitsTest, Parts) {
    SessionConfig clientConfig = configOf(Role::Client);
    clientConfig.check = std::make_shared<const session::WireWalk>(
        session::WireWalk::Messages{{"test:question", msg_svc::protobuf::IDType::descriptor()}});
    SessionConfig engineConfig = clientConfig;
    engineConfig.role = Role::Engine;
    engineConfig.limits.parts = 1000;
    const auto fields = [](int count) {
        std::string content;
        for (int i = 0; i < count; ++i) {
            content += "\x08\x01";
        }
        return content;
    };
    SessionPair pair(clientConfig, engineConfig);
    EXPECT_EQ(textOf<LimitExceeded>([&] { pair.client->send(1, question(fields(1001))); }),
              "\"test:question\" is larger than the engine accepts: its limit \"parts\" is 1000 fields, the content of "
              "frame 1 has 1001");
    const std::string long_ = "\x0A\x90\x4E" + std::string(10'000, 'x');
    pair.client->send(1, question(fields(1000)));
    pair.client->send(2, question(long_));
    EXPECT_THAT(pair.engineSaw.waitForLines(2), ElementsAre("question 1 " + fields(1000), "question 2 " + long_));
}

TEST_F(PeerLimitsTest, PartsThatASenderWithoutMannersSends) {
    SessionConfig config = configOf(Role::Engine);
    config.check = std::make_shared<const session::WireWalk>(
        session::WireWalk::Messages{{"test:question", msg_svc::protobuf::IDType::descriptor()}});
    config.limits.parts = 2;
    SessionWithBytes end(config);
    end.peer->write(root(1, questionTag, "\x08\x01\x08\x01\x08\x01"));
    EXPECT_EQ(end.saw.waitForEnd().text,
              "frame \"test:question\", byte 4, field hi: expected at most 2 fields (limit \"parts\"), got more");
}

TEST_F(PeerLimitsTest, Tag) {
    SessionConfig engineConfig = configOf(Role::Engine);
    engineConfig.limits.tag = 12;
    SessionPair pair(configOf(Role::Client), engineConfig);
    EXPECT_EQ(textOf<LimitExceeded>([&] { pair.client->send(1, question("q")); }),
              "\"test:question\" is larger than the engine accepts: its limit \"tag\" is 12 bytes, the tag of frame 1 "
              "has 13");
}

TEST_F(PeerLimitsTest, WhatIsExactlyAtTheLimitsArrives) {
    SessionConfig engineConfig = configOf(Role::Engine);
    engineConfig.limits = {13, 100, 100, 1113, 2};
    SessionPair pair(configOf(Role::Client), engineConfig);
    pair.client->send(1, question(std::string(100, 'x'), {bulkOf(1000)}));
    EXPECT_THAT(pair.engineSaw.waitForLines(1), ElementsAre("question 1 " + std::string(100, 'x')));
}

TEST_F(PeerLimitsTest, EngineNamesTheClient) {
    SessionConfig clientConfig = configOf(Role::Client);
    clientConfig.limits.taggedFrame = 10;
    SessionPair pair(clientConfig);
    EXPECT_EQ(
        textOf<LimitExceeded>([&] { pair.engine->send(0, notice(std::string(11, 'x'))); }),
        "\"test:notice\" is larger than the client accepts: its limit \"taggedFrame\" is 10 bytes, the content of "
        "frame 1 has 11");
}

TEST_F(PeerLimitsTest, ReceiverRefusesWhatASenderWithoutMannersSends) {
    SessionConfig config = configOf(Role::Engine);
    config.limits.taggedFrame = 10;
    config.limits.arrayMessage = 20;
    SessionWithBytes end(config);
    const std::size_t buffers = framing::BufferAllocator::inUse();
    end.peer->write(root(1, questionTag, std::string(11, 'x')));
    EXPECT_EQ(end.saw.waitForEnd().text,
              "content of frame 1 with tag \"test:question\" exceeds the limit \"taggedFrame\": expected at most 10 "
              "bytes, got 11");
    EXPECT_EQ(framing::BufferAllocator::inUse(), buffers);
}

}  // namespace
}  // namespace testing_sessions
