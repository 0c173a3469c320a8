#include "qvm/requests/RequestQueue.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <future>

#include "apps/qvm/requests/TestRequests.hpp"

namespace qvm_test {
namespace {

using namespace krutil::cmddistributor::WhenToDequeue;
using qvm::DequeuePoint;
using qvm::memoryOf;
using qvm::RequestQueue;
using testing::ElementsAre;

qvm::Request numbered(std::uint64_t number, WhenToDequeue mode = DEQUEUE_AT_IDLE) {
    RequestParts parts;
    parts.number = number;
    parts.mode = mode;
    return makeRequest(parts);
}

// Numbers of the requests that are handed out at `point`, until none is due.
std::vector<std::uint64_t> takeDue(RequestQueue& queue, DequeuePoint point) {
    std::vector<std::uint64_t> numbers;
    while (const auto request = queue.take(point)) {
        numbers.push_back(request->id().lo());
    }
    return numbers;
}

// One request of each mode, numbered as the mode.
std::vector<std::uint64_t> modesDueAt(DequeuePoint point) {
    RequestQueue queue({});
    for (int mode = DEQUEUE_UNKNOWN; mode <= DEQUEUE_AT_BOOTSTRAP; ++mode) {
        queue.put(numbered(static_cast<std::uint64_t>(mode), static_cast<WhenToDequeue>(mode)));
    }
    return takeDue(queue, point);
}

TEST(RequestQueueTest, IdleTakesAllButDebugPromptRequestsAndBootstrapFirst) {
    EXPECT_THAT(modesDueAt(DequeuePoint::Idle),
                ElementsAre(DEQUEUE_AT_BOOTSTRAP, DEQUEUE_UNKNOWN, DEQUEUE_AT_PPE, DEQUEUE_AT_PAUSE, DEQUEUE_AT_PROMPT,
                            DEQUEUE_AT_NON_DEBUG_PROMPT, DEQUEUE_AT_IDLE));
}

TEST(RequestQueueTest, PromptTakesRequestsForPromptsThatAreNoDebuggers) {
    EXPECT_THAT(modesDueAt(DequeuePoint::Prompt),
                ElementsAre(DEQUEUE_AT_PPE, DEQUEUE_AT_PROMPT, DEQUEUE_AT_NON_DEBUG_PROMPT));
}

TEST(RequestQueueTest, InputPromptTakesAnswersOnly) {
    EXPECT_THAT(modesDueAt(DequeuePoint::InputPrompt), ElementsAre(DEQUEUE_AT_PROMPT, DEQUEUE_AT_NON_DEBUG_PROMPT));
}

TEST(RequestQueueTest, DebugPromptLetsIdleAndNonDebugRequestsWait) {
    EXPECT_THAT(modesDueAt(DequeuePoint::DebugPrompt),
                ElementsAre(DEQUEUE_AT_PPE, DEQUEUE_AT_PROMPT, DEQUEUE_AT_DEBUG_PROMPT));
}

TEST(RequestQueueTest, PauseTakesRequestsForAPause) {
    EXPECT_THAT(modesDueAt(DequeuePoint::Pause),
                ElementsAre(DEQUEUE_AT_PPE, DEQUEUE_AT_PAUSE, DEQUEUE_AT_PROMPT, DEQUEUE_AT_NON_DEBUG_PROMPT));
}

std::vector<std::uint64_t> numbersOf(const std::vector<qvm::Request>& requests) {
    std::vector<std::uint64_t> numbers;
    for (const qvm::Request& each : requests) {
        numbers.push_back(each.id().lo());
    }
    return numbers;
}

TEST(RequestQueueTest, BatchIsTakenInOrderAndLaterRequestsStayOut) {
    RequestQueue queue({});
    queue.put(numbered(1, DEQUEUE_AT_PROMPT));
    queue.put(numbered(2, DEQUEUE_AT_IDLE));
    queue.put(numbered(3, DEQUEUE_AT_DEBUG_PROMPT));
    EXPECT_THAT(queue.takeBatch(1, DequeuePoint::DebugPrompt), testing::IsEmpty());
    queue.put(numbered(4, DEQUEUE_AT_PROMPT));
    EXPECT_EQ(queue.takeOfBatch(1)->id().lo(), 1U);
    EXPECT_EQ(queue.takeOfBatch(1)->id().lo(), 3U);
    EXPECT_FALSE(queue.takeOfBatch(1));
    EXPECT_EQ(queue.wait(DequeuePoint::DebugPrompt), RequestQueue::Wait::Due);
}

TEST(RequestQueueTest, RestOfABatchGoesBackToItsPlaceAndIsToldWhenTakenAgain) {
    RequestQueue queue({});
    queue.put(numbered(1, DEQUEUE_AT_PROMPT));
    queue.put(numbered(2, DEQUEUE_AT_PROMPT));
    queue.takeBatch(1, DequeuePoint::Prompt);
    queue.put(numbered(3, DEQUEUE_AT_PROMPT));
    EXPECT_FALSE(queue.take(DequeuePoint::Idle)->requeued);
    EXPECT_THAT(numbersOf(queue.closeBatch(1)), ElementsAre(1, 2));
    EXPECT_THAT(numbersOf(queue.takeBatch(2, DequeuePoint::Prompt)), ElementsAre(1, 2));
    EXPECT_THAT(numbersOf(queue.closeBatch(2)), ElementsAre(1, 2));
    const auto again = queue.take(DequeuePoint::Idle);
    EXPECT_EQ(again->id().lo(), 1U);
    EXPECT_TRUE(again->requeued);
}

TEST(RequestQueueTest, RemoveFindsRequestsInsideAndOutsideOfBatches) {
    RequestQueue queue({});
    queue.put(numbered(1, DEQUEUE_AT_PROMPT));
    queue.put(numbered(2, DEQUEUE_AT_IDLE));
    queue.takeBatch(1, DequeuePoint::Prompt);
    using foundation::msg_svc::exchange::IDType;
    EXPECT_TRUE(queue.remove(IDType(0, 1)));
    EXPECT_FALSE(queue.remove(IDType(0, 1)));
    EXPECT_TRUE(queue.remove(IDType(0, 2)));
    EXPECT_FALSE(queue.takeOfBatch(1));
}

TEST(RequestQueueTest, WaitEndsAtItsDeadline) {
    RequestQueue queue({});
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(5);
    EXPECT_EQ(queue.wait(DequeuePoint::Pause, -1, deadline), RequestQueue::Wait::TimedOut);
    EXPECT_GE(std::chrono::steady_clock::now(), deadline);
}

TEST(RequestQueueTest, NumberThatIsNoModeIsNeverDue) {
    EXPECT_FALSE(qvm::isDue(static_cast<WhenToDequeue>(8), DequeuePoint::Idle));
    EXPECT_FALSE(qvm::isDue(static_cast<WhenToDequeue>(-1), DequeuePoint::Idle));
}

TEST(RequestQueueTest, RequestsOfOneModeKeepTheirOrder) {
    RequestQueue queue({});
    for (const std::uint64_t number : {1U, 2U, 3U}) {
        EXPECT_EQ(queue.put(numbered(number)), RequestQueue::Put::Taken);
    }
    EXPECT_EQ(queue.put(numbered(8, DEQUEUE_AT_BOOTSTRAP)), RequestQueue::Put::Taken);
    EXPECT_EQ(queue.put(numbered(9, DEQUEUE_AT_BOOTSTRAP)), RequestQueue::Put::Taken);
    EXPECT_THAT(takeDue(queue, DequeuePoint::Idle), ElementsAre(8, 9, 1, 2, 3));
}

TEST(RequestQueueTest, RequestBeyondTheCountIsRefusedUntilOneIsTaken) {
    RequestQueue queue({2, 1U << 20});
    EXPECT_EQ(queue.put(numbered(1)), RequestQueue::Put::Taken);
    EXPECT_EQ(queue.put(numbered(2)), RequestQueue::Put::Taken);
    EXPECT_EQ(queue.put(numbered(3)), RequestQueue::Put::TooMany);
    EXPECT_EQ(queue.take(DequeuePoint::Idle)->id().lo(), 1U);
    EXPECT_EQ(queue.put(numbered(4)), RequestQueue::Put::Taken);
    EXPECT_THAT(takeDue(queue, DequeuePoint::Idle), ElementsAre(2, 4));
}

TEST(RequestQueueTest, RequestBeyondTheBytesIsRefusedUntilThereIsRoom) {
    RequestParts large;
    large.code.assign(10'000, u'x');
    const std::size_t bytes = memoryOf(makeRequest(large));
    EXPECT_GE(bytes, 20'000U);
    RequestQueue queue({100, 2 * bytes});
    EXPECT_EQ(queue.put(makeRequest(large)), RequestQueue::Put::Taken);
    EXPECT_EQ(queue.put(makeRequest(large)), RequestQueue::Put::Taken);
    EXPECT_EQ(queue.put(numbered(3)), RequestQueue::Put::TooLarge);
    queue.take(DequeuePoint::Idle);
    EXPECT_EQ(queue.put(numbered(4)), RequestQueue::Put::Taken);
    queue.takeAll();
    EXPECT_EQ(queue.put(makeRequest(large)), RequestQueue::Put::Taken);
    EXPECT_EQ(queue.put(makeRequest(large)), RequestQueue::Put::Taken);
}

TEST(RequestQueueTest, ClosedQueueRefusesAndStillGivesBackWhatItHas) {
    RequestQueue queue({});
    queue.put(numbered(1, DEQUEUE_AT_DEBUG_PROMPT));
    queue.put(numbered(2));
    EXPECT_TRUE(queue.hasDue(DequeuePoint::Idle));
    EXPECT_FALSE(queue.hasDue(DequeuePoint::Prompt));
    queue.close();
    EXPECT_FALSE(queue.hasDue(DequeuePoint::Idle)) << "nothing is to be taken";
    EXPECT_EQ(queue.put(numbered(3)), RequestQueue::Put::Closed);
    EXPECT_EQ(queue.wait(DequeuePoint::Idle), RequestQueue::Wait::Closed);
    const std::vector<qvm::Request> rest = queue.takeAll();
    ASSERT_EQ(rest.size(), 2U);
    EXPECT_EQ(rest[0].id().lo(), 1U);
    EXPECT_EQ(rest[1].id().lo(), 2U);
    EXPECT_TRUE(queue.takeAll().empty());
}

TEST(RequestQueueTest, EndedQueueRefusesAndGivesWhatIsDueBeforeItSaysSo) {
    RequestQueue queue({});
    queue.put(numbered(1, DEQUEUE_AT_DEBUG_PROMPT));
    queue.put(numbered(2));
    queue.end();
    EXPECT_EQ(queue.put(numbered(3)), RequestQueue::Put::Closed);
    EXPECT_EQ(queue.wait(DequeuePoint::Idle), RequestQueue::Wait::Due);
    EXPECT_EQ(queue.take(DequeuePoint::Idle)->id().lo(), 2U);
    EXPECT_EQ(queue.wait(DequeuePoint::Idle), RequestQueue::Wait::Closed);
    EXPECT_EQ(queue.wait(DequeuePoint::DebugPrompt), RequestQueue::Wait::Due);
}

TEST(RequestQueueTest, BatchThatIsRequeuedAfterTheEndIsDueAgain) {
    RequestQueue queue({});
    queue.put(numbered(1, DEQUEUE_AT_PROMPT));
    queue.takeBatch(1, DequeuePoint::Prompt);
    queue.end();
    EXPECT_EQ(queue.wait(DequeuePoint::Prompt), RequestQueue::Wait::Closed);
    queue.closeBatch(1);
    EXPECT_EQ(queue.wait(DequeuePoint::Idle), RequestQueue::Wait::Due);
}

TEST(RequestQueueTest, ClosedQueueStaysClosed) {
    RequestQueue queue({});
    queue.put(numbered(1));
    queue.close();
    queue.end();
    EXPECT_EQ(queue.wait(DequeuePoint::Idle), RequestQueue::Wait::Closed);
}

TEST(RequestQueueTest, WaitEndsWhenNothingMoreWillCome) {
    RequestQueue queue({});
    auto waited = std::async(std::launch::async, [&] { return queue.wait(DequeuePoint::Idle); });
    queue.end();
    EXPECT_EQ(waited.get(), RequestQueue::Wait::Closed);
}

TEST(RequestQueueTest, WaitEndsWhenADueRequestComes) {
    RequestQueue queue({});
    auto waited = std::async(std::launch::async, [&] { return queue.wait(DequeuePoint::DebugPrompt); });
    queue.put(numbered(1, DEQUEUE_AT_IDLE));
    queue.wake();
    queue.put(numbered(2, DEQUEUE_AT_DEBUG_PROMPT));
    queue.wake();
    EXPECT_EQ(waited.get(), RequestQueue::Wait::Due);
    EXPECT_EQ(queue.take(DequeuePoint::DebugPrompt)->id().lo(), 2U);
}

TEST(RequestQueueTest, WaitEndsWhenTheQueueIsClosed) {
    RequestQueue queue({});
    auto waited = std::async(std::launch::async, [&] { return queue.wait(DequeuePoint::Idle); });
    queue.close();
    EXPECT_EQ(waited.get(), RequestQueue::Wait::Closed);
}

TEST(RequestQueueTest, WaitThatIsInterruptedEndsOnceAndOnlyWithoutARequest) {
    RequestQueue queue({});
    auto waiting = std::async(std::launch::async, [&queue] { return queue.wait(DequeuePoint::Idle); });
    queue.interruptWait();
    EXPECT_EQ(waiting.get(), RequestQueue::Wait::Interrupted);
    EXPECT_EQ(queue.wait(DequeuePoint::Idle, -1, std::chrono::steady_clock::now()), RequestQueue::Wait::TimedOut);
    queue.put(numbered(1));
    queue.interruptWait();
    EXPECT_EQ(queue.wait(DequeuePoint::Idle), RequestQueue::Wait::Due);
}

TEST(RequestQueueTest, WaitEndsWhenItsInterruptIsReadable) {
    RequestQueue queue({});
    const int interrupt = ::eventfd(1, EFD_CLOEXEC);
    EXPECT_EQ(queue.wait(DequeuePoint::Idle, interrupt), RequestQueue::Wait::Interrupted);
    ::close(interrupt);
}

}  // namespace
}  // namespace qvm_test
