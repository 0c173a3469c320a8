// Rules that recorded sessions keep, and those that they break.
#include "krutil/inspect/Lint.hpp"

#include <gtest/gtest.h>

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "common/FrameBytes.hpp"
#include "krutil.protobuf.TextBaseEvent.pb.h"
#include "krutil/base/ExitCode.hpp"

namespace krutil_client {
namespace {

using Role = apps::RecordedUnit::Role;
using UnitKind = apps::RecordedUnit::Kind;
using Feature = std::pair<std::string, std::string>;
using apps::FrameHeader;
using apps::FrameKind;
using msg_svc::protobuf::SessionHello;
using msg_svc::protobuf::SessionVerdict;
using namespace std::string_literals;

const std::string helloBegin = "\x89KRUTIL\n\x01\0\0\0"s;
const std::string textTag = "krutil:TextBaseEvent";
const std::string tokenBytes = "12345678";

// The number in four bytes, and what it counts.
std::string counted(const std::string& body) {
    return std::string{static_cast<char>(body.size()), 0, 0, 0} + body;
}

SessionHello helloOf(Role role) {
    SessionHello hello;
    hello.set_role(role == Role::Client ? SessionHello::CLIENT : SessionHello::ENGINE);
    hello.mutable_limits()->set_tag(128);
    hello.mutable_limits()->set_taggedframe(1'000);
    hello.mutable_limits()->set_arraymessage(1'000);
    hello.mutable_limits()->set_message(2'000'000);
    hello.mutable_limits()->set_frames(10);
    return hello;
}

std::string verdictOf(const std::vector<Feature>& features, bool accepted = true) {
    SessionVerdict verdict;
    verdict.set_accepted(accepted);
    for (const auto& [name, value] : features) {
        auto& feature = *verdict.add_features();
        feature.set_name(name);
        feature.set_value(value);
    }
    return counted(verdict.SerializeAsString());
}

std::string frameOf(FrameKind kind, bool last, std::uint64_t index, const std::string& tag,
                    const std::string& content) {
    FrameHeader header;
    header.kind = static_cast<std::uint8_t>(kind);
    header.last = last;
    header.type = static_cast<decltype(header.type)>(kind == FrameKind::Tagged ? 29 : 0);
    header.tagSize = static_cast<std::uint16_t>(tag.size());
    header.index = index;
    header.contentSize = content.size();
    const FrameHeader::Bytes bytes = encode(header);
    return std::string(bytes.begin(), bytes.end()) + tag + content;
}

// An event of no request, with 2 bytes in front of its text.
std::string textOf(const std::string& text) {
    krutil::protobuf::TextBaseEvent event;
    event.set_text(text);
    return frameOf(FrameKind::Tagged, true, 1, textTag, event.SerializeAsString());
}

const std::string goodbyeFrame = frameOf(FrameKind::Goodbye, false, 0, "", "");

class LintTest : public ::testing::Test {
  protected:
    // What is said of a unit; empty for one that keeps to the rules.
    std::string take(Role sender, UnitKind kind, const std::string& bytes, std::size_t session = 0) {
        apps::RecordedUnit unit;
        unit.session = session;
        unit.sender = sender;
        unit.kind = kind;
        unit.bytes = bytes;
        unit.size = bytes.size();
        return lint_.take(unit, recorded_).value_or("");
    }

    std::string takeHello(Role sender, const SessionHello& hello) {
        return take(sender, UnitKind::FirstMessage, helloBegin + counted(hello.SerializeAsString()));
    }

    std::string takeFrame(Role sender, const std::string& bytes, std::size_t session = 0) {
        return take(sender, UnitKind::Frame, bytes, session);
    }

    void sayHello(const SessionHello& client = helloOf(Role::Client),
                  const SessionHello& engine = helloOf(Role::Engine)) {
        EXPECT_EQ(takeHello(Role::Client, client), "");
        EXPECT_EQ(takeHello(Role::Engine, engine), "");
    }

    void agree(const std::vector<Feature>& features = {}) {
        for (const Role role : {Role::Client, Role::Engine}) {
            EXPECT_EQ(take(role, UnitKind::Verdict, verdictOf(features)), "");
        }
    }

    // The answers to the tokens say whether descriptors have arrived.
    void probe(char atClient, char atEngine) {
        for (const Role role : {Role::Client, Role::Engine}) {
            EXPECT_EQ(take(role, UnitKind::Token, tokenBytes), "");
            EXPECT_EQ(take(role, UnitKind::Answer, std::string(1, role == Role::Client ? atClient : atEngine)), "");
        }
    }

    // The next test begins with a recording of its own.
    void startAnew() { lint_ = Lint(); }

    Lint lint_{};
    const apps::RecordedSession recorded_{Role::Client, "client 1", "krutil"};
};

const std::vector<Feature> sharing{{"SHM", "descriptors"}};

TEST_F(LintTest, WholeSessionBreaksNoRule) {
    sayHello();
    agree();
    EXPECT_EQ(takeFrame(Role::Engine, textOf("a")), "");
    EXPECT_EQ(takeFrame(Role::Client, goodbyeFrame), "");
    EXPECT_EQ(takeFrame(Role::Engine, textOf("b")), "");
    EXPECT_EQ(takeFrame(Role::Engine, frameOf(FrameKind::Tagged, true, 1, "krutil:QVMShutdownEvent", "")), "");
}

TEST_F(LintTest, FirstMessagesAreChecked) {
    const auto of = [this](Role sender, const std::string& bytes) {
        startAnew();
        return take(sender, UnitKind::FirstMessage, bytes);
    };
    EXPECT_EQ(of(Role::Client, "HTTP/1.1"),
              R"(first message: expected one that begins with "\x89KRUTIL\n", got "HTTP/1.1")");
    EXPECT_EQ(of(Role::Client, helloBegin), "size of a first message: expected at least 16 bytes, got 12");
    EXPECT_EQ(of(Role::Client, helloBegin + "\x02\0\0\0a"s),
              "length in a first message: expected the 1 bytes behind it, at most 65536, got 2");
    EXPECT_EQ(of(Role::Client, helloBegin + "\x01\0\x01\0"s + std::string(65'537, 'a')),
              "length in a first message: expected the 65537 bytes behind it, at most 65536, got 65537");
    EXPECT_EQ(of(Role::Client, helloBegin + counted("\x07")),
              "body of a first message: its 1 bytes are not a message of its type");
    EXPECT_EQ(of(Role::Client, "\x89KRUTIL\n\x01\x02\0\0"s + counted(helloOf(Role::Client).SerializeAsString())),
              "layout version of a first message: expected 1, got 513");
    EXPECT_EQ(of(Role::Client, helloBegin + counted("")),
              "limits in a first message: expected those of the sender, got none");
    EXPECT_EQ(of(Role::Engine, helloBegin + counted(helloOf(Role::Client).SerializeAsString())),
              "role in a first message: expected 1 (engine), got 0");
    SessionHello other = helloOf(Role::Client);
    other.set_role(static_cast<SessionHello::Role>(2));
    EXPECT_EQ(of(Role::Client, helloBegin + counted(other.SerializeAsString())),
              "role in a first message: expected 0 (client), got 2");
    EXPECT_EQ(takeHello(Role::Client, helloOf(Role::Client)), "");
    startAnew();
    sayHello();
    EXPECT_EQ(takeHello(Role::Engine, helloOf(Role::Engine)),
              "first message: expected one in each direction, got another one");
}

TEST_F(LintTest, VerdictsAreChecked) {
    EXPECT_EQ(takeHello(Role::Engine, helloOf(Role::Engine)), "");
    EXPECT_EQ(take(Role::Engine, UnitKind::Verdict, verdictOf({})),
              "verdict: expected the first messages of both ends before it, got fewer");
    const auto ofEngine = [this](const std::string& bytes) {
        startAnew();
        sayHello();
        return take(Role::Engine, UnitKind::Verdict, bytes);
    };
    EXPECT_EQ(ofEngine("abc"), "size of a verdict: expected at least 4 bytes, got 3");
    EXPECT_EQ(ofEngine("\x03\0\0\0ab"s), "length in a verdict: expected the 2 bytes behind it, at most 65536, got 3");
    EXPECT_EQ(ofEngine(counted("\x07")), "body of a verdict: its 1 bytes are not a message of its type");
    EXPECT_EQ(ofEngine(verdictOf({})), "");
    EXPECT_EQ(takeFrame(Role::Engine, textOf("a")), "frame: expected the verdicts of both ends before it, got fewer");
}

TEST_F(LintTest, FramesNeedVerdictsThatAcceptTheSame) {
    const auto fault = [this](const std::string& client, const std::string& engine) {
        startAnew();
        sayHello();
        EXPECT_EQ(take(Role::Client, UnitKind::Verdict, client), "");
        EXPECT_EQ(take(Role::Engine, UnitKind::Verdict, engine), "");
        return takeFrame(Role::Client, goodbyeFrame);
    };
    const std::string refuses = "frame: expected two verdicts before it that accept, got one that refuses";
    EXPECT_EQ(fault(verdictOf({}, false), verdictOf({})), refuses);
    EXPECT_EQ(fault(verdictOf({}), verdictOf({}, false)), refuses);
    const std::string others = "features of the verdicts: expected the same from both ends, got others";
    EXPECT_EQ(fault(verdictOf({{"A", "1"}}), verdictOf({{"A", "2"}})), others);
    EXPECT_EQ(fault(verdictOf({{"A", "1"}}), verdictOf({})), others);
    // Their order does not count.
    EXPECT_EQ(fault(verdictOf({{"A", "1"}, {"B", "2"}}), verdictOf({{"B", "2"}, {"A", "1"}})), "");
}

TEST_F(LintTest, ProbeNeedsVerdictsThatListIt) {
    const std::string unexpected =
        "probe of shared memory: expected two verdicts before it that accept and list \"SHM\", got others";
    sayHello();
    EXPECT_EQ(take(Role::Client, UnitKind::Token, tokenBytes), unexpected);
    startAnew();
    sayHello();
    agree();
    EXPECT_EQ(take(Role::Client, UnitKind::Token, tokenBytes), unexpected);
    startAnew();
    sayHello();
    take(Role::Client, UnitKind::Verdict, verdictOf(sharing));
    take(Role::Engine, UnitKind::Verdict, verdictOf(sharing, false));
    EXPECT_EQ(take(Role::Client, UnitKind::Answer, "\1"), unexpected);
}

TEST_F(LintTest, ProbeIsChecked) {
    const auto begin = [this] {
        startAnew();
        sayHello();
        agree(sharing);
    };
    begin();
    EXPECT_EQ(take(Role::Client, UnitKind::Token, tokenBytes), "");
    // The token of the other end does not count.
    EXPECT_EQ(take(Role::Engine, UnitKind::Answer, "\1"),
              "answer to the probe of shared memory: expected a token of its sender before it, got none");
    begin();
    EXPECT_EQ(take(Role::Client, UnitKind::Token, tokenBytes), "");
    EXPECT_EQ(take(Role::Client, UnitKind::Answer, "\xff"),
              "answer to the probe of shared memory: expected 0 or 1, got 255");
    begin();
    EXPECT_EQ(take(Role::Client, UnitKind::Token, tokenBytes), "");
    EXPECT_EQ(take(Role::Client, UnitKind::Answer, "\1"), "");
    EXPECT_EQ(takeFrame(Role::Client, goodbyeFrame),
              "frame: expected the answers of both ends to the probe of shared memory before it, got fewer");
}

TEST_F(LintTest, MemoryIsSharedWhereDescriptorsArriveAtBothEnds) {
    const std::string content(std::size_t{1} << 20U, 'c');
    const std::string place = "\x07\0\0\0\0\0\0\0"s + "\0\0\0\0\0\0\0\0"s + "\0\0\x10\0\0\0\0\0"s;
    const std::string shared = frameOf(FrameKind::SharedData, false, 1, "", place) + content;
    const auto fault = [&](char atClient, char atEngine) {
        startAnew();
        sayHello();
        agree(sharing);
        probe(atClient, atEngine);
        return takeFrame(Role::Client, shared);
    };
    EXPECT_EQ(fault(1, 1), "");
    EXPECT_EQ(takeFrame(Role::Engine, frameOf(FrameKind::Return, false, 7, "", "")), "");
    const std::string unknown = "frame kind: expected 1 (tagged), 2 (data), 3 (goodbye) or 4 (abort), got 5";
    EXPECT_EQ(fault(0, 1), unknown);
    EXPECT_EQ(fault(1, 0), unknown);
}

TEST_F(LintTest, SignsOfLifeNeedTheirFeature) {
    const std::string sign = frameOf(FrameKind::KeepAlive, false, 0, "", "");
    sayHello();
    agree({{"KEEPALIVE", "frames"}});
    EXPECT_EQ(takeFrame(Role::Client, sign), "");
    startAnew();
    sayHello();
    agree();
    EXPECT_EQ(takeFrame(Role::Client, sign),
              "frame kind: expected 1 (tagged), 2 (data), 3 (goodbye) or 4 (abort), got 7");
}

TEST_F(LintTest, LimitsAreThoseOfTheReceiver) {
    SessionHello narrow = helloOf(Role::Client);
    narrow.mutable_limits()->set_taggedframe(12);
    sayHello(narrow);
    agree();
    EXPECT_EQ(takeFrame(Role::Engine, textOf("0123456789")), "");
    EXPECT_EQ(
        takeFrame(Role::Engine, textOf("0123456789a")),
        "content of frame 1 with tag \"krutil:TextBaseEvent\" exceeds the limit \"taggedFrame\": expected at most "
        "12 bytes, got 13");

    // The other end accepts more.
    startAnew();
    narrow.set_role(SessionHello::ENGINE);
    sayHello(helloOf(Role::Client), narrow);
    agree();
    EXPECT_EQ(takeFrame(Role::Engine, textOf("0123456789a")), "");

    // A tag cannot be longer than a header can tell, whatever an end says.
    startAnew();
    SessionHello wide = helloOf(Role::Client);
    wide.mutable_limits()->set_tag(65'536 + 10);
    sayHello(wide);
    agree();
    EXPECT_EQ(takeFrame(Role::Engine, textOf("a")), "");
}

TEST_F(LintTest, FieldsAreCountedWhereTheirNumberIsLimited) {
    // A text in several fields.
    std::string content;
    for (int i = 0; i < 100; ++i) {
        content += "\x1a\x01x";
    }
    const std::string frame = frameOf(FrameKind::Tagged, true, 1, textTag, content);
    SessionHello counting = helloOf(Role::Client);
    counting.mutable_limits()->set_parts(99);
    sayHello(counting);
    agree();
    EXPECT_EQ(takeFrame(Role::Engine, frame),
              "frame \"krutil:TextBaseEvent\", byte 297, field text: expected at most 99 fields (limit \"parts\"), got "
              "more");
    // An end that does not know this limit has none.
    startAnew();
    sayHello();
    agree();
    EXPECT_EQ(takeFrame(Role::Engine, frame), "");
}

TEST_F(LintTest, SessionIsCheckedUpToItsFirstFault) {
    sayHello();
    agree();
    const std::string again = "first message: expected one in each direction, got another one";
    EXPECT_EQ(takeHello(Role::Client, helloOf(Role::Client)), again);
    EXPECT_EQ(takeHello(Role::Client, helloOf(Role::Client)), "");
    EXPECT_EQ(takeFrame(Role::Client, "no frame"), "");

    // Another session has rules of its own; it may begin before the others.
    EXPECT_EQ(take(Role::Client, UnitKind::Verdict, verdictOf({}), 2),
              "verdict: expected the first messages of both ends before it, got fewer");
    EXPECT_EQ(takeFrame(Role::Client, "no frame", 1), "frame: expected the verdicts of both ends before it, got fewer");
    EXPECT_EQ(takeFrame(Role::Client, "no frame", 1), "");
}

TEST_F(LintTest, BeginningsOfSessionsAndFramesAreNeeded) {
    const auto refusal = [this](const apps::RecordedUnit& unit, const apps::RecordedSession& session) {
        try {
            lint_.take(unit, session);
        } catch (const Failure& failure) {
            EXPECT_EQ(failure.code(), ExitCode::Usage);
            return std::string(failure.what());
        }
        return std::string("none");
    };
    apps::RecordedUnit unit;
    unit.offset = 4711;
    apps::RecordedSession later = recorded_;
    later.repeated = 0;
    EXPECT_EQ(refusal(unit, later),
              "--lint needs a session from its beginning, which is in an earlier file than the unit at byte 4711; "
              "record without --record-size");
    unit.bytes = "12345";
    unit.size = 100;
    unit.missing = 95;
    EXPECT_EQ(refusal(unit, recorded_),
              "--lint needs all bytes, but the recording has only the first 5 of the 100 of the frame at byte 4711; "
              "record without --record-snap");
}

}  // namespace
}  // namespace krutil_client
