// Everything that leaves for the client: events, text and replies.
//
// Whoever has something to send takes a turn. There is one turn at a time, so turns decide the order of everything. The
// session's I/O thread takes one for each message from the client as well: while a turn is held, each request is either
// in the queue, or among the running ones, or has ended, and a cancel finds it.
//
// What a request sends is held for a moment, so that a short request leaves in one write, and short requests that wait
// for each other leave together: until the engine has none left or waits, when it is much, and in any case for holdTime
// only, since nobody knows how long the code goes on.
//
// Nobody waits for the client in a turn, because sending never waits. So the threads of running code wait afterwards,
// without a turn and without the interpreter lock: waitForRoom() returns when the client has read enough. That bounds
// what is unwritten to the session's room and one message of each thread.
#pragma once

#include <boost/shared_ptr.hpp>
#include <boost/smart_ptr/make_shared.hpp>
#include <chrono>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <string>

#include "cmddistributor/IIPResult.hpp"
#include "cmddistributor/RuntimeException.hpp"
#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"
#include "foundation/msg_svc/exchange/Reply.hpp"
#include "foundation/msg_svc/transport/layers/session/Session.hpp"
#include "korvel/lang/diagnostic/Warning.hpp"
#include "qvm/process/AppendFile.hpp"
#include "qvm/process/FlushTimer.hpp"
#include "qvm/process/Log.hpp"
#include "qvm/requests/MessageBounds.hpp"
#include "qvm/requests/Request.hpp"
#include "qvm/requests/SessionPhase.hpp"
#include "qvm/requests/TextOutput.hpp"

namespace qvm {

/// See the head of this file. Members may be called from any thread, but not by a thread that holds a turn.
class Announcer {
  public:
    using Session = foundation::msg_svc::transport::layers::session::Session;
    using Event = boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent>;

    /// The right to send, as long as it lives. What is sent after the shutdown event is dropped.
    class Turn {
      public:
        /// Whether anything can still be sent.
        bool isServing() const noexcept { return announcer_.phase_ == SessionPhase::Serving; }

        /// Sends a state event of the request.
        template <class EventT>
        void raise(const Request& request) {
            publish(request.stream, boost::make_shared<const EventT>(request.id()));
        }

        /// Sends an event of the exchange on `stream`, or of none when that is 0. Returns false, and tells the log, for
        /// one that cannot be sent.
        bool publish(framing::StreamID stream, const Event& event) noexcept;

        /// Sends the answer to a message on `stream` that is no request.
        void answer(framing::StreamID stream,
                    const boost::shared_ptr<const foundation::msg_svc::exchange::Reply>& reply);

        /// Ends a request: its last event, and the reply. A result that cannot be sent becomes an error that says so.
        /// The reply to an evaluation is held for a moment; Announcer::flush() and waitUntilWritten() send it.
        void finish(const Request& request, std::unique_ptr<cmddistributor::IIPResult> result);

        /// Ends a request that is never run: discarded, last and a reply with the error.
        void discard(const Request& request, cmddistributor::RuntimeException error);

        /// The same for a request that the engine cannot run; `why` is a sentence.
        void refuse(const Request& request, const std::string& why);

      private:
        friend class Announcer;
        Turn(Announcer& announcer, Session::Urgency urgency)
            : lock_(announcer.mutex_), announcer_(announcer), urgency_(urgency) {}

        template <class T>
        void send(framing::StreamID stream, const boost::shared_ptr<const T>& object, Session::Urgency urgency);
        Session::Urgency patient() const noexcept;

        std::unique_lock<std::mutex> lock_;
        Announcer& announcer_;
        const Session::Urgency urgency_;
    };

    /// How long what is sent may be held.
    static constexpr std::chrono::microseconds holdTime{300};

    /// All must outlive the object. `diary` and `log` get copies of the texts that ask for it. `timer` calls
    /// flushDue().
    Announcer(Session& session, AppendFile& diary, Log& log, FlushTimer& timer);
    Announcer(const Announcer&) = delete;
    Announcer& operator=(const Announcer&) = delete;

    /// Waits for the turns of others. The I/O thread names its turns Urgency::Answer.
    [[nodiscard]] Turn turn(Session::Urgency urgency = Session::Urgency::Output) { return {*this, urgency}; }

    /// Sends text where its target says. Takes a turn of its own.
    void announceText(const TextTarget& target, std::u16string text) noexcept;

    /// Sends a warning of `request`, or of none when it is null, and once more when it is enabled. Takes a turn of its
    /// own.
    void announceWarning(const Request* request, korvel::lang::diagnostic::Warning warning);

    /// Writes what is held.
    void flush() { flushDue(FlushTimer::never); }

    /// Writes what is held if it is due at `now`; returns when it is due otherwise, FlushTimer::never if there is none.
    FlushTimer::Time flushDue(FlushTimer::Time now);

    /// Waits until the client has read enough for more to be sent, the session is over, or `interrupt` (a descriptor,
    /// -1 for none) is readable; returns false in the last case.
    bool waitForRoom(int interrupt = -1) { return session_.waitForRoom(interrupt); }

    /// The same until all that was sent before the call is written.
    bool waitUntilWritten(int interrupt = -1) { return session_.waitUntilWritten(interrupt); }

    /// Sends the shutdown event.
    void shutDown();

    /// The thread that runs code has finished.
    void leave();

    /// The stream is over. Returns whether the thread that runs code has finished within `grace`.
    bool end(std::chrono::milliseconds grace);

    /// Whether the stream is over within `grace`.
    bool awaitEnd(std::chrono::milliseconds grace);

  private:
    void step(SessionStep step);

    Session& session_;
    AppendFile& diary_;
    Log& log_;
    FlushTimer& timer_;
    const MessageBounds bounds_;
    std::mutex mutex_;
    FlushTimer::Time due_ = FlushTimer::never;  // of what is held
    std::condition_variable changed_;
    SessionPhase phase_ = SessionPhase::Serving;
};

}  // namespace qvm
