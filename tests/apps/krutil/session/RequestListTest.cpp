#include "krutil/session/RequestList.hpp"

#include <gtest/gtest.h>

#include <boost/make_shared.hpp>

#include "cmddistributor/IIPStateEvent.hpp"
#include "krutil/io/PrintableErrorEvent.hpp"

namespace krutil_client {
namespace {

using foundation::msg_svc::exchange::IDType;
using State = SentRequest::State;

class RequestListTest : public ::testing::Test {
  protected:
    RequestList::Sent add(const IDType& id) {
        const auto request = std::make_shared<SentRequest>();
        request->id = id;
        list.add(request);
        return request;
    }

    template <class EventT>
    void publish(const IDType& id) {
        events.publish(boost::make_shared<const EventT>(id));
    }

    foundation::msg_svc::eventmgr::EventMgr events;
    RequestList list{events};
};

TEST_F(RequestListTest, RequestsAreNumberedAsTheyAreSentAndKeepTheirNumbers) {
    const auto first = add(IDType(0, 1));
    const auto second = add(IDType(0, 2));
    EXPECT_EQ(list.unanswered(), (std::vector{first, second}));
    list.remove(*first);
    const auto third = add(IDType(0, 3));
    EXPECT_EQ(list.unanswered(), (std::vector{second, third}));
    EXPECT_EQ(list.find(IDType(0, 1)), nullptr);
    EXPECT_EQ(list.find(1U), nullptr);
    EXPECT_EQ(list.find(2U), second);
    EXPECT_EQ(list.find(IDType(0, 3)), third);
    EXPECT_EQ(third->number, 3U);
}

TEST_F(RequestListTest, EventsTellTheStateOfTheirRequestOnly) {
    const IDType id(0, 1);
    const auto request = add(id);
    const auto other = add(IDType(0, 2));
    EXPECT_EQ(request->state, State::Waiting);
    publish<cmddistributor::IIPRequeuedEvent>(id);
    EXPECT_EQ(request->state, State::Requeued);
    publish<cmddistributor::IIPReactivatedEvent>(id);
    EXPECT_EQ(request->state, State::Waiting);
    publish<cmddistributor::IIPStartedEvent>(id);
    EXPECT_EQ(request->state, State::Running);
    publish<cmddistributor::IIPSuspendedEvent>(id);
    EXPECT_EQ(request->state, State::HeldUp);
    publish<cmddistributor::IIPResumedEvent>(id);
    EXPECT_EQ(request->state, State::Running);
    publish<cmddistributor::IIPCompletedEvent>(id);
    EXPECT_EQ(request->state, State::Running);
    EXPECT_EQ(other->state, State::Waiting);
    publish<cmddistributor::IIPDiscardedEvent>(IDType(0, 2));
    EXPECT_EQ(other->state, State::Discarded);
    publish<cmddistributor::IIPStartedEvent>(IDType(0, 3));
}

TEST_F(RequestListTest, AnErrorThatIsPrintedIsRemembered) {
    const auto request = add(IDType(0, 1));
    const auto printError = [this](const IDType& id) {
        const cmddistributor::RuntimeException error(krutil::cmddistributor::inRUNTIME_ERROR, u"", "", "", {}, {},
                                                     false);
        events.publish(boost::make_shared<const krutil::io::PrintableErrorEvent>(id, error, u"text"));
    };
    printError(IDType(0, 2));
    EXPECT_FALSE(request->errorPrinted);
    printError(IDType(0, 1));
    EXPECT_TRUE(request->errorPrinted);
}

}  // namespace
}  // namespace krutil_client
