// The way out of a session: what was handed over is written in order, at once as far as the stream takes it, the rest
// by the I/O thread. Nobody waits for a write unless they ask to.
//
// A message may be held, for one write together with what follows. What is held is unwritten like all that waits for
// the stream, so it counts against the room, and whoever waits for the stream sends it first.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <mutex>
#include <optional>
#include <vector>

#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "foundation/msg_svc/transport/layers/session/Asio.hpp"
#include "foundation/msg_svc/transport/layers/session/LevelEvent.hpp"
#include "foundation/msg_svc/transport/layers/session/OutgoingQueue.hpp"

namespace foundation::msg_svc::transport::layers::session {

/// Owns the descriptor that a session writes to. Members may be called from any thread, but for those of the I/O
/// thread.
class Outgoing {
  public:
    /// Is told what becomes of the stream, on the I/O thread.
    class Owner {
      public:
        /// Messages have been written. `all`: nothing is left to be written.
        virtual void onWritten(bool all) = 0;
        /// Writing has failed with this errno. Nothing can be written any more, and what was unwritten is dropped.
        virtual void onWriteFailed(int error) = 0;
        /// The peer has closed both directions of the stream; told once after awaitHangUp().
        virtual void onHangUp() = 0;

      protected:
        ~Owner() = default;
    };

    /// Takes the descriptor over; it must be non-blocking. `roomBytes` is what may be unwritten while there is room,
    /// `recorder` sees all that is handed over; null for none.
    Outgoing(asio::io_context& io, core::posix::OwnedDescriptor& descriptor, std::size_t roomBytes,
             SessionRecorder* recorder, Owner& owner);

    /// Whether messages are taken. False after an error and after finish().
    bool isOpen() const noexcept { return state_.load(std::memory_order_acquire) == State::Open; }

    enum class Hold {
        No,
        Yes,
        WithOthers,  ///< only when something is held already: somebody will send that
    };

    /// Writes a message behind those that are held, or puts it behind those that are unwritten. With Hold::Yes it is
    /// held, until Session::heldBytes are. Returns what has been written at once, for the caller to drop where it holds
    /// no lock: deleters of frames are their owners' code. A message that is not taken stays the caller's.
    [[nodiscard]] std::vector<OutgoingPieces> push(OutgoingPieces&& message, Hold hold = Hold::No);

    /// Writes what is held.
    void sendHeld();

    /// Waits until no more than `roomBytes` are unwritten, nothing is taken any more, or `interrupt` (a descriptor, -1
    /// for none) becomes readable; returns false in the last case only. Not from the I/O thread.
    bool waitForRoom(int interrupt);

    /// The same until all is written that was handed over before the call.
    bool waitUntilWritten(int interrupt);

    /// Messages posted as answers that the stream has not taken. Those that are merely held are not owed: nobody knows
    /// yet whether the peer reads.
    std::size_t answersOwed() const noexcept { return writerAwake_ ? answersOwed_.load() : 0; }

    /// Bytes that the stream has taken.
    std::uint64_t written() const;

    /// Nothing is unwritten, and nothing was lost.
    bool isDrained() const;
    bool hasFailed() const noexcept { return state_.load(std::memory_order_acquire) == State::Failed; }

    // I/O thread.

    /// Takes nothing more, and drops what is unwritten but for a message that is written in part and, behind it,
    /// `lastWord`, unless writing has failed. Returns whether something is left to be written.
    bool finish(std::optional<OutgoingPieces> lastWord);

    /// Writes as much as the stream takes now, and waits for the stream to take the rest.
    void flush();

    /// Has onHangUp() called when the peer has closed both directions.
    void awaitHangUp();

    /// Drops what is unwritten and closes the descriptor.
    void close();

    /// For a forked child: closes the descriptors with nothing but close(2).
    void abandonInChild() noexcept;

  private:
    // Open -> Finishing -> Closed; Failed may come before each of the last two.
    enum class State { Open, Finishing, Failed, Closed };

    struct Total {
        std::size_t bytes = 0;
        std::size_t answers = 0;
    };
    static Total totalOf(const std::vector<OutgoingPieces>& messages);

    static bool waitFor(const LevelEvent& event, int interrupt);
    void updateEvents();
    void enqueue(OutgoingPieces&& message);
    void write(std::vector<OutgoingPieces>& written);
    void uncount(Total written);
    void drop(std::vector<OutgoingPieces>& messages);
    void armWrite();
    void fail(int error);

    asio::io_context& io_;
    asio::posix::stream_descriptor stream_;
    Owner& owner_;
    const std::size_t roomBytes_;
    SessionRecorder* const recorder_;
    LevelEvent room_;
    LevelEvent allWritten_;
    std::atomic<int> descriptor_;
    // Changed with the mutex held.
    std::atomic<State> state_{State::Open};
    std::atomic<std::size_t> answersOwed_{0};  ///< unwritten ones
    std::atomic<bool> writerAwake_{false};     ///< the I/O thread writes; without it, what is in the queue is held

    mutable std::mutex mutex_;
    OutgoingQueue queue_;
    std::size_t unwritten_ = 0;
    std::size_t awaited_ = 0;  ///< of these, what was there when somebody began to wait for it
};

}  // namespace foundation::msg_svc::transport::layers::session
