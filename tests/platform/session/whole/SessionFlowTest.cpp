// Back-pressure, and how sessions end.

#include <fcntl.h>
#include <sys/eventfd.h>
#include <sys/mman.h>
#include <unistd.h>

#include <future>
#include <thread>

#include "platform/session/support/TestSessions.hpp"
#include "platform/session/support/WireBytes.hpp"
#include "support/Eventually.hpp"

namespace testing_sessions {
namespace {

using std::chrono::milliseconds;
using testing::ElementsAre;

class SessionFlowTest : public testing::Test {
  protected:
    // More than any socket buffer takes.
    static constexpr std::size_t plenty = 8U << 20;

    // Fills the stream of an engine whose peer does not read, until output has to wait.
    static std::size_t fill(Session& engine) {
        std::size_t sent = 0;
        while (sent < plenty) {
            engine.send(0, notice(std::string(65'536, 'n')));
            sent += 65'536 + 24 + 11;
        }
        return sent;
    }

    Registered protocol_{"test"};
};

// Back-pressure.

TEST_F(SessionFlowTest, SendNeverWaitsForAPeerThatDoesNotRead) {
    SessionWithBytes end(configOf(Role::Engine));
    const std::size_t sent = fill(*end.session);
    // The peer's questions come through all the same.
    end.peer->write(wire::tagged(1, 1, true, questionTag, "q"));
    EXPECT_THAT(end.saw.waitForLines(1), ElementsAre("question 1 q"));
    std::thread reader([&] { EXPECT_EQ(end.peer->read(sent).size(), sent); });
    EXPECT_TRUE(end.session->waitUntilWritten());
    reader.join();
}

// A client that sends more than its stream takes, and reads what an engine says. The engine says something new whenever
// something of it was read, so that there is always more than one read takes.
class EndlesslyTold : public Recorder {
  public:
    EndlesslyTold(Session& session, wire::ByteEnd& engine) : session_(session), engine_(engine) {}

    void onEvent(framing::StreamID /*stream*/, const boost::shared_ptr<const eventmgr::BaseEvent>& /*event*/) override {
        if (events_++ == 0) {
            session_.send(1, question("q", {bulkOf(sent - 24 - 24 - std::string(questionTag).size() - 1)}));
            for (int ahead = 0; ahead < 4; ++ahead) {
                engine_.write(something());
            }
        }
        const std::uint64_t written = session_.traffic().written - before_;
        received_ += engine_.read(written - received_).size();
        if (received_ == sent || events_ == most) {
            if (!done_) {
                done_ = true;
                result_.set_value(received_);
            }
        } else {
            engine_.write(something());
        }
    }

    static std::string something() { return wire::tagged(0, 1, true, noticeTag, std::string(30'000, 'n')); }

    /// Bytes of what the client had to say when all of it was written, or when so much was read that it should have
    /// been.
    std::size_t waitUntilWritten() { return result_.get_future().get(); }

    static constexpr std::size_t sent = 1U << 20;

  private:
    static constexpr std::size_t most = 2'000;

    Session& session_;
    wire::ByteEnd& engine_;
    const std::uint64_t before_ = session_.traffic().written;
    std::size_t events_ = 0;
    std::size_t received_ = 0;
    bool done_ = false;
    std::promise<std::size_t> result_;
};

TEST_F(SessionFlowTest, PeerThatNeverStopsSendingLetsTheSessionWrite) {
    const Ends ends = pipes();
    // Room for more than one read takes.
    ASSERT_GE(::fcntl(ends.otherOut, F_SETPIPE_SZ, 1 << 20), 1 << 20);
    wire::ByteEnd engine(ends.otherIn, ends.otherOut);
    const auto session = openWith(engine, ends, configOf(Role::Client));
    EndlesslyTold told(*session, engine);
    session->start(told);
    engine.write(EndlesslyTold::something());
    EXPECT_EQ(told.waitUntilWritten(), EndlesslyTold::sent);
    session->close(milliseconds(0));
}

TEST_F(SessionFlowTest, TrafficTellsOfTheFrameThatIsArriving) {
    SessionWithBytes end(configOf(Role::Engine));
    std::promise<std::pair<std::uint64_t, std::uint64_t>> whenTold;
    end.saw.answerWith([&](framing::StreamID, const Question&) {
        const session::Traffic traffic = end.session->traffic();
        whenTold.set_value(std::pair(traffic.arriving, traffic.arrived));
    });
    const std::string bytes = wire::tagged(1, 1, true, questionTag, std::string(100'000, 'q'));
    end.peer->write(bytes.substr(0, bytes.size() - 40'000));
    EXPECT_TRUE(test_support::eventually([&] { return end.session->traffic().arrived == 60'000; }));
    EXPECT_EQ(end.session->traffic().arriving, 100'000U);
    end.peer->write(bytes.substr(bytes.size() - 40'000));
    // Whoever is told of a message finds that it has arrived.
    EXPECT_EQ(whenTold.get_future().get(), std::pair(std::uint64_t{0}, std::uint64_t{0}));
}

TEST_F(SessionFlowTest, WaitForRoomReturnsAtOnceWhenThereIsRoom) {
    SessionWithBytes end(configOf(Role::Engine));
    EXPECT_TRUE(end.session->waitForRoom());
    EXPECT_TRUE(end.session->waitUntilWritten());
    end.session->send(0, notice("n"));
    EXPECT_TRUE(end.session->waitForRoom());
}

TEST_F(SessionFlowTest, WaitsEndWhenTheirDescriptorBecomesReadable) {
    SessionWithBytes end(configOf(Role::Engine));
    fill(*end.session);
    const int interrupt = ::eventfd(0, EFD_CLOEXEC);
    auto room = std::async(std::launch::async, [&] { return end.session->waitForRoom(interrupt); });
    auto written = std::async(std::launch::async, [&] { return end.session->waitUntilWritten(interrupt); });
    EXPECT_EQ(room.wait_for(milliseconds(20)), std::future_status::timeout);
    EXPECT_EQ(::eventfd_write(interrupt, 1), 0);
    EXPECT_FALSE(room.get());
    EXPECT_FALSE(written.get());
    ::close(interrupt);
}

TEST_F(SessionFlowTest, WaitForRoomEndsWhenThePeerHasReadEnough) {
    SessionConfig config = configOf(Role::Engine);
    config.roomBytes = 100'000;
    SessionWithBytes end(config);
    const std::size_t sent = fill(*end.session);
    const int never = ::eventfd(0, EFD_CLOEXEC);
    auto room = std::async(std::launch::async, [&] { return end.session->waitForRoom(never); });
    EXPECT_EQ(end.peer->read(sent - 90'000).size(), sent - 90'000);
    EXPECT_TRUE(room.get());
    end.peer->read(90'000);
    EXPECT_TRUE(end.session->waitUntilWritten(never));
    ::close(never);
}

TEST_F(SessionFlowTest, WaitsEndWhenTheSessionEnds) {
    SessionWithBytes end(configOf(Role::Engine));
    fill(*end.session);
    auto room = std::async(std::launch::async, [&] { return end.session->waitForRoom(); });
    auto written = std::async(std::launch::async, [&] { return end.session->waitUntilWritten(); });
    end.peer->close();
    EXPECT_TRUE(room.get());
    EXPECT_TRUE(written.get());
    end.session->send(0, notice("into the void"));
    EXPECT_TRUE(end.session->waitForRoom());
}

TEST_F(SessionFlowTest, BuffersAreLetGoWhenTheyAreWrittenNotBefore) {
    SessionWithBytes end(configOf(Role::Client));
    const auto bytes = bulkOf(plenty);
    end.session->send(1, question("q", {bytes}));
    EXPECT_FALSE(bytes->dropped);
    std::thread reader([&] { end.peer->read(plenty + 24 + 24 + 13 + 1); });
    EXPECT_TRUE(end.session->waitUntilWritten());
    EXPECT_TRUE(bytes->dropped);
    reader.join();
}

TEST_F(SessionFlowTest, BuffersAreLetGoWhenTheSessionEndsUnwritten) {
    const auto bytes = bulkOf(plenty);
    {
        SessionWithBytes end(configOf(Role::Client));
        end.session->send(1, question("q", {bytes}));
        EXPECT_FALSE(bytes->dropped);
    }
    EXPECT_TRUE(bytes->dropped);
}

// An engine that owes its client as many answers as it may, because the client does not read. The client has sent two
// questions and a goodbye more.
class HeldBackTest : public SessionFlowTest {
  protected:
    static constexpr std::size_t bound = 5;

    explicit HeldBackTest(Ends ends = socketPair()) : end_(config(), ends) {
        end_.saw.answerWith([this](framing::StreamID stream, const Question&) {
            end_.session->send(stream, answer("a"), Session::Urgency::Answer);
        });
        unread_ = fill(*end_.session);
        std::string bytes;
        for (std::uint64_t stream = 1; stream <= bound + 2; ++stream) {
            bytes += wire::tagged(stream, 1, true, questionTag, "q");
        }
        end_.peer->write(bytes);
        end_.saw.waitForLines(bound);
    }

    static SessionConfig config() {
        SessionConfig config = configOf(Role::Engine);
        config.maxPendingAnswers = bound;
        return config;
    }

    SessionWithBytes end_;
    std::size_t unread_ = 0;
};

TEST_F(HeldBackTest, NothingMoreIsReadUntilThePeerReads) {
    // All that the stream takes, so the test would see that somebody reads it.
    const std::string bytes = wire::tagged(100, 1, true, questionTag, std::string(100'000, 'q'));
    std::size_t taken = 0;
    std::size_t left = 0;
    while (taken < plenty) {
        const auto count = end_.peer->writeSome(bytes.substr(left));
        if (count == 0) {
            break;
        }
        taken += count;
        left = (left + count) % bytes.size();
        ASSERT_LE(taken, plenty);
    }
    EXPECT_LT(taken, plenty);
    EXPECT_EQ(end_.saw.lines().size(), bound);
}

TEST_F(HeldBackTest, PeerThatReadsAgainIsAnsweredInFull) {
    end_.peer->write(wire::goodbye());
    std::string bytes;
    std::string answers;
    for (std::uint64_t stream = 1; stream <= bound + 2; ++stream) {
        answers += wire::tagged(stream, 1, true, answerTag, "a");
    }
    EXPECT_EQ(end_.peer->read(unread_).size(), unread_);
    EXPECT_EQ(end_.peer->read(answers.size()), answers);
    const auto lines = end_.saw.waitForLines(bound + 3);
    EXPECT_EQ(lines[bound + 1], "question 7 q");
    EXPECT_EQ(lines[bound + 2], "goodbye");
}

TEST_F(HeldBackTest, PeerThatHangsUpIsNoticed) {
    end_.peer->close();
    EXPECT_THAT(end_.saw.waitForEnd(), isEnd(Reason::Lost,
                                             "the stream ended between two messages, without the client's goodbye; "
                                             "writing to it had failed: Broken pipe"));
}

class HeldBackOverPipesTest : public HeldBackTest {
  protected:
    HeldBackOverPipesTest() : HeldBackTest(pipes()) {}
};

TEST_F(HeldBackOverPipesTest, PeerThatHangsUpIsNoticed) {
    end_.peer->close();
    EXPECT_THAT(end_.saw.waitForEnd(), isEnd(Reason::Lost,
                                             "the stream ended between two messages, without the client's goodbye; "
                                             "writing to it had failed: Broken pipe"));
}

TEST_F(HeldBackTest, PeerThatHangsUpAfterItsGoodbyeIsNoticed) {
    end_.peer->write(wire::goodbye());
    end_.peer->close();
    EXPECT_THAT(end_.saw.waitForEnd(), isEnd(Reason::Lost, "cannot write to the stream: Broken pipe"));
}

TEST_F(HeldBackTest, SessionCanBeClosed) {
    end_.session->close(milliseconds(0));
    EXPECT_EQ(end_.saw.lines().back(), "end: closed");
    EXPECT_EQ(end_.saw.lines().size(), bound + 1);
}

TEST_F(HeldBackTest, SessionCanBeAborted) {
    end_.session->abort("enough");
    EXPECT_EQ(end_.saw.waitForEnd().text, "enough");
}

TEST_F(SessionFlowTest, ClientThatReadsWhileItWritesGetsAllAnswers) {
    SessionWithBytes end(configOf(Role::Engine));
    end.saw.answerWith([&](framing::StreamID stream, const Question&) {
        end.session->send(stream, answer("a"), Session::Urgency::Answer);
    });
    std::string questions;
    std::string answers;
    for (std::uint64_t stream = 1; stream <= 100'000; ++stream) {
        questions += wire::tagged(stream, 1, true, questionTag, "q");
        answers += wire::tagged(stream, 1, true, answerTag, "a");
    }
    std::thread writer([&] { end.peer->write(questions); });
    EXPECT_TRUE(end.peer->read(answers.size()) == answers);
    writer.join();
}

TEST_F(SessionFlowTest, AnswersThatAreReadDoNotCount) {
    SessionConfig config = configOf(Role::Engine);
    config.maxPendingAnswers = 1;
    SessionPair pair(configOf(Role::Client), config);
    pair.engineSaw.answerWith([&](framing::StreamID stream, const Question&) {
        pair.engine->send(stream, answer("a"), Session::Urgency::Answer);
    });
    for (framing::StreamID stream = 1; stream <= 50; ++stream) {
        pair.client->send(stream, question("q"));
        pair.clientSaw.waitForLines(stream);
    }
}

// The end of a session.

TEST_F(SessionFlowTest, ClientWhoseEngineClosesWithoutAShutdownEventHasLostIt) {
    SessionWithBytes end(configOf(Role::Client));
    end.peer->close();
    EXPECT_THAT(end.saw.waitForEnd(),
                isEnd(Reason::Lost, "the stream ended between two messages, before the engine's shutdown event"));
}

TEST_F(SessionFlowTest, EngineWhoseClientClosesWithoutAGoodbyeHasLostIt) {
    SessionWithBytes end(configOf(Role::Engine));
    end.peer->close();
    EXPECT_THAT(end.saw.waitForEnd(),
                isEnd(Reason::Lost, "the stream ended between two messages, without the client's goodbye"));
}

TEST_F(SessionFlowTest, StreamThatEndsWithinAMessageTellsWhere) {
    SessionWithBytes end(configOf(Role::Engine));
    end.peer->write(wire::data(1, 1, false, "12345") + wire::tagged(1, 2, true, questionTag, "question").substr(0, 40));
    end.peer->close();
    EXPECT_EQ(end.saw.waitForEnd().text,
              "the stream ended in the middle of a message: 3 of 8 content bytes of frame 2, tag \"test:question\", "
              "had arrived");
}

TEST_F(SessionFlowTest, ClientThatWasToldOfTheShutdownIsFinished) {
    SessionWithBytes end(configOf(Role::Client));
    end.peer->write(wire::tagged(0, 1, true, shutdownTag, ""));
    end.peer->close();
    EXPECT_EQ(end.saw.waitForEnd().reason, Reason::Finished);
    EXPECT_THAT(end.saw.lines(), ElementsAre("event 0 shutdown", "end: finished"));
}

TEST_F(SessionFlowTest, ClientThatClosesAfterTheShutdownEventIsFinished) {
    SessionWithBytes end(configOf(Role::Client));
    end.peer->write(wire::tagged(0, 1, true, shutdownTag, ""));
    end.saw.waitForLines(1);
    end.session->close();
    EXPECT_EQ(end.saw.waitForEnd().reason, Reason::Finished);
}

TEST_F(SessionFlowTest, WithoutAShutdownEventNothingIsTheLastMessage) {
    SessionConfig config = configOf(Role::Client);
    config.shutdownEvent.reset();
    SessionWithBytes end(config);
    end.peer->write(wire::tagged(0, 1, true, shutdownTag, "") + wire::tagged(0, 1, true, noticeTag, "more"));
    end.peer->close();
    EXPECT_EQ(end.saw.waitForEnd().reason, Reason::Lost);
    EXPECT_THAT(end.saw.lines(),
                ElementsAre("event 0 shutdown", "event 0 more",
                            "end: lost: the stream ended between two messages, before the engine's shutdown event"));
}

TEST_F(SessionFlowTest, EngineGoesOnSendingAfterTheClientsGoodbyeAndEndOfStream) {
    const Ends ends = socketPair();
    SessionWithBytes end(configOf(Role::Engine), ends);
    end.peer->write(wire::tagged(1, 1, true, questionTag, "q") + wire::goodbye());
    end.peer->closeWriting();
    EXPECT_THAT(end.saw.waitForLines(2), ElementsAre("question 1 q", "goodbye"));
    end.session->send(1, answer("a"));
    end.session->send(0, shutdownEvent());
    end.session->close();
    EXPECT_EQ(end.peer->readAll(),
              wire::tagged(1, 1, true, answerTag, "a") + wire::tagged(0, 1, true, shutdownTag, ""));
    EXPECT_THAT(end.saw.lines(), ElementsAre("question 1 q", "goodbye", "end: finished"));
}

TEST_F(SessionFlowTest, EngineWhoseClientHasGoneAfterTheGoodbyeHasLostIt) {
    SessionWithBytes end(configOf(Role::Engine));
    end.peer->write(wire::goodbye());
    end.saw.waitForLines(1);
    end.peer->close();
    // Without a write that would fail.
    EXPECT_THAT(end.saw.waitForEnd(), isEnd(Reason::Lost, "the client has gone before the engine's shutdown event"));
}

TEST_F(SessionFlowTest, EngineWhoseClientClosesUponTheShutdownEventIsFinished) {
    SessionWithBytes end(configOf(Role::Engine));
    end.session->send(0, shutdownEvent());
    end.peer->read(24 + 13);
    end.peer->close();
    EXPECT_EQ(end.saw.waitForEnd().reason, Reason::Finished);
}

TEST_F(SessionFlowTest, NothingIsDeliveredAfterThePeersAbortWhileOutputIsUnwritten) {
    SessionWithBytes end(configOf(Role::Engine));
    fill(*end.session);
    end.peer->write(wire::abort("enough") + wire::tagged(1, 1, true, questionTag, "q"));
    end.saw.waitForEnd();
    EXPECT_THAT(end.saw.lines(), ElementsAre("end: violation: the peer closed the session: enough"));
}

// As a recorded one is that an engine is given as its standard input.
TEST_F(SessionFlowTest, WhatTheClientSaysMayBeAFile) {
    const std::string said = wire::helloBytes(wire::hello(msg_svc::protobuf::SessionHello::CLIENT)) +
                             wire::verdictBytes(wire::acceptance()) + wire::tagged(1, 1, true, questionTag, "q") +
                             wire::goodbye();
    Ends ends = pipes();
    ::close(ends.in);
    ends.in = ::memfd_create("said", MFD_CLOEXEC);
    ASSERT_EQ(::pwrite(ends.in, said.data(), said.size(), 0), static_cast<ssize_t>(said.size()));
    wire::ByteEnd peer(ends.otherIn, ends.otherOut);
    Recorder saw;
    const auto session = Session::open(ends.in, ends.out, configOf(Role::Engine));
    session->start(saw);
    EXPECT_THAT(saw.waitForLines(2), ElementsAre("question 1 q", "goodbye"));
}

TEST_F(SessionFlowTest, CloseWithoutCeremonyIsClosedHereAndLostThere) {
    SessionPair pair;
    pair.client->close();
    EXPECT_THAT(pair.clientSaw.lines(), ElementsAre("end: closed"));
    EXPECT_EQ(pair.engineSaw.waitForEnd().reason, Reason::Lost);
    pair.client->close();
    pair.client->send(1, question("too late"));
    pair.client->abort("too late");
    EXPECT_THAT(pair.clientSaw.lines(), ElementsAre("end: closed"));
}

TEST_F(SessionFlowTest, CloseWritesWhatIsUnwritten) {
    SessionWithBytes end(configOf(Role::Engine));
    const std::size_t sent = fill(*end.session);
    auto reader = std::async(std::launch::async, [&] { return end.peer->readAll().size(); });
    end.session->close(std::chrono::seconds(30));
    EXPECT_EQ(reader.get(), sent);
    EXPECT_EQ(end.saw.waitForEnd().reason, Reason::Closed);
}

TEST_F(SessionFlowTest, CloseLosesPatienceWithAPeerThatDoesNotRead) {
    SessionWithBytes end(configOf(Role::Engine));
    fill(*end.session);
    end.session->close(milliseconds(10));
    EXPECT_THAT(end.saw.lines(), ElementsAre("end: closed"));
}

TEST_F(SessionFlowTest, SeveralThreadsMayClose) {
    SessionPair pair;
    std::vector<std::thread> threads;
    for (int i = 0; i < 4; ++i) {
        threads.emplace_back([&] {
            pair.client->close();
            EXPECT_EQ(pair.clientSaw.lines().size(), 1U);
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
}

TEST_F(SessionFlowTest, DestructionClosesAndTellsTheHandler) {
    const Ends ends = socketPair();
    Recorder saw;
    wire::ByteEnd peer(ends.otherIn, ends.otherOut);
    {
        const auto session = openWith(peer, ends, configOf(Role::Client));
        session->start(saw);
    }
    EXPECT_THAT(saw.lines(), ElementsAre("end: closed"));
    EXPECT_EQ(peer.readAll(), "");
}

TEST_F(SessionFlowTest, SessionThatEndedBeforeItsStartStillTellsTheHandler) {
    const Ends ends = socketPair();
    Recorder saw;
    wire::ByteEnd peer(ends.otherIn, ends.otherOut);
    const auto session = openWith(peer, ends, configOf(Role::Client));
    session->abort("never mind");
    EXPECT_EQ(peer.readAll(), wire::abort("never mind"));
    session->start(saw);
    EXPECT_EQ(saw.waitForEnd().text, "never mind");
}

TEST_F(SessionFlowTest, SessionThatIsNeverStartedCanBeDestroyed) {
    const Ends ends = socketPair();
    wire::ByteEnd peer(ends.otherIn, ends.otherOut);
    auto session = openWith(peer, ends, configOf(Role::Client));
    session->send(1, question("q"));
    session.reset();
    EXPECT_EQ(peer.readAll(), wire::tagged(1, 1, true, questionTag, "q"));
}

// The peer has said its last words and closed; this end's own writing fails first.
TEST_F(SessionFlowTest, LastWordsAreHeardAfterAWriteHasFailed) {
    const Ends ends = pipes();
    SessionWithBytes end(configOf(Role::Client), ends);
    // Keeps this end's input open while its output loses its reader.
    const int keptOpen = ::fcntl(ends.otherOut, F_DUPFD_CLOEXEC, 0);
    end.peer->close();
    end.session->send(1, question("q"));
    wire::ByteEnd lastWords(-1, keptOpen);
    lastWords.write(wire::tagged(0, 1, true, shutdownTag, ""));
    lastWords.close();
    EXPECT_EQ(end.saw.waitForEnd().reason, Reason::Finished);
}

TEST_F(SessionFlowTest, StreamWhoseWritingFailsIsLostThoughItsInputStaysOpen) {
    const Ends ends = pipes();
    SessionWithBytes end(configOf(Role::Client), ends);
    const int keptOpen = ::fcntl(ends.otherOut, F_DUPFD_CLOEXEC, 0);
    end.peer->close();
    end.session->send(1, question("q"));
    EXPECT_THAT(end.saw.waitForEnd(), isEnd(Reason::Lost, "cannot write to the stream: Broken pipe"));
    ::close(keptOpen);
}

// close() does not hide that nobody heard the last event.
TEST_F(SessionFlowTest, EngineThatClosesAfterAFailedWriteHasLostItsClient) {
    const Ends ends = pipes();
    SessionWithBytes end(configOf(Role::Engine), ends);
    const int keptOpen = ::fcntl(ends.otherOut, F_DUPFD_CLOEXEC, 0);
    end.peer->write(wire::goodbye());
    end.saw.waitForLines(1);
    end.peer->close();
    end.session->send(0, shutdownEvent());
    end.session->close();
    EXPECT_THAT(end.saw.waitForEnd(), isEnd(Reason::Lost, "cannot write to the stream: Broken pipe"));
    ::close(keptOpen);
}

}  // namespace
}  // namespace testing_sessions
