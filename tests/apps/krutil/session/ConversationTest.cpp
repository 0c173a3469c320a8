// A conversation with an engine in the same process.

#include "krutil/session/Conversation.hpp"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <boost/make_shared.hpp>
#include <csignal>
#include <functional>
#include <future>
#include <optional>
#include <thread>

#include "cmddistributor/EvalIIP.hpp"
#include "cmddistributor/IIPEnqueueMessage.hpp"
#include "cmddistributor/IIPStateEvent.hpp"
#include "common/KrutilSession.hpp"
#include "krutil/base/ExitCode.hpp"
#include "krutil/base/Interrupt.hpp"
#include "krutil/cmddistributor/IIPReply.hpp"
#include "krutil/eventmgr/QVMShutdownEvent.hpp"
#include "krutil/io/TextBaseEvent.hpp"
#include "support/Pipe.hpp"

namespace krutil_client {
namespace {

namespace session = foundation::msg_svc::transport::layers::session;
namespace exchange = foundation::msg_svc::exchange;
using foundation::msg_svc::eventmgr::BaseEvent;
using krutil::io::StreamTypeEnum;
using krutil::io::TextBaseEvent;
using namespace std::chrono_literals;

// Does what a test wants with each request, on the engine's I/O thread.
class TestEngine : public session::SessionHandler {
  public:
    using Action = std::function<void(TestEngine&, session::framing::StreamID, const exchange::IDType&)>;

    explicit TestEngine(Action action) : action_(std::move(action)) {}

    void open(int stream) {
        session_ = session::Session::open(stream, stream, apps::krutilSession(session::Role::Engine));
        session_->start(*this);
    }

    void text(session::framing::StreamID stream, const std::u16string& text) {
        session_->send(stream, boost::shared_ptr<const BaseEvent>(boost::make_shared<const TextBaseEvent>(
                                   exchange::IDType(1, 1), StreamTypeEnum::OUTPUT_STREAM, text)));
    }

    void reply(session::framing::StreamID stream, const exchange::IDType& id) {
        session_->send(
            stream, boost::shared_ptr<const exchange::Reply>(boost::make_shared<const krutil::cmddistributor::IIPReply>(
                        id, std::make_unique<cmddistributor::IIPResult>(id, boost::none))));
    }

    void onMessage(session::framing::StreamID stream,
                   const boost::shared_ptr<const exchange::Message>& message) override {
        action_(*this, stream, dynamic_cast<const cmddistributor::IIPEnqueueMessage&>(*message).getID());
    }

    void onGoodbye() override {
        session_->send(
            0, boost::shared_ptr<const BaseEvent>(boost::make_shared<const krutil::eventmgr::QVMShutdownEvent>()));
        goodbye.set_value();
    }

    void onEnd(const session::SessionEnd&) override {}

    session::Session& session() { return *session_; }

    std::promise<void> goodbye;

  private:
    Action action_;
    std::unique_ptr<session::Session> session_;
};

boost::shared_ptr<const exchange::Message> enqueue(const exchange::IDType& id) {
    const krutil::io::SinkTraits traits;
    return boost::make_shared<const cmddistributor::IIPEnqueueMessage>(
        boost::make_shared<const cmddistributor::EvalIIP>("python", cmddistributor::IqmStreamID::ekIqmCmdWinStream,
                                                          nullptr, traits, traits, u"1",
                                                          cmddistributor::CodeType::CodeBlockType),
        id, 0, boost::none, nullptr, krutil::cmddistributor::WhenToDequeue::DEQUEUE_AT_IDLE, u"",
        capabilities::CapabilityList{}, nullptr, false);
}

exchange::IDType idOf(const Conversation::Reply& reply) {
    return dynamic_cast<const krutil::cmddistributor::IIPReply&>(*reply).getID();
}

class ConversationTest : public ::testing::Test {
  protected:
    void begin(TestEngine::Action action) {
        int ends[2];
        ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends), 0);
        engine.emplace(std::move(action));
        std::thread opening([this, &ends] { engine->open(ends[1]); });
        conversation.emplace(ends[0], apps::krutilSession(session::Role::Client), events, interrupt);
        opening.join();
        events.subscribe<TextBaseEvent>([this](const TextBaseEvent& event) { texts.push_back(event.getText()); });
    }

    ~ConversationTest() override {
        conversation.reset();
        engine.reset();
    }

    Interrupt interrupt;
    foundation::msg_svc::eventmgr::EventMgr events;
    std::optional<TestEngine> engine;
    std::optional<Conversation> conversation;
    std::vector<std::u16string> texts;
};

TEST_F(ConversationTest, EventsAreDeliveredBeforeTheReplyAndOnTheThreadThatWaits) {
    begin([](TestEngine& peer, auto stream, const auto& id) {
        peer.text(stream, u"a");
        peer.text(stream, u"b");
        peer.reply(stream, id);
    });
    const auto here = std::this_thread::get_id();
    events.subscribe<TextBaseEvent>([here](const auto&) { EXPECT_EQ(std::this_thread::get_id(), here); });
    const auto reply = conversation->ask(enqueue(exchange::IDType(1, 2)));
    EXPECT_EQ(idOf(reply), exchange::IDType(1, 2));
    EXPECT_EQ(texts, (std::vector<std::u16string>{u"a", u"b"}));
}

TEST_F(ConversationTest, ASubscriberMayItselfAskAndWait) {
    begin([](TestEngine& peer, auto stream, const auto& id) {
        // The outer request is answered after the inner one that it leads to.
        static session::framing::StreamID outerStream;
        if (id == exchange::IDType(1, 1)) {
            outerStream = stream;
            peer.text(stream, u"prompt");
        } else {
            peer.reply(stream, id);
            peer.reply(outerStream, exchange::IDType(1, 1));
        }
    });
    std::vector<exchange::IDType> order;
    events.subscribe<TextBaseEvent>(
        [&](const auto&) { order.push_back(idOf(conversation->ask(enqueue(exchange::IDType(2, 2))))); });
    order.push_back(idOf(conversation->ask(enqueue(exchange::IDType(1, 1)))));
    EXPECT_EQ(order, (std::vector<exchange::IDType>{exchange::IDType(2, 2), exchange::IDType(1, 1)}));
}

TEST_F(ConversationTest, RepliesGoToWhoeverAsked) {
    begin([](TestEngine& peer, auto stream, const auto& id) { peer.reply(stream, id); });
    std::vector<exchange::IDType> answered;
    conversation->send(enqueue(exchange::IDType(1, 1)), [&](const auto& reply) { answered.push_back(idOf(reply)); });
    conversation->send(enqueue(exchange::IDType(2, 2)), [&](const auto& reply) { answered.push_back(idOf(reply)); });
    EXPECT_TRUE(conversation->runUntil(Conversation::Clock::now() + 60s, [&] { return answered.size() == 2; }));
    EXPECT_EQ(answered, (std::vector<exchange::IDType>{exchange::IDType(1, 1), exchange::IDType(2, 2)}));
}

TEST_F(ConversationTest, APastimeGoesOnWhileAQuietExchangeIsAnswered) {
    begin([](TestEngine& peer, auto stream, const auto& id) {
        peer.text(stream, u"text");
        peer.reply(stream, id);
    });
    int stops = 0;
    conversation->setPastime({{}, nullptr, [&stops] { ++stops; }, nullptr});
    bool answered = false;
    conversation->sendQuietly(enqueue(exchange::IDType(1, 1)), [&answered](const auto&) { answered = true; });
    conversation->run([&answered] { return answered; });
    EXPECT_EQ(stops, 0);
    EXPECT_TRUE(texts.empty());
    conversation->ask(enqueue(exchange::IDType(2, 2)));
    EXPECT_EQ(stops, 2) << "one for each delivery";
    EXPECT_EQ(texts, (std::vector<std::u16string>{u"text"}));
    conversation->setPastime({});
}

TEST_F(ConversationTest, FinishingEndsWithTheShutdownEvent) {
    begin([](TestEngine& peer, auto stream, const auto& id) { peer.reply(stream, id); });
    conversation->ask(enqueue(exchange::IDType(1, 1)));
    std::thread closing([this] {
        engine->goodbye.get_future().wait();
        engine->session().close();
    });
    const auto end = conversation->finish(60s);
    closing.join();
    ASSERT_TRUE(end);
    EXPECT_EQ(end->reason, session::SessionEnd::Reason::Finished);
    EXPECT_THROW(conversation->run([] { return false; }), SessionOver);
}

TEST_F(ConversationTest, AnEngineThatGoesEndsTheWait) {
    begin([](TestEngine& peer, auto, const auto&) {
        peer.text(0, u"before");
        peer.session().abort("given up");
    });
    try {
        conversation->ask(enqueue(exchange::IDType(1, 1)));
        FAIL();
    } catch (const SessionOver& over) {
        EXPECT_EQ(over.end().reason, session::SessionEnd::Reason::Violation);
        EXPECT_NE(over.end().text.find("given up"), std::string::npos) << over.end().text;
    }
    EXPECT_EQ(texts, (std::vector<std::u16string>{u"before"}));
}

TEST_F(ConversationTest, ADeadlineEndsTheWaitOnly) {
    begin([](TestEngine& peer, auto stream, const auto& id) { peer.reply(stream, id); });
    EXPECT_FALSE(conversation->runUntil(Conversation::Clock::now(), [] { return false; }));
    EXPECT_EQ(idOf(conversation->ask(enqueue(exchange::IDType(3, 3)))), exchange::IDType(3, 3));
}

TEST_F(ConversationTest, CtrlCIsDispatchedWhileWaiting) {
    begin([](TestEngine&, auto, const auto&) { ::kill(::getpid(), SIGINT); });
    EXPECT_THROW(conversation->ask(enqueue(exchange::IDType(1, 1))), Cancelled);
}

TEST_F(ConversationTest, AWatchedDescriptorIsToldOnce) {
    begin([](TestEngine& peer, auto stream, const auto& id) { peer.reply(stream, id); });
    test_support::Pipe pipe;
    int told = 0;
    conversation->watch(pipe.read.get(), [&told] { ++told; });
    pipe.write.reset();
    EXPECT_TRUE(conversation->runUntil(Conversation::Clock::now() + 60s, [&told] { return told > 0; }));
    conversation->ask(enqueue(exchange::IDType(1, 1)));
    EXPECT_EQ(told, 1);
}

// A main thread that does not deliver holds back the engine, and destroying the conversation does not wait for it.
TEST_F(ConversationTest, WhatIsNotDeliveredHoldsBackTheEngine) {
    begin([](TestEngine&, auto, const auto&) {});
    conversation->send(enqueue(exchange::IDType(1, 1)), [](const auto&) {});
    const std::u16string text(100'000, u'x');
    std::promise<bool> heldBack;
    int fds[2];
    ASSERT_EQ(::pipe2(fds, O_CLOEXEC), 0);
    const foundation::core::posix::OwnedDescriptor stopRead(fds[0]);
    foundation::core::posix::OwnedDescriptor stopWrite(fds[1]);
    std::thread writing([&] {
        // 50 MB, several times what both ends hold: the writer waits for room until it is told to stop.
        for (int i = 0; i < 500; ++i) {
            engine->text(0, text);
            if (!engine->session().waitForRoom(stopRead.get())) {
                heldBack.set_value(true);
                return;
            }
        }
        heldBack.set_value(false);
    });
    // Nothing is delivered here, so the writer stands still after what both ends hold.
    auto result = heldBack.get_future();
    ASSERT_EQ(result.wait_for(500ms), std::future_status::timeout);
    ASSERT_EQ(::write(stopWrite.get(), "x", 1), 1);
    EXPECT_TRUE(result.get());
    writing.join();
    conversation.reset();
}

}  // namespace
}  // namespace krutil_client
