// Numbers that the protocol's conversions end a process for, sent to an engine. No message that goes to an engine has
// one in its fields. So they come in frames of types that an engine sends itself, which a session would not send, and
// which this client puts together byte by byte.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <unistd.h>

#include "apps/common/UnknownNumbers.hpp"
#include "apps/qvm/fixture/EngineFixture.hpp"
#include "common/KrutilSession.hpp"
#include "foundation/msg_svc/transport/layers/session/FrameHeader.hpp"
#include "krutil.protobuf.EvalIIP.pb.h"
#include "krutil.protobuf.FEvalIIP.pb.h"
#include "krutil.protobuf.IIPEnqueueMessage.pb.h"
#include "krutil.protobuf.TextBaseEvent.pb.h"
#include "support/TemporaryDirectory.hpp"

namespace qvm_test {
namespace {

namespace proto = krutil::protobuf;
using namespace apps_test;
using session::framing::FrameType;
using testing::ElementsAre;

// One tagged frame of a message.
struct Part {
    std::string tag;
    std::string content;
    FrameType type = FrameType::Object;
};

using Parts = std::vector<Part>;

// What an engine did with what it was sent.
struct Outcome {
    std::vector<std::string> roots;  ///< tags of its messages
    std::string abort;               ///< why it closed the session; empty when it did not
    int exitCode = -1;
    std::string stderrText;

    bool operator==(const Outcome&) const = default;
};

void PrintTo(const Outcome& outcome, std::ostream* out) {
    *out << testing::PrintToString(outcome.roots) << ", abort \"" << outcome.abort << "\", exit code "
         << outcome.exitCode << ", standard error \"" << outcome.stderrText << '"';
}

// A client that has shaken hands, and nothing more.
class ByteClient {
  public:
    explicit ByteClient(int connection) : bytes_(::fcntl(connection, F_DUPFD_CLOEXEC, 3)) {
        session::SessionConfig config = apps::krutilSession(session::Role::Client);
        config.build = "engine test";
        // Never started, so it leaves all frames to this object.
        session_ = session::Session::open(connection, connection, std::move(config));
    }
    ~ByteClient() { ::close(bytes_); }
    ByteClient(const ByteClient&) = delete;
    ByteClient& operator=(const ByteClient&) = delete;

    // Sends one message on a stream of its own, and a goodbye when it has been answered. Returns what comes up to the
    // end of the stream.
    Outcome exchange(const Parts& parts) {
        std::string message;
        for (const Part& part : parts) {
            session::FrameHeader header;
            header.kind = static_cast<std::uint8_t>(session::FrameKind::Tagged);
            header.last = &part == &parts.back();
            header.type = part.type;
            header.tagSize = static_cast<std::uint16_t>(part.tag.size());
            header.stream = 1;
            header.index = static_cast<std::uint64_t>(&part - parts.data()) + 1;
            header.contentSize = part.content.size();
            message += bytesOf(header) + part.tag + part.content;
        }
        write(message);
        Outcome outcome;
        session::FrameHeader::Bytes head;
        while (read(head.data(), head.size())) {
            const session::FrameHeader header = session::decode(head);
            std::string tag(header.tagSize, '\0');
            std::string content(header.contentSize, '\0');
            if (!read(tag.data(), tag.size()) || !read(content.data(), content.size())) {
                throw std::runtime_error("The stream ended in the middle of a frame");
            }
            if (header.is(session::FrameKind::Abort)) {
                outcome.abort = content;
            } else if (header.last) {
                outcome.roots.push_back(tag);
            }
            if (tag == "krutil:IIPReply") {
                session::FrameHeader goodbye;
                goodbye.kind = static_cast<std::uint8_t>(session::FrameKind::Goodbye);
                write(bytesOf(goodbye));
            }
        }
        return outcome;
    }

  private:
    static std::string bytesOf(const session::FrameHeader& header) {
        const auto bytes = encode(header);
        return {bytes.data(), bytes.size()};
    }

    // Little enough for a stream to take at once.
    void write(const std::string& bytes) {
        if (::write(bytes_, bytes.data(), bytes.size()) != static_cast<ssize_t>(bytes.size())) {
            throw std::runtime_error("The engine does not take a small message");
        }
    }

    bool read(char* target, std::size_t size) {
        while (size > 0) {
            pollfd watched{bytes_, POLLIN, 0};
            if (::poll(&watched, 1, static_cast<int>(std::chrono::milliseconds(patience).count())) <= 0) {
                throw std::runtime_error("Nothing came within the patience of a test");
            }
            const ssize_t count = ::read(bytes_, target, size);
            if (count <= 0) {
                return false;
            }
            target += count;
            size -= static_cast<std::size_t>(count);
        }
        return true;
    }

    int bytes_;
    std::unique_ptr<session::Session> session_;
};

Outcome outcomeOf(const Parts& parts, std::vector<std::string> options) {
    options.insert(options.begin(), "--stdio");
    EngineProcess engine(options);
    Outcome outcome = ByteClient(engine.connection()).exchange(parts);
    outcome.exitCode = engine.wait();
    outcome.stderrText = engine.stderrText();
    return outcome;
}

// A frame with a number that ends a process, what the check says to it, and the same frame with a known number.
struct Stowaway {
    Part bad;
    std::string refusal;
    Part good;
};

std::vector<Stowaway> stowaways() {
    std::vector<Stowaway> all;
    const auto add = [&](const std::string& tag, const std::string& bad, const std::string& refusal,
                         const std::string& good) {
        all.push_back({{tag, bad}, refusal, {tag, good}});
    };
    add("krutil:TextBaseEvent", textEvent<proto::TextBaseEvent>(3), refusalOfStream("krutil:TextBaseEvent", 3),
        textEvent<proto::TextBaseEvent>(2));
    add("krutil:SinkTextEvent", textEvent<proto::SinkTextEvent>(-1), refusalOfStream("krutil:SinkTextEvent", -1),
        textEvent<proto::SinkTextEvent>(2));
    const auto addStatus = [&](const std::string& tag, const std::string& path, int depth, int status, auto make) {
        const std::string bad = make(depth, status);
        add(tag, bad, refusalOfStatus(tag, path, bad, depth, status), make(depth, 5));
    };
    for (const int depth : {0, 30}) {
        addStatus("krutil:IIPResult", "exception", depth, 6, result);
        addStatus("krutil:FEvalResult", "iipResult.exception", depth, -1, callResult);
        addStatus("krutil:PrintableErrorEvent", "except", depth, 6, printableError);
    }
    return all;
}

Part evaluation() {
    proto::EvalIIP message;
    message.mutable_iip()->set_plugintype("python");
    message.mutable_iip()->mutable_outtraits();
    message.mutable_iip()->mutable_errtraits();
    message.set_cmd("6 * 7");
    return {"krutil:EvalIIP", message.SerializeAsString()};
}

// A call whose argument is the frame with this index.
Part call(std::uint64_t argument) {
    proto::FEvalIIP message;
    message.mutable_iip()->set_plugintype("python");
    message.mutable_iip()->mutable_outtraits();
    message.mutable_iip()->mutable_errtraits();
    message.set_functionname("abs");
    message.set_clientqvmid(1);
    message.set_serverqvmid(1);
    message.add_dataids(argument);
    return {"krutil:FEvalIIP", message.SerializeAsString()};
}

Part enqueue(std::uint64_t request) {
    proto::IIPEnqueueMessage message;
    message.mutable_iipid()->set_lo(1);
    message.set_iiphandle(request);
    message.set_dequeuemode(proto::DEQUEUE_AT_IDLE);
    return {"krutil:IIPEnqueueMessage", message.SerializeAsString(), FrameType::Control};
}

const std::vector<std::string> evaluated{"krutil:IIPStartedEvent",   "krutil:SinkTextEvent",
                                         "krutil:IIPCompletedEvent", "krutil:detail::LastIIPEvent",
                                         "krutil:IIPReply",          "krutil:QVMShutdownEvent"};

const std::vector<std::string> checked;
const std::vector<std::string> unchecked{"--no-precheck"};

TEST(EnginePrecheckTest, FrameThatNothingRefersToIsRefused) {
    for (const Stowaway& each : stowaways()) {
        EXPECT_EQ(outcomeOf({each.bad, evaluation(), enqueue(2)}, checked),
                  (Outcome{{}, each.refusal, 4, "krutil-qvm: " + each.refusal + "\n"}));
    }
}

TEST(EnginePrecheckTest, WithoutItFramesThatNothingRefersToAreIgnored) {
    Parts parts;
    for (const Stowaway& each : stowaways()) {
        parts.push_back(each.bad);
    }
    parts.push_back(evaluation());
    parts.push_back(enqueue(parts.size()));
    EXPECT_EQ(outcomeOf(parts, unchecked), (Outcome{evaluated, {}, 0, {}}));
}

TEST(EnginePrecheckTest, KnownNumbersPass) {
    Parts parts;
    for (const Stowaway& each : stowaways()) {
        parts.push_back(each.good);
    }
    parts.push_back(evaluation());
    parts.push_back(enqueue(parts.size()));
    for (const auto& options : {checked, unchecked}) {
        EXPECT_EQ(outcomeOf(parts, options), (Outcome{evaluated, {}, 0, {}}));
    }
}

// What an engine sends goes to no engine, whatever is in it.
TEST(EnginePrecheckTest, MessagesForClientsAreRefusedBeforeTheirNumbersAreSeen) {
    for (const Stowaway& each : stowaways()) {
        const bool event = each.bad.tag.ends_with("Event");
        const std::string why = "message on stream 1: \"" + each.bad.tag +
                                (event ? "\" goes to a client, not to an engine"
                                       : "\" is only ever referred to and cannot be the last frame");
        for (const auto& options : {checked, unchecked}) {
            EXPECT_EQ(outcomeOf({each.bad}, options), (Outcome{{}, why, 4, "krutil-qvm: " + why + "\n"}));
        }
    }
}

// In the place of a request or of an argument these frames have the wrong type, so their numbers are never converted.
TEST(EnginePrecheckTest, WithoutItFramesInPlacesOfOthersAreRefusedForTheirType) {
    for (const Stowaway& each : stowaways()) {
        for (const Parts& parts : {Parts{each.bad, enqueue(1)}, Parts{each.bad, call(1), enqueue(2)}}) {
            EXPECT_EQ(outcomeOf(parts, checked), (Outcome{{}, each.refusal, 4, "krutil-qvm: " + each.refusal + "\n"}));
            const std::string reader = parts.size() == 2 ? "krutil:IIPEnqueueMessage" : "krutil:FEvalIIP";
            const std::string why = "cannot read \"krutil:IIPEnqueueMessage\": frame 1: expected an object that \"" +
                                    reader + "\" can refer to, got one with tag \"" + each.bad.tag + "\"";
            EXPECT_EQ(outcomeOf(parts, unchecked), (Outcome{{}, why, 4, "krutil-qvm: " + why + "\n"})) << each.bad.tag;
        }
    }
}

// The number of the stream that a request's text is for. Only writing the same request again would end the process.
TEST(EnginePrecheckTest, RequestForAStreamThatIsNoneIsServedEitherWay) {
    for (const auto& options : {checked, unchecked}) {
        EngineSession engine(options);
        engine.client.replaceStream1000(7);
        EvalOptions toStream1000;
        toStream1000.streams = cmddistributor::IqmStreamID::ekIqmJavaStream;
        EXPECT_EQ(engine.client.eval("6 * 7", toStream1000).shown(), "42\n");
        EXPECT_EQ(engine.client.goodbye().reason, session::SessionEnd::Reason::Finished);
        EXPECT_EQ(engine.process.wait(), 0);
        EXPECT_EQ(engine.process.stderrText(), "");
    }
}

// That is no matter of numbers: without the check of these it is refused all the same.
TEST(EnginePrecheckTest, ContentThatIsCutIsRefusedEitherWay) {
    proto::EvalIIP message;
    ASSERT_TRUE(message.ParseFromString(evaluation().content));
    const std::string whole = evaluation().content;
    for (const auto& options : {checked, unchecked}) {
        const Parts parts{{"krutil:EvalIIP", whole.substr(0, whole.size() - 1)}, enqueue(1)};
        const std::string why = "frame \"krutil:EvalIIP\", byte " +
                                std::to_string(whole.size() - 2 - message.cmd().size()) +
                                ", field cmd: expected 5 more bytes, got 4";
        EXPECT_EQ(outcomeOf(parts, options), (Outcome{{}, why, 4, "krutil-qvm: " + why + "\n"}));
    }
}

// Two bytes make an empty error, which is a large object of the process that reads it.
TEST(EnginePrecheckTest, MorePartsThanTheLimitAreRefused) {
    std::string content = evaluation().content;
    for (int i = 0; i < 996; ++i) {
        content += std::string("\x18\x00", 2);
    }
    const auto engineWith = [&](const std::string& most) {
        return outcomeOf({{"krutil:EvalIIP", content}, enqueue(1)}, {"--limit-parts", most});
    };
    const std::string why = "frame \"krutil:EvalIIP\", byte " + std::to_string(content.size() - 2) +
                            ", field codeType: expected at most 1000 fields (limit \"parts\"), got more";
    EXPECT_EQ(engineWith("1001"), (Outcome{evaluated, {}, 0, {}}));
    EXPECT_EQ(engineWith("1000"), (Outcome{{}, why, 4, "krutil-qvm: " + why + "\n"}));
}

class ListenerPrecheckTest : public testing::TestWithParam<bool> {};

TEST_P(ListenerPrecheckTest, SessionThatIsClosedLeavesTheOthers) {
    const test_support::TemporaryDirectory directory;
    const std::string path = directory.file("private/socket");
    std::vector<std::string> arguments{"--listen", path};
    if (!GetParam()) {
        arguments.emplace_back("--no-precheck");
    }
    EngineProcess engine(arguments);
    engine.awaitStderr("krutil-qvm: serving " + path + "\n");
    EngineClient other(connectTo(path));
    other.eval("x = 41");

    const Outcome outcome = ByteClient(connectTo(path)).exchange({stowaways().front().bad, enqueue(1)});
    const std::string why = GetParam() ? refusalOfStream("krutil:TextBaseEvent", 3)
                                       : "cannot read \"krutil:IIPEnqueueMessage\": frame 1: expected an object that "
                                         "\"krutil:IIPEnqueueMessage\" can refer to, got one with tag "
                                         "\"krutil:TextBaseEvent\"";
    EXPECT_EQ(outcome.abort, why);
    EXPECT_THAT(outcome.roots, ElementsAre());
    engine.awaitStderr("krutil-qvm: " + why + "\n");

    EXPECT_EQ(other.eval("x + 1").shown(), "42\n");
    EXPECT_EQ(EngineClient(connectTo(path)).eval("1").shown(), "1\n");
    EXPECT_EQ(other.goodbye().reason, session::SessionEnd::Reason::Finished);
}

INSTANTIATE_TEST_SUITE_P(Precheck, ListenerPrecheckTest, testing::Bool(),
                         [](const testing::TestParamInfo<bool>& checks) { return checks.param ? "On" : "Off"; });

}  // namespace
}  // namespace qvm_test
