// Each allocation of sending and of receiving fails in turn: the session goes on, or ends with a sentence.

#include <algorithm>
#include <array>
#include <memory>
#include <optional>
#include <vector>

#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"
#include "krutil_protobuf/serializers/AllocationRecorder.hpp"
#include "platform/session/support/TestSessions.hpp"
#include "platform/session/support/WireBytes.hpp"

namespace testing_sessions {
namespace {

using foundation::vantor::carrier::framing::BufferAllocator;

const std::string noMemory = "there is no memory left for the session";

class OutOfMemoryTest : public testing::Test {
  protected:
    Registered protocol_{"test"};
};

// Lets an allocation of the session's own thread fail after the first question, until the next call.
class FailingRecorder : public Recorder {
  public:
    explicit FailingRecorder(long failing) : failing_(failing) {}

    void onMessage(framing::StreamID stream, const boost::shared_ptr<const exchange::Message>& message) override {
        const bool first = !allocations_;
        stop();
        Recorder::onMessage(stream, message);
        if (first) {
            allocations_.emplace(failing_);
        }
    }

    void onEnd(const SessionEnd& end) override {
        stop();
        Recorder::onEnd(end);
    }

    // Once the second question or the end was seen.
    bool failed() const { return allocations_->failed(); }

  private:
    void stop() {
        if (allocations_) {
            allocations_->stop();
        }
    }

    long failing_;
    std::optional<AllocationRecorder> allocations_;
};

TEST_F(OutOfMemoryTest, ReceivingGoesOnOrEndsWithASentence) {
    const std::string bulk(100'000, 'b');
    long failing = 0;
    for (bool failed = true; failed; ++failing) {
        SCOPED_TRACE(failing);
        const std::size_t buffers = BufferAllocator::inUse();
        {
            FailingRecorder saw(failing);
            const Ends ends = socketPair();
            wire::ByteEnd peer(ends.otherIn, ends.otherOut);
            const auto session = openWith(peer, ends, configOf(Role::Engine));
            session->start(saw);
            peer.write(wire::tagged(1, 1, true, questionTag, "first"));
            saw.waitForLines(1);
            peer.write(wire::data(2, 1, false, bulk) + wire::tagged(2, 2, true, questionTag, "second"));
            const std::string line = saw.waitForLines(2)[1];
            failed = saw.failed();
            if (line.rfind("question", 0) != 0) {
                EXPECT_TRUE(failed);
                const SessionEnd end = saw.waitForEnd();
                EXPECT_THAT(end.text, testing::AnyOf(noMemory, testing::HasSubstr("there is no memory for")));
            }
        }
        EXPECT_EQ(BufferAllocator::inUse(), buffers);
    }
    EXPECT_GT(failing, 5);
}

TEST_F(OutOfMemoryTest, SendingThrowsAndGoesOnOrEndsWithASentence) {
    long failing = 0;
    for (bool failed = true; failed; ++failing) {
        SCOPED_TRACE(failing);
        const auto bulk = bulkOf(100'000);
        {
            SessionPair pair;
            const auto first = question("first", {bulk});
            bool threw = false;
            {
                AllocationRecorder allocations(failing);
                try {
                    pair.client->send(1, first);
                } catch (const std::bad_alloc&) {
                    threw = true;
                }
                failed = allocations.failed();
            }
            EXPECT_EQ(threw, failed);
            pair.client->send(2, question("second"));
            const std::string line = pair.engineSaw.waitForLines(1)[0];
            if (line.rfind("question", 0) != 0) {
                EXPECT_THAT(pair.clientSaw.waitForEnd(), isEnd(Reason::Lost, noMemory));
            }
        }
        EXPECT_EQ(bulk.use_count(), 1);
    }
    EXPECT_GT(failing, 5);
}

// What the stream does not take at once is the other thread's, which has to be told.
TEST_F(OutOfMemoryTest, SendingMoreThanTheStreamTakesDoesTheSame) {
    long failing = 0;
    long ended = 0;
    for (bool failed = true; failed; ++failing) {
        SCOPED_TRACE(failing);
        SessionWithBytes end(configOf(Role::Client));
        const auto large = question("large", {bulkOf(8U << 20)});
        {
            AllocationRecorder allocations(failing);
            try {
                end.session->send(1, large);
            } catch (const std::bad_alloc&) {
            }
            failed = allocations.failed();
        }
        if (end.session->traffic().written > 0 && failed) {
            EXPECT_THAT(end.saw.waitForEnd(), isEnd(Reason::Lost, noMemory));
            ++ended;
        }
    }
    EXPECT_GT(failing, 5);
    EXPECT_GT(ended, 0);
}

}  // namespace
}  // namespace testing_sessions
