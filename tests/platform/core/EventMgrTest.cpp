#include "foundation/msg_svc/eventmgr/EventMgr.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <boost/make_shared.hpp>
#include <string>
#include <thread>

#include "cmddistributor/IIPStateEvent.hpp"

namespace foundation::msg_svc::eventmgr {
namespace {

using cmddistributor::IIPCompletedEvent;
using cmddistributor::IIPStateEvent;
using cmddistributor::LastIIPEvent;
using exchange::IDType;
using testing::ElementsAre;

class EventMgrTest : public testing::Test {
  protected:
    template <class EventT>
    void publish() {
        manager_.publish(boost::make_shared<const EventT>(IDType(1, 2)));
    }
    template <class EventT>
    EventMgr::Subscription note(const std::string& name) {
        return manager_.subscribe<EventT>([this, name](const EventT&) { seen_.push_back(name); });
    }

    EventMgr manager_;
    std::vector<std::string> seen_;
};

TEST_F(EventMgrTest, DeliversByExactDynamicType) {
    note<IIPCompletedEvent>("completed");
    note<LastIIPEvent>("last");
    publish<IIPCompletedEvent>();
    EXPECT_THAT(seen_, ElementsAre("completed"));
}

TEST_F(EventMgrTest, LastEventIsNotCountedAsCompletedToo) {
    note<IIPCompletedEvent>("completed");
    note<LastIIPEvent>("last");
    publish<LastIIPEvent>();
    EXPECT_THAT(seen_, ElementsAre("last"));
}

TEST_F(EventMgrTest, SubscriberOfABaseClassSeesNoDerivedEvents) {
    note<IIPStateEvent>("state");
    publish<IIPCompletedEvent>();
    EXPECT_TRUE(seen_.empty());
}

TEST_F(EventMgrTest, SubscribersOfTheTypeComeBeforeThoseOfAllEachInOrder) {
    manager_.subscribeAll([this](const auto&) { seen_.push_back("all"); });
    note<IIPCompletedEvent>("one");
    note<IIPCompletedEvent>("two");
    publish<IIPCompletedEvent>();
    EXPECT_THAT(seen_, ElementsAre("one", "two", "all"));
}

TEST_F(EventMgrTest, SubscribersGetThePublishedObjectItself) {
    const auto event = boost::make_shared<const IIPCompletedEvent>(IDType(3, 4));
    const BaseEvent* all = nullptr;
    const IIPCompletedEvent* typed = nullptr;
    manager_.subscribeAll([&](const boost::shared_ptr<const BaseEvent>& published) { all = published.get(); });
    manager_.subscribe<IIPCompletedEvent>([&](const IIPCompletedEvent& published) { typed = &published; });
    manager_.publish(event);
    EXPECT_EQ(all, event.get());
    EXPECT_EQ(typed, event.get());
}

TEST_F(EventMgrTest, UnsubscribedCallbackIsNotCalled) {
    const auto subscription = note<IIPCompletedEvent>("one");
    const auto all = manager_.subscribeAll([this](const auto&) { seen_.push_back("all"); });
    manager_.unsubscribe(subscription);
    manager_.unsubscribe(all);
    manager_.unsubscribe(12345);
    publish<IIPCompletedEvent>();
    EXPECT_TRUE(seen_.empty());
}

TEST_F(EventMgrTest, CallbacksMaySubscribeUnsubscribeAndPublish) {
    EventMgr::Subscription self = 0;
    self = manager_.subscribe<IIPCompletedEvent>([&](const IIPCompletedEvent&) {
        manager_.unsubscribe(self);
        note<LastIIPEvent>("last");
        publish<LastIIPEvent>();
    });
    publish<IIPCompletedEvent>();
    publish<IIPCompletedEvent>();
    EXPECT_THAT(seen_, ElementsAre("last"));
}

TEST_F(EventMgrTest, ExceptionOfASubscriberReachesThePublisherAndEndsTheDelivery) {
    manager_.subscribe<IIPCompletedEvent>([](const IIPCompletedEvent&) { throw std::runtime_error("stop"); });
    note<IIPCompletedEvent>("later");
    EXPECT_THAT([&] { publish<IIPCompletedEvent>(); }, testing::ThrowsMessage<std::runtime_error>("stop"));
    EXPECT_TRUE(seen_.empty());
}

TEST_F(EventMgrTest, NullEventIsRefused) {
    EXPECT_THAT([&] { manager_.publish(nullptr); }, testing::ThrowsMessage<std::invalid_argument>(
                                                        "EventMgr::publish: expected an event, got a null pointer"));
}

TEST_F(EventMgrTest, ManyThreadsPublishAtOnce) {
    std::atomic<int> count{0};
    manager_.subscribe<IIPCompletedEvent>([&](const IIPCompletedEvent&) { ++count; });
    std::vector<std::thread> threads;
    for (int i = 0; i < 4; ++i) {
        threads.emplace_back([this] {
            for (int j = 0; j < 250; ++j) {
                publish<IIPCompletedEvent>();
                manager_.unsubscribe(manager_.subscribeAll([](const auto&) {}));
            }
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    EXPECT_EQ(count, 1000);
}

}  // namespace
}  // namespace foundation::msg_svc::eventmgr
