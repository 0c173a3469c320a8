// One session with an engine, seen from the main thread.
#pragma once

#include <boost/shared_ptr.hpp>
#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <exception>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <unordered_map>
#include <unordered_set>
#include <utility>
#include <variant>

#include "foundation/core/posix/EventDescriptor.hpp"
#include "foundation/msg_svc/eventmgr/EventMgr.hpp"
#include "foundation/msg_svc/transport/layers/session/Session.hpp"

namespace krutil_client {

namespace posix = foundation::core::posix;

class Interrupt;

/// Thrown by what waits for something that cannot come any more.
class SessionOver : public std::exception {
  public:
    explicit SessionOver(foundation::msg_svc::transport::layers::session::SessionEnd end) : end_(std::move(end)) {}
    const char* what() const noexcept override { return "the session is over"; }
    const foundation::msg_svc::transport::layers::session::SessionEnd& end() const noexcept { return end_; }

  private:
    foundation::msg_svc::transport::layers::session::SessionEnd end_;
};

/// Receives on the session's I/O thread and delivers on the main thread, which waits in one of the run functions:
/// events are published through an event manager, replies go to whoever asked. Delivery may nest: a subscriber may
/// itself ask and wait. When the main thread does not keep up, because nobody reads what it prints, the I/O thread is
/// held back, so that the engine is too and memory stays bounded.
///
/// Main thread only, but for the session's own calls.
class Conversation : private foundation::msg_svc::transport::layers::session::SessionHandler {
  public:
    using Clock = std::chrono::steady_clock;
    using Reply = boost::shared_ptr<const foundation::msg_svc::exchange::Reply>;
    using ReplyAction = std::function<void(const Reply&)>;
    using SessionEnd = foundation::msg_svc::transport::layers::session::SessionEnd;

    /// Performs the handshake on `stream`, of which it takes ownership in every case, and begins to receive. `events`
    /// and `interrupt` must outlive the object. Ctrl-C during the handshake ends it with an error.
    ///
    /// Throws what Session::open() throws.
    Conversation(int stream, foundation::msg_svc::transport::layers::session::SessionConfig config,
                 foundation::msg_svc::eventmgr::EventMgr& events, Interrupt& interrupt);

    /// Closes the stream at once; what was not delivered is dropped.
    ~Conversation() override;

    /// The session, for what needs no waiting: send an event, look at the peer.
    foundation::msg_svc::transport::layers::session::Session& session() noexcept { return *session_; }

    /// Begins an exchange; `action` is called with the reply, in a run function. Throws what Session::send() throws.
    void send(const boost::shared_ptr<const foundation::msg_svc::exchange::Message>& message, ReplyAction action);

    /// The same for an exchange that nobody is to see anything of: its events are not published, and a pastime goes on.
    void sendQuietly(const boost::shared_ptr<const foundation::msg_svc::exchange::Message>& message,
                     ReplyAction action);

    /// Begins an exchange and delivers until its reply has come. Throws what send() and run() throw.
    Reply ask(const boost::shared_ptr<const foundation::msg_svc::exchange::Message>& message);

    /// Delivers what arrives until `done` returns true; it is asked first, and after each delivery. Ctrl-C is
    /// dispatched meanwhile. Throws SessionOver, and what subscribers, reply actions and the interrupt's action throw.
    void run(const std::function<bool()>& done);

    /// The same until `deadline`; returns what `done` said last.
    bool runUntil(Clock::time_point deadline, const std::function<bool()>& done);

    /// The same until `descriptor` is readable or hangs up with nothing left to deliver; returns whether it is, false
    /// when `done` was.
    bool runUntilReadable(int descriptor, const std::function<bool()>& done);

    /// How much of what the engine has said was delivered: messages, replies and events.
    std::uint64_t delivered() const noexcept { return delivered_; }

    /// Calls `action` once, in a run function, when `descriptor` becomes readable or hangs up. One at a time; -1 for
    /// none.
    void watch(int descriptor, std::function<void()> action);

    /// What to do while a run function waits: `start` is called whenever it begins to wait, `tick` every `interval`
    /// that passes without a delivery, `stop` before whatever comes is delivered or dispatched, unless it is of a quiet
    /// exchange. Each may be empty for nothing to do.
    struct Pastime {
        std::chrono::milliseconds interval{};
        std::function<void()> tick{};
        std::function<void()> stop{};
        std::function<void()> start{};
    };

    /// Replaces the pastime, and returns the one before. What it throws comes out of the run functions.
    Pastime setPastime(Pastime pastime) { return std::exchange(pastime_, std::move(pastime)); }

    /// Says goodbye, and delivers what arrives until the session is over or `patience` has passed. Returns how it
    /// ended, empty when it did not. Throws what subscribers and the interrupt's action throw.
    std::optional<SessionEnd> finish(std::chrono::milliseconds patience);

    /// How the session ended, as far as delivered.
    const std::optional<SessionEnd>& end() const noexcept { return end_; }

  private:
    using StreamID = foundation::msg_svc::transport::layers::session::framing::StreamID;
    using Event = boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent>;
    struct ArrivedReply {
        StreamID stream;
        Reply reply;
    };
    struct ArrivedEvent {
        StreamID stream;
        Event event;
    };
    struct Arrived {
        std::variant<ArrivedEvent, ArrivedReply, SessionEnd> what;
        std::size_t bytes;  ///< roughly what it holds in memory
    };

    void onReply(StreamID stream, const Reply& reply) override;
    void onEvent(StreamID stream, const Event& event) override;
    void onEnd(const SessionEnd& end) override;

    void arrive(Arrived&& arrived);
    StreamID begin(const boost::shared_ptr<const foundation::msg_svc::exchange::Message>& message,
                   ReplyAction&& action);
    bool isQuiet(const Arrived& arrived) const;
    bool deliverOne();
    void deliver(Arrived& arrived);
    void stopPastime();
    bool waitForSomething(std::optional<Clock::time_point> deadline, int descriptor = -1);

    foundation::msg_svc::eventmgr::EventMgr& events_;
    Interrupt& interrupt_;
    std::unordered_map<StreamID, ReplyAction> actions_;
    std::unordered_set<StreamID> quiet_;  ///< of those in actions_
    std::deque<Arrived> taken_;           ///< arrived and not yet delivered
    std::uint64_t delivered_ = 0;
    std::optional<SessionEnd> end_;
    int watched_ = -1;
    std::function<void()> watchAction_;
    Pastime pastime_;

    // Shared with the I/O thread, under the mutex.
    std::mutex mutex_;
    std::condition_variable room_;
    std::deque<Arrived> arrived_;
    std::size_t arrivedBytes_ = 0;
    bool closing_ = false;
    posix::EventDescriptor wake_;  ///< readable while something has arrived

    std::unique_ptr<foundation::msg_svc::transport::layers::session::Session> session_;
};

}  // namespace krutil_client
