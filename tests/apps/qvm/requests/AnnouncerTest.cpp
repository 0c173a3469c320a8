#include "qvm/requests/Announcer.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <future>

#include "apps/qvm/requests/ServedClient.hpp"
#include "cmddistributor/IIPStateEvent.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionError.hpp"
#include "krutil/io/TextBaseEvent.hpp"

namespace qvm_test {
namespace {

using cmddistributor::IIPCompletedEvent;
using cmddistributor::IIPResult;
using cmddistributor::IIPStartedEvent;
using cmddistributor::RuntimeException;
using foundation::msg_svc::exchange::IDType;
using korvel::lang::diagnostic::Warning;
using krutil::io::StreamTypeEnum;
using qvm::Announcer;
using std::chrono::milliseconds;
using testing::ElementsAre;
using testing::EndsWith;
using testing::HasSubstr;
using testing::IsEmpty;
using Limits = foundation::msg_svc::transport::layers::session::Limits;

Limits smallFrames(std::uint64_t size) {
    Limits limits;
    limits.taggedFrame = size;
    return limits;
}

RequestParts requestNumbered(std::uint64_t number) {
    RequestParts parts;
    parts.number = number;
    return parts;
}

Announcer::Event textOf(std::uint64_t request, std::u16string text) {
    return boost::make_shared<const krutil::io::TextBaseEvent>(IDType(0, request), StreamTypeEnum::OUTPUT_STREAM,
                                                               std::move(text));
}

RuntimeException error(std::u16string text) {
    return {krutil::cmddistributor::inRUNTIME_ERROR, std::move(text), "id", "", {}, {}, false};
}

Warning warningOf(std::size_t units, bool disabled = false) {
    return {std::string(units, 'i'),
            std::u16string(units, u'f'),
            {korvel::lang::PrintfArgument(1)},
            std::u16string(units, u'm'),
            {{u"file", u"function", 1}},
            disabled,
            0.5};
}

TEST(AnnouncerTest, EventsOfATurnTravelOnTheStreamOfTheirRequestInOrder) {
    ServedClient client;
    const qvm::Request first = client.send(requestNumbered(1));
    const qvm::Request second = client.send(requestNumbered(2));
    {
        Announcer::Turn turn = client.announcer().turn();
        EXPECT_TRUE(turn.isServing());
        turn.raise<IIPStartedEvent>(second);
        EXPECT_TRUE(turn.publish(2, textOf(2, u"out")));
        turn.raise<IIPStartedEvent>(first);
        turn.raise<IIPCompletedEvent>(second);
        turn.finish(second, std::make_unique<IIPResult>(second.id(), boost::none));
    }
    EXPECT_THAT(client.received(),
                ElementsAre("2 started", "2 text 0 out", "1 started", "2 completed", "2 last", "2 reply"));
}

TEST(AnnouncerTest, OthersWaitForTheirTurn) {
    ServedClient client;
    const qvm::Request request = client.send(requestNumbered(1));
    std::future<void> other;
    {
        Announcer::Turn turn = client.announcer().turn();
        turn.raise<IIPStartedEvent>(request);
        other = std::async(std::launch::async, [&] { client.announcer().turn().publish(1, textOf(1, u"later")); });
        EXPECT_EQ(other.wait_for(milliseconds(20)), std::future_status::timeout);
        EXPECT_TRUE(turn.publish(1, textOf(1, u"now")));
    }
    other.get();
    EXPECT_THAT(client.received(), ElementsAre("1 started", "1 text 0 now", "1 text 0 later"));
}

TEST(AnnouncerTest, DiscardedRequestHasItsErrorInTheReply) {
    ServedClient client;
    const qvm::Request request = client.send(requestNumbered(3));
    client.announcer().turn().discard(request, error(u"too late"));
    EXPECT_THAT(client.received(), ElementsAre("3 discarded", "3 last", "3 reply 2 too late"));
}

TEST(AnnouncerTest, RefusedRequestHasTheReasonInTheReply) {
    ServedClient client;
    const qvm::Request request = client.send(requestNumbered(3));
    client.announcer().turn().refuse(request, "The engine is busy.");
    EXPECT_THAT(client.received(), ElementsAre("3 discarded", "3 last", "3 reply 5 The engine is busy."));
}

TEST(AnnouncerTest, ResultThatTheClientDoesNotAcceptBecomesAnErrorThatSaysSo) {
    ServedClient client(smallFrames(1000));
    const qvm::Request request = client.send(requestNumbered(1));
    client.announcer().turn().finish(request,
                                     std::make_unique<IIPResult>(request.id(), error(std::u16string(1000, u'x'))));
    EXPECT_THAT(client.received(),
                ElementsAre("1 last",
                            "1 reply 5 The result of this request cannot be sent: \"krutil:IIPReply\" is larger than "
                            "the client accepts: its limit \"taggedFrame\" is 1000 bytes, the content of frame 1 has "
                            "1016"));
}

TEST(AnnouncerTest, ClientThatAcceptsNotEvenThatIsAnException) {
    ServedClient client(smallFrames(40));
    const qvm::Request request = client.send(requestNumbered(1));
    EXPECT_THROW(client.announcer().turn().finish(
                     request, std::make_unique<IIPResult>(request.id(), error(std::u16string(1000, u'x')))),
                 foundation::msg_svc::transport::layers::session::LimitExceeded);
    EXPECT_THAT(client.received(), ElementsAre("1 last"));
}

TEST(AnnouncerTest, EventThatTheClientDoesNotAcceptIsToldToTheLog) {
    ServedClient client(smallFrames(1000));
    client.send(requestNumbered(1));
    {
        Announcer::Turn turn = client.announcer().turn();
        EXPECT_FALSE(turn.publish(1, textOf(1, std::u16string(1000, u'x'))));
        EXPECT_TRUE(turn.publish(1, textOf(1, u"y")));
    }
    EXPECT_THAT(client.log(), EndsWith(" An event cannot be sent: \"krutil:TextBaseEvent\" is larger than the client "
                                       "accepts: its limit \"taggedFrame\" is 1000 bytes, the content of frame 1 has "
                                       "1007\n"));
    EXPECT_THAT(client.received(), ElementsAre("1 text 0 y"));
}

TEST(AnnouncerTest, TextGoesWhereItsTargetSays) {
    ServedClient client;
    client.send(requestNumbered(7));
    Announcer& announcer = client.announcer();
    announcer.announceText({7, IDType(0, 7), StreamTypeEnum::ERROR_STREAM, false, false, false}, u"plain");
    announcer.announceText({7, IDType(0, 7), StreamTypeEnum::OUTPUT_STREAM, true, true, false}, u"sh\u00f6wn");
    announcer.announceText({7, IDType(0, 7), StreamTypeEnum::OUTPUT_STREAM, false, true, true}, u" twice");
    announcer.announceText({}, u"of none");
    EXPECT_EQ(client.diary(), "sh\u00f6wn twice");
    EXPECT_THAT(client.log(), EndsWith(" text of " + toString(IDType(0, 7)) + ":  twice\n"));
    EXPECT_THAT(client.received(),
                ElementsAre("7 text 1 plain", "7 shown 0 sh\u00f6wn", "7 text 0  twice", "0 text 2 of none"));
}

TEST(AnnouncerTest, WarningThatIsShownTravelsTwice) {
    ServedClient client;
    const qvm::Request request = client.send(requestNumbered(4));
    client.announcer().announceWarning(&request, warningOf(2));
    client.announcer().announceWarning(&request, warningOf(3, true));
    client.announcer().announceWarning(nullptr, warningOf(1));
    EXPECT_THAT(client.received(), ElementsAre("4 warning ii | ff | mm | 1 arguments, 1 frames",
                                               "4 enabled warning ii | ff | mm | 1 arguments, 1 frames",
                                               "4 warning iii | fff | mmm | 1 arguments, 1 frames",
                                               "0 warning i | f | m | 1 arguments, 1 frames",
                                               "0 enabled warning i | f | m | 1 arguments, 1 frames"));
}

TEST(AnnouncerTest, WarningThatTheClientDoesNotAcceptIsShortened) {
    ServedClient client(smallFrames(800));
    const qvm::Request request = client.send(requestNumbered(4));
    client.announcer().announceWarning(&request, warningOf(300));
    // A hundred units in all, half of them for the message.
    const std::string cut = " " + std::string(25, 'i') + "... | " + std::string(25, 'f') + "... | " +
                            std::string(50, 'm') + "... | 0 arguments, 0 frames";
    EXPECT_THAT(client.received(), ElementsAre("4 warning" + cut, "4 enabled warning" + cut));
    EXPECT_THAT(client.log(), HasSubstr("An event cannot be sent: \"korvel:lang:diagnostic:IssuedWarningEvent\""));
}

TEST(AnnouncerTest, NothingIsSentAfterTheShutdownEvent) {
    ServedClient client;
    const qvm::Request request = client.send(requestNumbered(1));
    client.announcer().shutDown();
    {
        Announcer::Turn turn = client.announcer().turn();
        EXPECT_FALSE(turn.isServing());
        EXPECT_TRUE(turn.publish(1, textOf(1, u"late")));
        turn.refuse(request, "late");
    }
    client.announcer().announceText({}, u"late");
    EXPECT_THAT(client.log(), IsEmpty());
    // Nor a second shutdown event.
    EXPECT_THAT(client.received(), IsEmpty());
}

TEST(AnnouncerTest, EachEndOfASessionWaitsForTheOther) {
    ServedClient client;
    Announcer& announcer = client.announcer();
    EXPECT_FALSE(announcer.awaitEnd(milliseconds(0)));
    auto over = std::async(std::launch::async, [&] { return announcer.awaitEnd(std::chrono::minutes(1)); });
    EXPECT_FALSE(announcer.end(milliseconds(0)));
    EXPECT_TRUE(over.get());
    auto left = std::async(std::launch::async, [&] { return announcer.end(std::chrono::minutes(1)); });
    announcer.leave();
    EXPECT_TRUE(left.get());
    EXPECT_TRUE(announcer.awaitEnd(milliseconds(0)));
}

}  // namespace
}  // namespace qvm_test
