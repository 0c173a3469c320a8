// Text events, state events and the shutdown event.

#include <gtest/gtest.h>

#include "IIPStateEventSerializer.hpp"
#include "QVMShutdownEventSerializer.hpp"
#include "SinkTextEventSerializer.hpp"
#include "TextBaseEventSerializer.hpp"
#include "foundation/msg_svc/eventmgr/EventMgr.hpp"
#include "krutil_protobuf/support/TestTransport.hpp"

namespace {

using foundation::msg_svc::eventmgr::BaseEvent;
using foundation::msg_svc::exchange::IDType;
using krutil::io::StreamTypeEnum;
using krutil::protobuf_serializer::EventFamily;
using krutil::protobuf_serializer::IIPStateEventSerializer;
using transport::FrameType;
using transport::RecordingStream;
using transport::SerializationContext;
namespace wire = krutil::protobuf;

boost::shared_ptr<const BaseEvent> read(const std::string& tag, const std::string& bytes) {
    return std::get<boost::shared_ptr<const BaseEvent>>(transport::readObject(tag, bytes));
}

// ---- Text events ----------------------------------------------------------------------------------------------------

template <class Serializer>
class TextEventTest : public testing::Test {};

template <class EventT, class SerializerT, class ProtoT>
struct Kind {
    using Event = EventT;
    using Serializer = SerializerT;
    using Proto = ProtoT;
};

using TextKinds = testing::Types<
    Kind<krutil::io::TextBaseEvent, krutil::protobuf_serializer::TextBaseEventSerializer, wire::TextBaseEvent>,
    Kind<krutil::io::SinkTextEvent, krutil::protobuf_serializer::SinkTextEventSerializer, wire::SinkTextEvent>>;
TYPED_TEST_SUITE(TextEventTest, TextKinds);

TYPED_TEST(TextEventTest, NonAsciiTextOnTheErrorStreamRoundTrips) {
    using Serializer = typename TypeParam::Serializer;
    using Event = typename TypeParam::Event;
    const std::u16string text = u"\u03B1\u20AC\U0001F600";
    const auto proto = Serializer::toProtobuf(Event(IDType(1, 2), StreamTypeEnum::ERROR_STREAM, text));
    EXPECT_EQ(proto.stream(), wire::ERROR_STREAM);
    EXPECT_EQ(proto.text(), "\xCE\xB1\xE2\x82\xAC\xF0\x9F\x98\x80");
    const auto back = boost::dynamic_pointer_cast<const Event>(Serializer::fromProtobuf(proto));
    EXPECT_EQ(back->getRequestId(), IDType(1, 2));
    EXPECT_EQ(back->getStreamType(), StreamTypeEnum::ERROR_STREAM);
    EXPECT_EQ(back->getText(), text);
}

TYPED_TEST(TextEventTest, AMessageWithoutFieldsIsEmptyOutputOfNoRequest) {
    const auto back = boost::dynamic_pointer_cast<const typename TypeParam::Event>(
        TypeParam::Serializer::fromProtobuf(typename TypeParam::Proto()));
    EXPECT_EQ(back->getRequestId(), IDType());
    EXPECT_EQ(back->getStreamType(), StreamTypeEnum::OUTPUT_STREAM);
    EXPECT_EQ(back->getText(), u"");
}

TYPED_TEST(TextEventTest, OutputHasNoStreamFieldOnTheWireAndReadsBackAsOutput) {
    using Serializer = typename TypeParam::Serializer;
    using Event = typename TypeParam::Event;
    const auto proto = Serializer::toProtobuf(Event(IDType(), StreamTypeEnum::OUTPUT_STREAM, u"a"));
    EXPECT_EQ(proto.SerializeAsString(), std::string("\x0A\x00\x1A\x01"
                                                     "a",
                                                     5));
    const auto back = boost::dynamic_pointer_cast<const Event>(Serializer::fromProtobuf(proto));
    EXPECT_EQ(back->getStreamType(), StreamTypeEnum::OUTPUT_STREAM);
}

// ---- State events ---------------------------------------------------------------------------------------------------

template <class Event>
class StateEventTest : public testing::Test {};

using StateKinds = testing::Types<cmddistributor::IIPStartedEvent, cmddistributor::IIPSuspendedEvent,
                                  cmddistributor::IIPResumedEvent, cmddistributor::IIPDiscardedEvent,
                                  cmddistributor::IIPRequeuedEvent, cmddistributor::IIPReactivatedEvent,
                                  cmddistributor::IIPCompletedEvent, cmddistributor::LastIIPEvent>;
TYPED_TEST_SUITE(StateEventTest, StateKinds);

TYPED_TEST(StateEventTest, TheReceivedTypeNeverChangesTheClass) {
    const std::string tag = IIPStateEventSerializer<TypeParam>().name();
    for (const int type : {0, 1, 2, 3, 4, 5, 6, 7, 8, -1}) {
        wire::IIPStateEvent proto;
        proto.mutable_id()->set_lo(9);
        proto.set_type(static_cast<wire::IIPStateEventType>(type));
        const auto event = read(tag, proto.SerializeAsString());
        const BaseEvent* raw = event.get();
        EXPECT_EQ(typeid(*raw), typeid(TypeParam)) << type;
        EXPECT_EQ(dynamic_cast<const TypeParam&>(*event).getRequestId(), IDType(0, 9));
    }
}

TYPED_TEST(StateEventTest, AMessageWithoutIdentifierHasThatOfTheEmptyMessage) {
    const auto event = read(IIPStateEventSerializer<TypeParam>().name(), "");
    EXPECT_EQ(dynamic_cast<const TypeParam&>(*event).getRequestId(), IDType());
}

// A class of the same template that is none of the eight has no number, and so no serializer.
template <class Event>
concept HasNumber = requires {
    krutil::protobuf_serializer::StateEventType<Event>::value;
};
static_assert(HasNumber<cmddistributor::IIPStartedEvent>);
static_assert(HasNumber<cmddistributor::LastIIPEvent>);
static_assert(!HasNumber<cmddistributor::IIPStateEvent>);
static_assert(!HasNumber<cmddistributor::DefaultIIPStateEvent<&cmddistributor::IIPStateEventTypes::getLastEventType,
                                                              cmddistributor::IIPStateEvent>>);

TEST(StateEventTypeTest, NumbersRunFromZeroInTheOrderOfTheKinds) {
    using namespace cmddistributor;
    const IDType id(1, 2);
    const auto type = []<class Event>(const Event& event) {
        return static_cast<int>(IIPStateEventSerializer<Event>::toProtobuf(event).type());
    };
    EXPECT_EQ(type(IIPStartedEvent(id)), 0);
    EXPECT_EQ(type(IIPSuspendedEvent(id)), 1);
    EXPECT_EQ(type(IIPResumedEvent(id)), 2);
    EXPECT_EQ(type(IIPDiscardedEvent(id)), 3);
    EXPECT_EQ(type(IIPRequeuedEvent(id)), 4);
    EXPECT_EQ(type(IIPReactivatedEvent(id)), 5);
    EXPECT_EQ(type(IIPCompletedEvent(id)), 6);
    EXPECT_EQ(type(LastIIPEvent(id)), 7);
}

// The exact dynamic type selects the serializer, so the frame's tag and number are the last event's although the
// object is a completed event too.
TEST(LastIIPEventTest, IsWrittenAsTheLastEventAndComesBackAsOneThatIsCompletedToo) {
    const auto registry = transport::sessionRegistry();
    const auto event = boost::make_shared<cmddistributor::LastIIPEvent>(IDType(1, 2));
    const BaseEvent* raw = event.get();
    const auto found = registry->find(std::type_index(typeid(*raw)));
    EXPECT_EQ(found->name(), "krutil:detail::LastIIPEvent");

    const auto stream = std::make_shared<RecordingStream>();
    dynamic_cast<const EventFamily&>(*found).serialize(event, 7, 1, stream, registry, SerializationContext());
    const auto frame = transport::contentOf(*stream->frames.at(0));
    EXPECT_EQ(frame.tag, "krutil:detail::LastIIPEvent");
    wire::IIPStateEvent proto;
    ASSERT_TRUE(proto.ParseFromString(frame.bytes));
    EXPECT_EQ(proto.type(), wire::LastIIPEvent);

    const auto back = read(frame.tag, frame.bytes);
    EXPECT_NE(boost::dynamic_pointer_cast<const cmddistributor::LastIIPEvent>(back), nullptr);
    EXPECT_NE(boost::dynamic_pointer_cast<const cmddistributor::IIPCompletedEvent>(back), nullptr);
}

TEST(LastIIPEventTest, ACompletedEventIsNoLastEventAfterTheTrip) {
    const auto registry = transport::sessionRegistry();
    const auto& serializer = *registry->find(std::type_index(typeid(cmddistributor::IIPCompletedEvent)));
    EXPECT_EQ(serializer.name(), "krutil:IIPCompletedEvent");
    const samples::Object event =
        boost::shared_ptr<const BaseEvent>(boost::make_shared<cmddistributor::IIPCompletedEvent>(IDType(1, 2)));
    const auto frames = transport::writtenFrames(serializer, event, registry);
    wire::IIPStateEvent proto;
    ASSERT_TRUE(proto.ParseFromString(frames.at(0).bytes));
    EXPECT_EQ(proto.type(), wire::IIPCompletedEvent);
    const auto back = read("krutil:IIPCompletedEvent", frames.at(0).bytes);
    EXPECT_EQ(boost::dynamic_pointer_cast<const cmddistributor::LastIIPEvent>(back), nullptr);
    EXPECT_NE(boost::dynamic_pointer_cast<const cmddistributor::IIPCompletedEvent>(back), nullptr);
}

// Even a completed event's serializer writes its own number for a last event: the object is not asked.
TEST(LastIIPEventTest, TheNumberIsTheSerializersNotTheObjects) {
    EXPECT_EQ(IIPStateEventSerializer<cmddistributor::IIPCompletedEvent>::toProtobuf(
                  cmddistributor::LastIIPEvent(IDType(1, 2)))
                  .type(),
              wire::IIPCompletedEvent);
}

TEST(LastIIPEventTest, ASubscriberOfCompletedEventsDoesNotCountIt) {
    foundation::msg_svc::eventmgr::EventMgr manager;
    int completed = 0;
    int last = 0;
    manager.subscribe<cmddistributor::IIPCompletedEvent>([&](const auto&) { ++completed; });
    manager.subscribe<cmddistributor::LastIIPEvent>([&](const auto&) { ++last; });
    manager.publish(boost::make_shared<cmddistributor::IIPCompletedEvent>(IDType(1, 2)));
    manager.publish(boost::make_shared<cmddistributor::LastIIPEvent>(IDType(1, 2)));
    EXPECT_EQ(completed, 1);
    EXPECT_EQ(last, 1);
}

// ---- Shutdown -------------------------------------------------------------------------------------------------------

class QVMShutdownEventTest : public testing::Test {
  protected:
    // The frame that the object becomes, at index 5.
    static transport::FrameContent written(const boost::shared_ptr<const BaseEvent>& event) {
        const auto registry = transport::sessionRegistry();
        const auto stream = std::make_shared<RecordingStream>();
        EXPECT_EQ(transport::serializer<EventFamily>(*registry, "krutil:QVMShutdownEvent")
                      .serialize(event, 7, 5, stream, registry, SerializationContext()),
                  6U);
        EXPECT_EQ(stream->frames.size(), 1U);
        return transport::contentOf(*stream->frames.at(0));
    }

    const transport::FrameContent frame_{true, FrameType::Object, 7, 5, "krutil:QVMShutdownEvent", ""};
};

TEST_F(QVMShutdownEventTest, IsAFrameWithoutBytes) {
    EXPECT_EQ(written(boost::make_shared<krutil::eventmgr::QVMShutdownEvent>()), frame_);
}

TEST_F(QVMShutdownEventTest, ANullPointerGivesTheSameFrame) {
    EXPECT_EQ(written(nullptr), frame_);
}

TEST_F(QVMShutdownEventTest, AnEventOfAnotherTypeGivesTheSameFrame) {
    EXPECT_EQ(written(boost::make_shared<cmddistributor::LastIIPEvent>(IDType(1, 2))), frame_);
}

TEST_F(QVMShutdownEventTest, AnyBytesReadAsTheEvent) {
    for (const std::string& bytes : {std::string(), std::string("\x08\x01"), std::string("\xFF\xFF\xFF"),
                                     std::string(1000, '\xFF'), std::string("\x0A\x7F", 2), std::string(100, '\0')}) {
        const auto event = read("krutil:QVMShutdownEvent", bytes);
        EXPECT_NE(boost::dynamic_pointer_cast<const krutil::eventmgr::QVMShutdownEvent>(event), nullptr);
    }
}

}  // namespace
