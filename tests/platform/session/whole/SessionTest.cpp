// What a session does while both ends keep to the rules.

#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <thread>

#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"
#include "foundation/vantor/carrier/framing/DataFrame.hpp"
#include "msg_svc.protobuf.IDType.pb.h"
#include "platform/session/support/TestSessions.hpp"
#include "platform/session/support/WireBytes.hpp"

namespace testing_sessions {
namespace {

using framing::BufferAllocator;
using testing::ElementsAre;

class SessionTest : public testing::Test {
  protected:
    Registered protocol_{"test"};
};

class SessionOverTest : public SessionTest, public testing::WithParamInterface<std::string> {};

TEST_P(SessionOverTest, ExchangeRunsFromQuestionToGoodbye) {
    SessionPair pair(configOf(Role::Client), configOf(Role::Engine), GetParam() == "Pipes" ? pipes() : socketPair());
    pair.engineSaw.answerWith([&](framing::StreamID stream, const Question& asked) {
        pair.engine->send(0, notice("background"));
        pair.engine->send(stream, notice("working"));
        pair.engine->send(stream, answer("re: " + asked.text));
    });
    const framing::StreamID stream = pair.client->newStreamID();
    EXPECT_EQ(stream, 1U);
    pair.client->send(stream, question("why"));
    EXPECT_THAT(pair.clientSaw.waitForLines(3),
                ElementsAre("event 0 background", "event 1 working", "answer 1 re: why"));
    pair.client->send(0, capabilityChange());
    pair.client->sayGoodbye();
    EXPECT_THAT(pair.engineSaw.waitForLines(3), ElementsAre("question 1 why", "event 0 capabilities", "goodbye"));
    pair.engine->send(0, notice("bye"));
    pair.engine->send(0, shutdownEvent());
    pair.engine->close();
    EXPECT_EQ(pair.engineSaw.lines().back(), "end: finished");
    pair.clientSaw.waitForEnd();
    EXPECT_THAT(pair.clientSaw.waitForLines(6), ElementsAre("event 0 background", "event 1 working", "answer 1 re: why",
                                                            "event 0 bye", "event 0 shutdown", "end: finished"));
}

INSTANTIATE_TEST_SUITE_P(Streams, SessionOverTest, testing::Values("SocketPair", "Pipes"),
                         [](const auto& tested) { return tested.param; });

TEST_F(SessionTest, StreamIDsAreNeitherZeroNorInUse) {
    SessionPair pair;
    EXPECT_EQ(pair.client->newStreamID(), 1U);
    pair.client->send(2, question("on an ID of one's own"));
    EXPECT_EQ(pair.client->newStreamID(), 3U);
}

TEST_F(SessionTest, StreamIDMayBeUsedAgainAfterTheReply) {
    SessionPair pair;
    pair.engineSaw.answerWith(
        [&](framing::StreamID stream, const Question& asked) { pair.engine->send(stream, answer(asked.text)); });
    pair.client->send(9, question("one"));
    pair.clientSaw.waitForLines(1);
    pair.client->send(9, question("two"));
    EXPECT_THAT(pair.clientSaw.waitForLines(2), ElementsAre("answer 9 one", "answer 9 two"));
}

TEST_F(SessionTest, ReplyMayBeginTheNextExchangeFromInsideItsHandler) {
    struct Chain : Recorder {
        Session* session = nullptr;
        void onReply(framing::StreamID stream, const boost::shared_ptr<const exchange::Reply>& reply) override {
            Recorder::onReply(stream, reply);
            if (lines().size() < 4) {
                session->send(stream, question("next"));
            }
        }
    };
    Chain clientSaw;
    Recorder engineSaw;
    const OpenedPair opened = openPair(configOf(Role::Client), configOf(Role::Engine));
    engineSaw.answerWith(
        [&](framing::StreamID stream, const Question& asked) { opened.engine->send(stream, answer(asked.text)); });
    clientSaw.session = opened.client.get();
    opened.engine->start(engineSaw);
    opened.client->start(clientSaw);
    opened.client->send(1, question("first"));
    EXPECT_THAT(clientSaw.waitForLines(4),
                ElementsAre("answer 1 first", "answer 1 next", "answer 1 next", "answer 1 next"));
    opened.client->close();
    opened.engine->close();
}

TEST_F(SessionTest, WhatIsSentBeforeTheStartArrives) {
    Recorder clientSaw;
    Recorder engineSaw;
    const OpenedPair opened = openPair(configOf(Role::Client), configOf(Role::Engine));
    const auto bulk = bulkOf(3'000'000);
    opened.client->send(1, question("early", {bulk}));
    opened.client->start(clientSaw);
    opened.engine->start(engineSaw);
    EXPECT_THAT(engineSaw.waitForLines(1), ElementsAre("question 1 early"));
    EXPECT_TRUE(opened.client->waitUntilWritten());
    EXPECT_TRUE(bulk->dropped);
    opened.client->close();
    opened.engine->close();
}

TEST_F(SessionTest, OrderOnTheWireIsTheOrderOfTheCalls) {
    SessionPair pair;
    std::vector<std::string> expected;
    pair.client->send(1, question("q"));
    pair.engineSaw.waitForLines(1);
    for (int i = 0; i < 2000; ++i) {
        // Sizes vary so that some are written at once and some wait for the I/O thread.
        pair.engine->send(i % 2 == 0 ? 0 : 1, notice(std::to_string(i) + std::string(i % 50 == 0 ? 60'000 : 1, '.')));
        expected.push_back("event " + std::to_string(i % 2 == 0 ? 0 : 1) + " " + std::to_string(i) +
                           std::string(i % 50 == 0 ? 60'000 : 1, '.'));
    }
    EXPECT_EQ(pair.clientSaw.waitForLines(2000), expected);
}

TEST_F(SessionTest, ManyThreadsSendAtOnceAndEachKeepsItsOrder) {
    SessionPair pair;
    constexpr int perThread = 300;
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([&pair, t] {
            for (int i = 0; i < perThread; ++i) {
                pair.engine->send(0, notice(std::to_string(t) + " " + std::to_string(i) + std::string(3000, '.')));
                EXPECT_TRUE(pair.engine->waitForRoom());
            }
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    std::array<int, 4> next{};
    for (const std::string& line : pair.clientSaw.waitForLines(4 * perThread)) {
        const auto t = static_cast<std::size_t>(line.at(8) - '0');
        ASSERT_EQ(std::stoi(line.substr(10)), next.at(t)++) << line.substr(0, 20);
    }
}

// Zero copy.

TEST_F(SessionTest, BulkBytesArriveInBuffersOfTheAllocatorAndTheSendersAreLetGo) {
    SessionPair pair;
    std::vector<std::shared_ptr<Bulk>> bulks;
    for (const std::size_t size : {std::size_t{0}, std::size_t{1}, std::size_t{100'000}, std::size_t{20'000'000}}) {
        bulks.push_back(std::make_shared<Bulk>());
        bulks.back()->bytes.assign(size, static_cast<char>('a' + bulks.size()));
    }
    pair.client->send(1, question("bulky", bulks));
    EXPECT_THAT(pair.engineSaw.waitForLines(1), ElementsAre("question 1 bulky"));
    const auto received = pair.engineSaw.lastQuestion();
    ASSERT_EQ(received->received.size(), bulks.size());
    for (std::size_t i = 0; i < bulks.size(); ++i) {
        const framing::Frame& frame = *received->received[i];
        EXPECT_EQ(BufferAllocator::sizeOf(frame.data()), bulks[i]->bytes.size());
        EXPECT_TRUE(std::string_view(frame.data(), frame.size()) == bulks[i]->bytes) << i;
    }
    EXPECT_TRUE(pair.client->waitUntilWritten());
    for (const auto& bulk : bulks) {
        EXPECT_TRUE(bulk->dropped);
    }
}

TEST_F(SessionTest, FrameOnItsWayOutHasTheSendersOwnAddress) {
    const void* traced = nullptr;
    SessionConfig config = configOf(Role::Client);
    config.trace = [&](const session::FrameTrace& trace) {
        if (trace.outgoing && dynamic_cast<const framing::DataFrame*>(&trace.frame) != nullptr) {
            traced = trace.frame.data();
        }
    };
    SessionPair pair(config);
    const auto bulk = bulkOf(1000);
    pair.client->send(1, question("q", {bulk}));
    EXPECT_EQ(traced, bulk->bytes.data());
    pair.engineSaw.waitForLines(1);
}

TEST_F(SessionTest, BytesThatMayChangeAfterTheSendArriveAsTheyWere) {
    SessionWithBytes end(configOf(Role::Client));
    const auto bulk = bulkOf(5'000'000);
    bulk->shareable = false;
    end.session->send(1, question("q", {bulk}));
    bulk->bytes.assign(bulk->bytes.size(), 'X');
    EXPECT_TRUE(end.peer->read(24 + 5'000'000) == wire::data(1, 1, false, std::string(5'000'000, 'b')));
    EXPECT_EQ(end.peer->read(24 + 13 + 1), wire::tagged(1, 2, true, questionTag, "q"));
}

// The trace and the check.

TEST_F(SessionTest, TraceSeesEveryFrameInBothDirections) {
    std::mutex mutex;
    std::vector<std::string> traced;
    SessionConfig config = configOf(Role::Client);
    config.trace = [&](const session::FrameTrace& trace) {
        const auto* const tagged = dynamic_cast<const framing::TaggedFrame*>(&trace.frame);
        const std::lock_guard lock(mutex);
        traced.push_back(std::string(trace.outgoing ? "> " : "< ") + std::to_string(trace.frame.index()) + " " +
                         std::string(tagged ? tagged->tag() : "data") + (trace.last ? " last " : " ") +
                         std::string(trace.frame.data(), trace.frame.size()));
    };
    SessionPair pair(config);
    pair.engineSaw.answerWith(
        [&](framing::StreamID stream, const Question&) { pair.engine->send(stream, answer("a")); });
    const auto bulk = std::make_shared<Bulk>();
    bulk->bytes = "bytes";
    pair.client->send(1, question("q", {bulk}));
    pair.clientSaw.waitForLines(1);
    const std::lock_guard lock(mutex);
    EXPECT_THAT(traced, ElementsAre("> 1 data bytes", "> 2 test:question last q", "< 1 test:answer last a"));
}

TEST_F(SessionTest, ContentThatIsNotOneWholeMessageClosesTheSessionBeforeTheSerializerRuns) {
    SessionConfig config = configOf(Role::Engine);
    config.check = std::make_shared<const session::WireWalk>(
        session::WireWalk::Messages{{"test:question", msg_svc::protobuf::IDType::descriptor()}});
    SessionPair pair(configOf(Role::Client), config);
    pair.client->send(1, question("\x08\x01"));
    pair.client->send(2, question("\x08"));
    const std::string refusal = R"(frame "test:question", byte 0, field hi: expected 1 more byte, got none)";
    EXPECT_EQ(pair.engineSaw.waitForEnd().text, refusal);
    EXPECT_EQ(pair.clientSaw.waitForEnd().text, "the peer closed the session: " + refusal);
}

// A forked child.

TEST_F(SessionTest, AbandonedSessionIsInertInTheChildAndWholeInTheParent) {
    auto pair = std::make_unique<SessionPair>();
    pair->engineSaw.answerWith(
        [&](framing::StreamID stream, const Question&) { pair->engine->send(stream, answer("a")); });
    const auto openDescriptors = [] {
        std::size_t count = 0;
        for (int descriptor = 0; descriptor < 1000; ++descriptor) {
            count += ::fcntl(descriptor, F_GETFD) >= 0 ? 1 : 0;
        }
        return count;
    };
    const std::size_t before = openDescriptors();
    const pid_t child = ::fork();
    if (child == 0) {
        pair->client->abandonInChild();
        pair->engine->abandonInChild();
        // Two sessions, each with two descriptors of the stream and two of its own.
        const bool closed = openDescriptors() == before - 8;
        pair->client->send(5, question("from the child"));
        pair->client->sayGoodbye();
        pair->client->abort("from the child");
        const bool inert = pair->client->waitForRoom() && pair->client->waitUntilWritten();
        pair->client->close();
        pair.reset();
        ::_exit(closed && inert ? 0 : 1);
    }
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
    pair->client->send(1, question("q"));
    EXPECT_THAT(pair->clientSaw.waitForLines(1), ElementsAre("answer 1 a"));
}

// As an engine's is that talks on its standard input and output.
TEST_F(SessionTest, AbandonedSessionOnStandardInputLetsGoOfIt) {
    const int standardInput = ::fcntl(STDIN_FILENO, F_DUPFD_CLOEXEC, 3);
    ASSERT_GE(standardInput, 0);
    Ends ends = pipes();
    ASSERT_EQ(::dup2(ends.in, STDIN_FILENO), STDIN_FILENO);
    ::close(ends.in);
    ends.in = STDIN_FILENO;
    {
        wire::ByteEnd peer(ends.otherIn, ends.otherOut);
        const auto session = openWith(peer, ends, configOf(Role::Client));
        const pid_t child = ::fork();
        if (child == 0) {
            session->abandonInChild();
            ::_exit(::fcntl(STDIN_FILENO, F_GETFD) < 0 ? 0 : 1);
        }
        int status = 0;
        ASSERT_EQ(::waitpid(child, &status, 0), child);
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
    }
    EXPECT_EQ(::dup2(standardInput, STDIN_FILENO), STDIN_FILENO);
    ::close(standardInput);
}

TEST_F(SessionTest, ManySessionsLeaveNoDescriptorBehind) {
    const auto next = [] {
        const int descriptor = ::dup(0);
        ::close(descriptor);
        return descriptor;
    };
    const int before = next();
    for (int i = 0; i < 20; ++i) {
        SessionPair pair;
        pair.client->send(1, question("q"));
    }
    EXPECT_EQ(next(), before);
}

}  // namespace
}  // namespace testing_sessions
