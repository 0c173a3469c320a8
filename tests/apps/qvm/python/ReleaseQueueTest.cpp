// References that come back from other threads.
#include "qvm/python/ReleaseQueue.hpp"

#include <gtest/gtest.h>
#include <poll.h>

#include <memory>
#include <thread>
#include <vector>

#include "apps/qvm/python/EmbeddedPython.hpp"

namespace qvm_test {
namespace {

using qvm::ReleaseQueue;

class ReleaseQueueTest : public PythonTest {
  protected:
    ReleaseQueueTest() {
        run("import weakref\n"
            "class Thing: pass\n");
    }

    // A new object that only the returned share keeps; `alive(number)` tells whether it still exists.
    std::shared_ptr<const void> heldThing(ReleaseQueue& queue) {
        run("thing = Thing(); watch = weakref.ref(thing)");
        std::shared_ptr<const void> share = queue.hold(eval("thing").ptr());
        run("del thing");
        return share;
    }

    bool alive() { return eval("watch() is not None").cast<bool>(); }

    static bool readable(const ReleaseQueue& queue) {
        pollfd watched{queue.descriptor(), POLLIN, 0};
        return ::poll(&watched, 1, 0) == 1;
    }
};

TEST_F(ReleaseQueueTest, ObjectLivesUntilItsShareHasComeBackAndTheQueueIsDrained) {
    ReleaseQueue queue;
    std::shared_ptr<const void> share = heldThing(queue);
    queue.drain();
    EXPECT_TRUE(alive());
    EXPECT_FALSE(readable(queue));
    share.reset();
    EXPECT_TRUE(alive());
    EXPECT_TRUE(readable(queue));
    queue.drain();
    EXPECT_FALSE(alive());
    EXPECT_FALSE(readable(queue));
}

TEST_F(ReleaseQueueTest, SharesComeBackFromThreadsThatDoNotHaveTheInterpreterLock) {
    ReleaseQueue queue;
    run("things = [Thing() for _ in range(1000)]; watches = [weakref.ref(each) for each in things]");
    std::vector<std::shared_ptr<const void>> shares;
    for (const py::handle each : eval("things")) {
        shares.push_back(queue.hold(each.ptr()));
    }
    run("del things");
    std::vector<std::thread> threads;
    for (std::size_t t = 0; t < 4; ++t) {
        threads.emplace_back([&shares, t] {
            for (std::size_t i = t; i < shares.size(); i += 4) {
                shares[i].reset();
            }
        });
    }
    // This thread keeps the lock throughout, as one that runs code does, and drains meanwhile.
    queue.drain();
    for (std::thread& thread : threads) {
        thread.join();
    }
    queue.drain();
    EXPECT_EQ(show("sum(each() is not None for each in watches)"), "0");
}

TEST_F(ReleaseQueueTest, ShareThatOutlivesTheQueueIsHarmlessAndItsObjectStays) {
    auto queue = std::make_unique<ReleaseQueue>();
    std::shared_ptr<const void> share = heldThing(*queue);
    queue.reset();
    std::thread([&share] { share.reset(); }).join();
    EXPECT_TRUE(alive());
}

TEST_F(ReleaseQueueTest, FinaliserMayGiveBackMore) {
    ReleaseQueue queue;
    std::shared_ptr<const void> share = heldThing(queue);
    names["give_back"] = py::cpp_function([&share] { share.reset(); });
    run("class Last:\n"
        "    def __del__(self, give_back=give_back): give_back()\n"
        "last = Last()");
    std::shared_ptr<const void> last = queue.hold(eval("last").ptr());
    run("del last");
    last.reset();
    queue.drain();
    EXPECT_TRUE(readable(queue));
    queue.drain();
    EXPECT_FALSE(alive());
}

}  // namespace
}  // namespace qvm_test
