// The requests that wait for their turn.
//
// The session's I/O thread puts requests in and never waits; the interpreter's thread takes them out, at idle or at a
// prompt of the running code. Which dequeue modes are due at which of these points is the table in RequestQueue.cpp.
//
// A prompt takes all due requests as one batch. They keep their places here until their turn comes, so that they count
// against the bounds, can be removed, and go back when the prompt closes first.
#pragma once

#include <signal.h>

#include <atomic>
#include <chrono>
#include <cstddef>
#include <deque>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "foundation/core/posix/EventDescriptor.hpp"
#include "krutil/cmddistributor/WhenToDequeue.hpp"
#include "qvm/requests/Request.hpp"

namespace qvm {

/// Where the interpreter's thread is when it asks for a request.
enum class DequeuePoint {
    Idle,         ///< nothing runs
    Prompt,       ///< running code has handed the keyboard over
    InputPrompt,  ///< running code waits for a line of input
    DebugPrompt,  ///< a debugger has stopped the running code
    Pause,        ///< running code waits for a sign to go on
};

/// Whether a queue hands out requests of `mode` at `point`.
bool isDue(krutil::cmddistributor::WhenToDequeue::WhenToDequeue mode, DequeuePoint point) noexcept;

/// See the head of this file. All members may be called from any thread; wait() from one thread at a time.
class RequestQueue {
  public:
    /// What may wait at a time; one request that would exceed either is refused.
    struct Bounds {
        std::size_t count = 1024;
        std::size_t bytes = std::size_t{5} << 30;  ///< by default, a message as large as a session accepts fits
    };

    enum class Put {
        Taken,
        TooMany,   ///< `count` requests wait already
        TooLarge,  ///< with this one the waiting requests would hold more than `bytes`
        Closed,    ///< end() or close() has been called
    };

    enum class Wait {
        Due,          ///< take() has something to give
        Closed,       ///< nothing is due, and after end() nothing will be; or close() has been called
        Interrupted,  ///< a signal was delivered to this thread, `interrupt` is readable, or interruptWait() was called
        TimedOut,     ///< the deadline has passed
    };

    using Deadline = std::optional<std::chrono::steady_clock::time_point>;

    /// Throws std::system_error when the system has no descriptor left.
    explicit RequestQueue(Bounds bounds);
    RequestQueue(const RequestQueue&) = delete;
    RequestQueue& operator=(const RequestQueue&) = delete;

    /// Adds a request behind the others, or one for the bootstrap before all of another mode. Never waits. wake() is to
    /// follow: whoever waits is not to wake up and stand before a lock that the caller holds.
    Put put(Request request);

    /// Why a request was not taken, in a sentence for whoever sent it; not for Put::Taken. Put::Closed is also what
    /// becomes of those that still wait when the session ends.
    std::string refusal(Put put) const;

    /// Has wait() look again. Without a system call when nobody waits.
    void wake();

    /// Waits until a request is due at `point`. `interrupt` is a descriptor that ends the wait when it becomes
    /// readable, -1 for none. `signals` are blocked during the wait instead of those that the thread blocks now; null
    /// for no change.
    Wait wait(DequeuePoint point, int interrupt = -1, Deadline deadline = {}, const sigset_t* signals = nullptr);

    /// Whether wait() would find a request that is due.
    bool hasDue(DequeuePoint point) const;

    /// Ends the wait that is under way, or else the next one, unless that has a request.
    void interruptWait();

    /// Takes out the first request that is due at `point` and of no batch. Empty when none is; works on a closed queue
    /// too.
    std::optional<Request> take(DequeuePoint point);

    /// Makes all requests that are due at `point` and of no batch the batch `number` (not 0; prompts nest, so there may
    /// be several). Returns those of them that had been requeued.
    std::vector<Request> takeBatch(unsigned number, DequeuePoint point);

    /// Takes out the first request of a batch. Empty when none is left.
    std::optional<Request> takeOfBatch(unsigned number);

    /// Requeues what is left of a batch, and returns it.
    std::vector<Request> closeBatch(unsigned number);

    /// Takes out the request with this identifier, of a batch or not. Empty when it does not wait.
    std::optional<Request> remove(const foundation::msg_svc::exchange::IDType& id);

    /// Takes out everything, due or not, in order.
    std::vector<Request> takeAll();

    /// Nothing more will come: refuses what comes from now on. What waits is still given when it is due.
    void end();

    /// Nothing more is to be taken: refuses what comes from now on and ends waits, whatever is due.
    void close();

  private:
    enum class Intake { Open, Ended, Closed };

    struct Entry {
        Request request;
        std::size_t bytes;
        unsigned batch = 0;  // 0 for none
    };

    bool anyIsDue(DequeuePoint point) const;  // with the mutex held
    std::optional<Wait> look(DequeuePoint point);
    static bool isFreeAndDue(const Entry& entry, DequeuePoint point) noexcept;
    template <class Predicate>
    std::optional<Request> takeFirst(Predicate isMeant);
    void leave(Intake intake);

    const Bounds bounds_;
    // Readable when something may have changed for wait(), so that the wait can watch another descriptor as well.
    foundation::core::posix::EventDescriptor changed_;
    std::atomic<bool> waiting_{false};  // changed_ is to be raised
    mutable std::mutex mutex_;
    std::deque<Entry> entries_;
    std::size_t bytes_ = 0;
    Intake intake_ = Intake::Open;
    bool interruptWait_ = false;
};

}  // namespace qvm
