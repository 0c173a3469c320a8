#include "qvm/requests/RequestQueue.hpp"

#include <poll.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <system_error>
#include <utility>

namespace qvm {
namespace {

using namespace krutil::cmddistributor::WhenToDequeue;

struct DueMode {
    WhenToDequeue mode;
    bool idle, prompt, inputPrompt, debugPrompt, pause;
};

// A request that asks for no particular point waits for idle. Idle takes all but what only a debugger's prompt may
// take; a prompt takes what was sent for it, and what may run anywhere. docs/protocol.md shows the same table.
constexpr std::array<DueMode, 8> dueModes{{
    // mode                        idle   prompt input  debug  pause
    {DEQUEUE_UNKNOWN, true, false, false, false, false},
    {DEQUEUE_AT_PPE, true, true, false, true, true},
    {DEQUEUE_AT_PAUSE, true, false, false, false, true},
    {DEQUEUE_AT_PROMPT, true, true, true, true, true},
    {DEQUEUE_AT_NON_DEBUG_PROMPT, true, true, true, false, true},
    {DEQUEUE_AT_DEBUG_PROMPT, false, false, false, true, false},
    {DEQUEUE_AT_IDLE, true, false, false, false, false},
    {DEQUEUE_AT_BOOTSTRAP, true, false, false, false, false},
}};

}  // namespace

bool isDue(WhenToDequeue mode, DequeuePoint point) noexcept {
    const auto row =
        std::find_if(dueModes.begin(), dueModes.end(), [mode](const DueMode& each) { return each.mode == mode; });
    if (row == dueModes.end()) {
        return false;
    }
    switch (point) {
        case DequeuePoint::Idle:
            return row->idle;
        case DequeuePoint::Prompt:
            return row->prompt;
        case DequeuePoint::InputPrompt:
            return row->inputPrompt;
        case DequeuePoint::DebugPrompt:
            return row->debugPrompt;
        case DequeuePoint::Pause:
            return row->pause;
    }
    return false;
}

bool RequestQueue::isFreeAndDue(const Entry& entry, DequeuePoint point) noexcept {
    return entry.batch == 0 && isDue(entry.request.message->getDequeueMode(), point);
}

RequestQueue::RequestQueue(Bounds bounds) : bounds_(bounds), changed_("The request queue") {}

RequestQueue::Put RequestQueue::put(Request request) {
    const std::size_t bytes = memoryOf(request);
    {
        const std::lock_guard lock(mutex_);
        if (intake_ != Intake::Open) {
            return Put::Closed;
        }
        if (entries_.size() >= bounds_.count) {
            return Put::TooMany;
        }
        if (bytes > bounds_.bytes - bytes_) {
            return Put::TooLarge;
        }
        const auto isOther = [](const Entry& entry) {
            return entry.request.message->getDequeueMode() != DEQUEUE_AT_BOOTSTRAP;
        };
        const auto place = request.message->getDequeueMode() == DEQUEUE_AT_BOOTSTRAP
                               ? std::find_if(entries_.begin(), entries_.end(), isOther)
                               : entries_.end();
        entries_.insert(place, {std::move(request), bytes});
        bytes_ += bytes;
    }
    return Put::Taken;
}

std::string RequestQueue::refusal(Put put) const {
    switch (put) {
        case Put::TooMany:
            return "The engine's queue is full: " + std::to_string(bounds_.count) +
                   " requests wait already, which is the engine's bound. Send this one again when some are done.";
        case Put::TooLarge:
            return "The engine's queue is full: with this request, those that wait would hold more than " +
                   std::to_string(bounds_.bytes) +
                   " bytes, which is the engine's bound. Send it again when some are done, or send less at a time.";
        case Put::Taken:
        case Put::Closed:
            break;
    }
    return "The session ended before this request was started.";
}

bool RequestQueue::anyIsDue(DequeuePoint point) const {
    return intake_ != Intake::Closed && std::any_of(entries_.begin(), entries_.end(),
                                                    [point](const Entry& entry) { return isFreeAndDue(entry, point); });
}

bool RequestQueue::hasDue(DequeuePoint point) const {
    const std::lock_guard lock(mutex_);
    return anyIsDue(point);
}

// What wait() returns; empty when it is to wait.
std::optional<RequestQueue::Wait> RequestQueue::look(DequeuePoint point) {
    const std::lock_guard lock(mutex_);
    if (anyIsDue(point)) {
        return Wait::Due;
    }
    if (intake_ != Intake::Open) {
        return Wait::Closed;
    }
    return std::exchange(interruptWait_, false) ? std::optional(Wait::Interrupted) : std::nullopt;
}

RequestQueue::Wait RequestQueue::wait(DequeuePoint point, int interrupt, Deadline deadline, const sigset_t* signals) {
    for (;;) {
        // Said before the look, so that no change is missed.
        waiting_ = true;
        if (const std::optional<Wait> found = look(point)) {
            waiting_ = false;
            return *found;
        }
        timespec left{};
        if (deadline) {
            const auto span = *deadline - std::chrono::steady_clock::now();
            if (span <= std::chrono::steady_clock::duration::zero()) {
                return Wait::TimedOut;
            }
            const auto seconds = std::chrono::duration_cast<std::chrono::seconds>(span);
            left.tv_sec = seconds.count();
            left.tv_nsec = std::chrono::nanoseconds(span - seconds).count();
        }
        // ppoll() ignores a negative descriptor.
        std::array<pollfd, 2> watched{{{changed_.get(), POLLIN, 0}, {interrupt, POLLIN, 0}}};
        if (::ppoll(watched.data(), watched.size(), deadline ? &left : nullptr, signals) < 0 ||
            watched[1].revents != 0) {
            return Wait::Interrupted;
        }
        changed_.clear();
    }
}

void RequestQueue::wake() {
    if (waiting_.exchange(false)) {
        changed_.raise();
    }
}

template <class Predicate>
std::optional<Request> RequestQueue::takeFirst(Predicate isMeant) {
    const std::lock_guard lock(mutex_);
    const auto entry = std::find_if(entries_.begin(), entries_.end(), isMeant);
    if (entry == entries_.end()) {
        return std::nullopt;
    }
    bytes_ -= entry->bytes;
    std::optional<Request> request = std::move(entry->request);
    entries_.erase(entry);
    return request;
}

std::optional<Request> RequestQueue::take(DequeuePoint point) {
    return takeFirst([point](const Entry& entry) { return isFreeAndDue(entry, point); });
}

std::vector<Request> RequestQueue::takeBatch(unsigned number, DequeuePoint point) {
    const std::lock_guard lock(mutex_);
    std::vector<Request> again;
    for (Entry& entry : entries_) {
        if (isFreeAndDue(entry, point)) {
            entry.batch = number;
            if (entry.request.requeued) {
                again.push_back(entry.request);
                entry.request.requeued = false;
            }
        }
    }
    return again;
}

std::optional<Request> RequestQueue::takeOfBatch(unsigned number) {
    return takeFirst([number](const Entry& entry) { return entry.batch == number; });
}

std::vector<Request> RequestQueue::closeBatch(unsigned number) {
    const std::lock_guard lock(mutex_);
    std::vector<Request> left;
    for (Entry& entry : entries_) {
        if (entry.batch == number) {
            entry.batch = 0;
            entry.request.requeued = true;
            left.push_back(entry.request);
        }
    }
    return left;
}

std::optional<Request> RequestQueue::remove(const foundation::msg_svc::exchange::IDType& id) {
    return takeFirst([&id](const Entry& entry) { return entry.request.id() == id; });
}

std::vector<Request> RequestQueue::takeAll() {
    const std::lock_guard lock(mutex_);
    std::vector<Request> requests;
    requests.reserve(entries_.size());
    for (Entry& entry : entries_) {
        requests.push_back(std::move(entry.request));
    }
    entries_.clear();
    bytes_ = 0;
    return requests;
}

void RequestQueue::interruptWait() {
    {
        const std::lock_guard lock(mutex_);
        interruptWait_ = true;
    }
    wake();
}

void RequestQueue::end() {
    leave(Intake::Ended);
}

void RequestQueue::close() {
    leave(Intake::Closed);
}

void RequestQueue::leave(Intake intake) {
    {
        const std::lock_guard lock(mutex_);
        intake_ = std::max(intake_, intake);
    }
    wake();
}

}  // namespace qvm
