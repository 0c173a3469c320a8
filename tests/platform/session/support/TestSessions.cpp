#include "platform/session/support/TestSessions.hpp"

#include <fcntl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <boost/make_shared.hpp>
#include <chrono>
#include <future>

namespace testing_sessions {
namespace {

constexpr std::chrono::seconds patience{30};

std::string reasonText(Reason reason) {
    switch (reason) {
        case Reason::Finished:
            return "finished";
        case Reason::Lost:
            return "lost";
        case Reason::Violation:
            return "violation";
        case Reason::Closed:
            return "closed";
    }
    return "?";
}

}  // namespace

void Recorder::keep(const std::string& line) {
    const std::lock_guard lock(mutex_);
    lines_.push_back(line);
    changed_.notify_all();
}

void Recorder::answerWith(std::function<void(framing::StreamID, const Question&)> answer) {
    const std::lock_guard lock(mutex_);
    answer_ = std::move(answer);
}

void Recorder::onMessage(framing::StreamID stream, const boost::shared_ptr<const exchange::Message>& message) {
    const auto asked = boost::dynamic_pointer_cast<const Question>(message);
    std::function<void(framing::StreamID, const Question&)> answer;
    {
        const std::lock_guard lock(mutex_);
        lastQuestion_ = asked;
        answer = answer_;
    }
    keep("question " + std::to_string(stream) + " " + asked->text);
    if (answer) {
        answer(stream, *asked);
    }
}

void Recorder::onReply(framing::StreamID stream, const boost::shared_ptr<const exchange::Reply>& reply) {
    keep("answer " + std::to_string(stream) + " " + dynamic_cast<const Answer&>(*reply).text);
}

void Recorder::onEvent(framing::StreamID stream, const boost::shared_ptr<const eventmgr::BaseEvent>& event) {
    std::string text = "capabilities";
    if (const auto* const note = dynamic_cast<const Notice*>(event.get())) {
        text = note->text;
    } else if (dynamic_cast<const Shutdown*>(event.get()) != nullptr) {
        text = "shutdown";
    }
    keep("event " + std::to_string(stream) + " " + text);
}

void Recorder::onGoodbye() {
    keep("goodbye");
}

void Recorder::onEnd(const SessionEnd& end) {
    // The line and the end become visible together: whoever has waited for the end looks at the lines.
    const std::lock_guard lock(mutex_);
    EXPECT_FALSE(end_) << "onEnd called twice";
    end_ = end;
    lines_.push_back("end: " + reasonText(end.reason) + (end.text.empty() ? "" : ": ") + end.text);
    changed_.notify_all();
}

std::vector<std::string> Recorder::lines() const {
    const std::lock_guard lock(mutex_);
    return lines_;
}

std::vector<std::string> Recorder::waitForLines(std::size_t count) {
    std::unique_lock lock(mutex_);
    EXPECT_TRUE(changed_.wait_for(lock, patience, [&] { return lines_.size() >= count; }))
        << "only " << testing::PrintToString(lines_);
    return lines_;
}

SessionEnd Recorder::waitForEnd() {
    std::unique_lock lock(mutex_);
    EXPECT_TRUE(changed_.wait_for(lock, patience, [&] { return end_.has_value(); }))
        << "no end after " << testing::PrintToString(lines_);
    return end_.value_or(SessionEnd{});
}

boost::shared_ptr<const Question> Recorder::lastQuestion() const {
    const std::lock_guard lock(mutex_);
    return lastQuestion_;
}

Ends socketPair() {
    std::array<int, 2> sockets{};
    EXPECT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, sockets.data()), 0);
    return {sockets[0], sockets[0], sockets[1], sockets[1]};
}

Ends pipes() {
    std::array<int, 2> there{};
    std::array<int, 2> back{};
    EXPECT_EQ(::pipe2(there.data(), O_CLOEXEC), 0);
    EXPECT_EQ(::pipe2(back.data(), O_CLOEXEC), 0);
    return {back[0], there[1], there[0], back[1]};
}

SessionConfig configOf(Role role) {
    SessionConfig config;
    config.role = role;
    config.protocol = "test";
    config.version = {1, 0};
    config.shutdownEvent = typeid(Shutdown);
    config.clientEvents = {typeid(CapabilityNews)};
    config.build = role == Role::Client ? "test client 1" : "test engine 1";
    config.handshakeTimeout = std::chrono::seconds(30);
    return config;
}

boost::shared_ptr<const exchange::Message> question(const std::string& text, std::vector<std::shared_ptr<Bulk>> bulks) {
    return boost::make_shared<const Question>(text, std::move(bulks));
}

std::shared_ptr<Bulk> bulkOf(std::size_t size) {
    auto made = std::make_shared<Bulk>();
    made->bytes.assign(size, 'b');
    return made;
}

boost::shared_ptr<const exchange::Reply> answer(const std::string& text) {
    return boost::make_shared<const Answer>(text);
}

boost::shared_ptr<const eventmgr::BaseEvent> notice(const std::string& text) {
    return boost::make_shared<const Notice>(text);
}

boost::shared_ptr<const eventmgr::BaseEvent> shutdownEvent() {
    return boost::make_shared<const Shutdown>();
}

boost::shared_ptr<const eventmgr::BaseEvent> capabilityChange() {
    return boost::make_shared<const CapabilityNews>();
}

OpenedPair openPair(const SessionConfig& clientConfig, const SessionConfig& engineConfig, Ends ends) {
    auto opening = std::async(std::launch::async, [&] { return Session::open(ends.in, ends.out, clientConfig); });
    auto engine = Session::open(ends.otherIn, ends.otherOut, engineConfig);
    return {opening.get(), std::move(engine)};
}

SessionPair::SessionPair(SessionConfig clientConfig, SessionConfig engineConfig, Ends ends) {
    OpenedPair opened = openPair(clientConfig, engineConfig, ends);
    client = std::move(opened.client);
    engine = std::move(opened.engine);
    engine->start(engineSaw);
    client->start(clientSaw);
}

std::unique_ptr<Session> openWith(wire::ByteEnd& peer, const Ends& ends, const SessionConfig& config) {
    auto opening = std::async(std::launch::async, [&] { return Session::open(ends.in, ends.out, config); });
    peer.shakeHands();
    return opening.get();
}

SessionWithBytes::SessionWithBytes(SessionConfig config, Ends ends)
    : peer(std::make_unique<wire::ByteEnd>(ends.otherIn, ends.otherOut)), session(openWith(*peer, ends, config)) {
    session->start(saw);
}

}  // namespace testing_sessions
