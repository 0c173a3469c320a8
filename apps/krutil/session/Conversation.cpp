#include "krutil/session/Conversation.hpp"

#include <poll.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdint>
#include <system_error>

#include "krutil/base/Interrupt.hpp"
#include "krutil/io/TextBase.hpp"

namespace krutil_client {
namespace {

namespace session = foundation::msg_svc::transport::layers::session;

// What may wait for the main thread, besides as much again that it has taken: enough that a burst does not stop the
// engine.
constexpr std::size_t waitingBytes = 8U << 20;
// Counted for whatever arrives, besides its text.
constexpr std::size_t bytesOfAnything = 512;

std::unique_ptr<session::Session> openSession(int stream, session::SessionConfig&& config) {
    const Interrupt::ShutsDown interruptible(stream);
    return session::Session::open(stream, stream, std::move(config));
}

}  // namespace

Conversation::Conversation(int stream, session::SessionConfig config, foundation::msg_svc::eventmgr::EventMgr& events,
                           Interrupt& interrupt)
    : events_(events),
      interrupt_(interrupt),
      wake_("A conversation"),
      session_(openSession(stream, std::move(config))) {
    session_->start(*this);
}

Conversation::~Conversation() {
    {
        const std::lock_guard lock(mutex_);
        closing_ = true;
        room_.notify_all();
    }
    session_.reset();
}

void Conversation::send(const boost::shared_ptr<const foundation::msg_svc::exchange::Message>& message,
                        ReplyAction action) {
    begin(message, std::move(action));
}

void Conversation::sendQuietly(const boost::shared_ptr<const foundation::msg_svc::exchange::Message>& message,
                               ReplyAction action) {
    // What comes of it is delivered on this thread, so not before it is noted.
    quiet_.insert(begin(message, std::move(action)));
}

Conversation::StreamID Conversation::begin(
    const boost::shared_ptr<const foundation::msg_svc::exchange::Message>& message, ReplyAction&& action) {
    const StreamID stream = session_->newStreamID();
    actions_.emplace(stream, std::move(action));
    try {
        session_->send(stream, message);
    } catch (...) {
        actions_.erase(stream);
        throw;
    }
    return stream;
}

Conversation::Reply Conversation::ask(const boost::shared_ptr<const foundation::msg_svc::exchange::Message>& message) {
    // Shared with the action, which may outlive this call if waiting ends with an exception.
    const auto answer = std::make_shared<Reply>();
    send(message, [answer](const Reply& reply) { *answer = reply; });
    run([&answer] { return *answer != nullptr; });
    return *answer;
}

void Conversation::run(const std::function<bool()>& done) {
    while (!done()) {
        if (!deliverOne()) {
            if (end_) {
                throw SessionOver(*end_);
            }
            waitForSomething(std::nullopt);
        }
    }
}

bool Conversation::runUntil(Clock::time_point deadline, const std::function<bool()>& done) {
    while (!done()) {
        if (!deliverOne()) {
            if (end_) {
                throw SessionOver(*end_);
            }
            if (Clock::now() >= deadline) {
                return false;
            }
            waitForSomething(deadline);
        }
    }
    return true;
}

bool Conversation::runUntilReadable(int descriptor, const std::function<bool()>& done) {
    while (!done()) {
        if (!deliverOne()) {
            if (end_) {
                throw SessionOver(*end_);
            }
            if (waitForSomething(std::nullopt, descriptor)) {
                return true;
            }
        }
    }
    return false;
}

void Conversation::watch(int descriptor, std::function<void()> action) {
    watched_ = descriptor;
    watchAction_ = std::move(action);
}

std::optional<Conversation::SessionEnd> Conversation::finish(std::chrono::milliseconds patience) {
    if (!end_) {
        session_->sayGoodbye();
        runUntil(Clock::now() + patience, [this] { return end_.has_value(); });
    }
    return end_;
}

bool Conversation::deliverOne() {
    if (taken_.empty()) {
        const std::lock_guard lock(mutex_);
        if (arrived_.empty()) {
            return false;
        }
        taken_.swap(arrived_);
        arrivedBytes_ = 0;
        wake_.clear();
        room_.notify_one();
    }
    // Taken out first: what is called may itself wait and deliver.
    Arrived next = std::move(taken_.front());
    taken_.pop_front();
    ++delivered_;
    if (!isQuiet(next)) {
        stopPastime();
    }
    deliver(next);
    return true;
}

bool Conversation::isQuiet(const Arrived& arrived) const {
    if (const auto* event = std::get_if<ArrivedEvent>(&arrived.what)) {
        return quiet_.contains(event->stream);
    }
    const auto* answer = std::get_if<ArrivedReply>(&arrived.what);
    return answer != nullptr && quiet_.contains(answer->stream);
}

void Conversation::deliver(Arrived& arrived) {
    if (const auto* event = std::get_if<ArrivedEvent>(&arrived.what)) {
        if (!quiet_.contains(event->stream)) {
            events_.publish(event->event);
        }
    } else if (const auto* answer = std::get_if<ArrivedReply>(&arrived.what)) {
        // The session let it through, so the exchange is one of ours.
        const auto found = actions_.find(answer->stream);
        const ReplyAction action = std::move(found->second);
        actions_.erase(found);
        quiet_.erase(answer->stream);
        action(answer->reply);
    } else {
        end_ = std::get<SessionEnd>(std::move(arrived.what));
    }
}

void Conversation::stopPastime() {
    if (pastime_.stop) {
        pastime_.stop();
    }
}

// Returns whether only the descriptor has something.
bool Conversation::waitForSomething(std::optional<Clock::time_point> deadline, int descriptor) {
    if (pastime_.start) {
        pastime_.start();
    }
    std::array<pollfd, 4> watched{pollfd{wake_.get(), POLLIN, 0}, pollfd{interrupt_.fd(), POLLIN, 0},
                                  pollfd{watched_, POLLIN, 0}, pollfd{descriptor, POLLIN, 0}};
    if (pastime_.tick) {
        const auto next = Clock::now() + pastime_.interval;
        deadline = deadline ? std::min(*deadline, next) : next;
    }
    int patience = -1;
    if (deadline) {
        const auto left = std::chrono::ceil<std::chrono::milliseconds>(*deadline - Clock::now());
        patience = left.count() > 0 ? static_cast<int>(std::min<std::int64_t>(left.count(), 1'000'000)) : 0;
    }
    const int ready = ::poll(watched.data(), watched.size(), patience);
    if (ready < 0) {
        if (errno == EINTR) {
            return false;
        }
        throw std::system_error(errno, std::generic_category(), "poll");
    }
    if (ready == 0) {
        if (pastime_.tick) {
            pastime_.tick();
        }
        return false;
    }
    if (watched[1].revents != 0) {
        interrupt_.dispatch([this] { stopPastime(); });
    }
    if (watched[2].revents != 0) {
        stopPastime();
        watched_ = -1;
        const auto action = std::move(watchAction_);
        action();
    }
    return ready == 1 && watched[3].revents != 0;
}

void Conversation::onReply(StreamID stream, const Reply& reply) {
    arrive({ArrivedReply{stream, reply}, bytesOfAnything});
}

void Conversation::onEvent(StreamID stream, const Event& event) {
    std::size_t bytes = bytesOfAnything;
    if (const auto* text = dynamic_cast<const krutil::io::TextBase*>(event.get())) {
        bytes += text->getText().size() * sizeof(char16_t);
    }
    arrive({ArrivedEvent{stream, event}, bytes});
}

void Conversation::onEnd(const SessionEnd& end) {
    arrive({end, 0});
}

void Conversation::arrive(Arrived&& arrived) {
    std::unique_lock lock(mutex_);
    // The end comes from whoever closes the session, which may be the main thread, and waits for nobody.
    if (!std::holds_alternative<SessionEnd>(arrived.what)) {
        room_.wait(lock, [this] { return closing_ || arrivedBytes_ <= waitingBytes; });
    }
    arrivedBytes_ += arrived.bytes;
    arrived_.push_back(std::move(arrived));
    if (arrived_.size() == 1) {
        wake_.raise();
    }
}

}  // namespace krutil_client
