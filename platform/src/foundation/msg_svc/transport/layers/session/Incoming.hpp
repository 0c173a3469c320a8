// The way in of a session: bytes become messages, messages become objects, and objects go to the handler.
//
// A peer that does not read its answers is not read either, once it is owed as many as
// SessionConfig::maxPendingAnswers: what it asks would need memory without end. It is read again when it has read. That
// the peer has gone is noticed all the same: there is something to write then, and writing fails.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>

#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "foundation/msg_svc/transport/layers/session/Asio.hpp"
#include "foundation/msg_svc/transport/layers/session/Exchanges.hpp"
#include "foundation/msg_svc/transport/layers/session/Intake.hpp"
#include "foundation/msg_svc/transport/layers/session/KeepAlive.hpp"
#include "foundation/msg_svc/transport/layers/session/KeptMemory.hpp"
#include "foundation/msg_svc/transport/layers/session/MessageReader.hpp"
#include "foundation/msg_svc/transport/layers/session/Outgoing.hpp"
#include "foundation/msg_svc/transport/layers/session/Session.hpp"
#include "foundation/msg_svc/transport/layers/session/lending/SharedMemory.hpp"

namespace foundation::msg_svc::transport::layers::session {

/// Owns the descriptor that a session reads from. Members belong to the I/O thread, but for those that say otherwise.
class Incoming {
  public:
    /// Is told why nothing more arrives, on the I/O thread. stop() is expected to follow.
    class Owner {
      public:
        /// What arrived is not allowed, or the handler has failed; `text` says so.
        virtual void onViolation(const std::string& text) = 0;
        /// The peer has closed the session, and said why.
        virtual void onPeerAbort(const std::string& reason) = 0;
        virtual void onEndOfStream() = 0;
        virtual void onReadFailed(const std::string& why) = 0;

      protected:
        ~Owner() = default;
    };

    /// Takes the descriptor over; it must be non-blocking. All references must outlive this object. `shared` is null
    /// when the peer sees no memory of this process, nor this process any of the peer's.
    Incoming(asio::io_context& io, core::posix::OwnedDescriptor& descriptor, const SessionConfig& config,
             std::shared_ptr<const serialization::Registry> registry, const std::string& arrayTag,
             SharedExchanges& exchanges, const Outgoing& outgoing, lending::SharedMemory* shared, KeepAlive& keepAlive,
             Owner& owner);

    /// Begins to read, unless stop() was called before.
    void start(SessionHandler& handler);

    /// Goes on when the peer was held back and is not owed too much any more. To be called when answers are written.
    void resume();

    /// Nothing more is read or handed on.
    void stop();
    bool isStopped() const noexcept { return state_ == State::Stopped; }

    /// The stream may end here: no part of a message has arrived.
    bool atBoundary() const noexcept { return reader_.atBoundary(); }

    /// How far the message has come that is arriving, for the report of a lost stream.
    std::string position() const { return reader_.position(); }

    void close();

    // Any thread.

    /// Has nothing more handed on, from whatever is being handed on now.
    void silence() noexcept { silenced_ = true; }

    /// Content of the frame that is arriving, in bytes, and how much of it is there; 0 between frames.
    std::uint64_t contentSize() const noexcept { return contentSize_; }
    std::uint64_t contentArrived() const noexcept { return contentArrived_; }

    /// For a forked child: closes the descriptor with nothing but close(2).
    void abandonInChild() noexcept;

  private:
    // Waiting (for start) -> Reading <-> HeldBack; Stopped is the end of all.
    enum class State { Waiting, Reading, HeldBack, Stopped };

    bool isReading() const noexcept { return state_ == State::Reading && !silenced_; }
    bool owesTooMuch() const noexcept { return outgoing_.answersOwed() >= config_.maxPendingAnswers; }
    void awaitBytes();
    void readAvailable();
    bool read();
    void takeItems();
    void take(MessageReader::Item item);

    const SessionConfig& config_;
    const Outgoing& outgoing_;
    lending::SharedMemory* const shared_;
    KeepAlive& keepAlive_;
    Owner& owner_;
    asio::posix::stream_descriptor stream_;
    MessageReader reader_;
    Intake intake_;
    KeptMemory keptMemory_;
    SessionHandler* handler_ = nullptr;
    State state_ = State::Waiting;

    std::atomic<bool> silenced_{false};
    std::atomic<std::uint64_t> contentSize_{0};
    std::atomic<std::uint64_t> contentArrived_{0};
    std::atomic<int> descriptor_;
};

}  // namespace foundation::msg_svc::transport::layers::session
