// Every type of the protocol from an object to frames and back, on a platform that shares no line with the reference
// platform. All that a type carries is compared.

#include <gtest/gtest.h>

#include <algorithm>
#include <boost/make_shared.hpp>
#include <cstring>
#include <iterator>
#include <set>
#include <string>
#include <vector>

#include "KrutilProtocol.hpp"
#include "cmddistributor/DebugLoopEvent.hpp"
#include "cmddistributor/EvalIIP.hpp"
#include "cmddistributor/FEvalIIP.hpp"
#include "cmddistributor/FEvalResult.hpp"
#include "cmddistributor/IIPCancelMessage.hpp"
#include "cmddistributor/IIPCancelReply.hpp"
#include "cmddistributor/IIPEnqueueMessage.hpp"
#include "cmddistributor/IIPResult.hpp"
#include "cmddistributor/IIPStateEvent.hpp"
#include "foundation/korveldata/ArrayFactory.hpp"
#include "foundation/msg_svc/transport/layers/serialization/SerializerAPI.hpp"
#include "foundation/msg_svc/transport/layers/session/ProtocolRegistry.hpp"
#include "foundation/vantor/carrier/framing/DataFrame.hpp"
#include "foundation/vantor/carrier/framing/TaggedFrame.hpp"
#include "korvel/lang/diagnostic/IssuedEnabledWarningEvent.hpp"
#include "korvel/lang/diagnostic/IssuedWarningEvent.hpp"
#include "krutil/capabilities_api/CapabilitiesChanged.hpp"
#include "krutil/cmddistributor/IIPReply.hpp"
#include "krutil/eventmgr/QVMShutdownEvent.hpp"
#include "krutil/io/PrintableErrorEvent.hpp"
#include "krutil/io/SinkTextEvent.hpp"
#include "krutil/io/TextBaseEvent.hpp"

namespace {

namespace framing = foundation::vantor::carrier::framing;
namespace layers = foundation::msg_svc::transport::layers;
using capabilities::Capability;
using capabilities::CapabilityList;
using foundation::korveldata::Array;
using foundation::korveldata::ArrayFactory;
using foundation::msg_svc::exchange::IDType;
using krutil::protobuf::KrutilProtocol;
using layers::serialization::SerializerAPI;

template <class T>
using Shared = boost::shared_ptr<const T>;
using Event = Shared<foundation::msg_svc::eventmgr::BaseEvent>;
using Request = Shared<cmddistributor::IIP>;
using Message = Shared<foundation::msg_svc::exchange::Message>;
using Reply = Shared<foundation::msg_svc::exchange::Reply>;
using Result = std::unique_ptr<cmddistributor::IIPResult>;

constexpr framing::FrameIndex firstIndex = 3;

/// What the frames of a message looked like: the tag and the type of a tagged frame, the type of a data frame.
struct Seen {
    std::string tag;
    int type;

    bool operator==(const Seen&) const = default;
    friend void PrintTo(const Seen& seen, std::ostream* out) { *out << seen.tag << ' ' << seen.type; }
};

/// A session's serializers, and a transport that hands the receiver bytes of its own.
class Session {
  public:
    Session() {
        KrutilProtocol::init();
        const auto& [initialize, configure] =
            layers::session::ProtocolRegistry::getRegistry()->protocol(KrutilProtocol::protocolName);
        offered_ = configure();
        version_ = initialize(registry_, {1, 0}, {{"ZEROCOPY", "enable"}});
    }

    const layers::serialization::Registry& registry() const { return *registry_; }
    const std::vector<layers::session::FeatureRequest>& offered() const { return offered_; }
    std::pair<unsigned int, unsigned int> version() const { return version_; }
    const std::vector<Seen>& seen() const { return seen_; }

    template <class T, class Ptr>
    Ptr travel(const Ptr& object, const std::type_info& type) {
        using Api = SerializerAPI<T, Ptr, Ptr>;
        const auto stream = std::make_shared<layers::message::MessageStream>();
        const auto writer = std::dynamic_pointer_cast<const Api>(registry_->find(type));
        const framing::FrameIndex next = writer->serialize(object, 7, firstIndex, stream, registry_, context_);

        const auto message = std::make_unique<layers::message::Message>();
        seen_.clear();
        for (auto& frame : stream->take()) {
            const framing::FrameIndex index = firstIndex + seen_.size();
            message->add(index, received(*frame, index));
        }
        EXPECT_EQ(next, firstIndex + seen_.size());
        const auto reader = std::dynamic_pointer_cast<const Api>(registry_->find(seen_.back().tag));
        return reader->deserialize(next - 1, message, registry_, context_);
    }

  private:
    // The frame as a receiver gets it: the same content in memory of its own, which a plain function releases.
    std::unique_ptr<framing::Frame> received(const framing::Frame& sent, framing::FrameIndex index) {
        EXPECT_EQ(sent.position(), index);
        const auto size = static_cast<unsigned long>(sent.end() - sent.begin());
        char* copy = foundation::korveldata::newBuffer(size);
        std::copy(sent.begin(), sent.end(), copy);
        std::pair bytes(framing::Frame::Bytes(copy, &foundation::korveldata::deleteBuffer), size);
        const auto* tagged = dynamic_cast<const framing::TaggedFrame*>(&sent);
        seen_.push_back({tagged != nullptr ? tagged->tag() : "", static_cast<int>(sent.type())});
        if (tagged != nullptr) {
            return std::make_unique<framing::TaggedFrame>(sent.type(), 7, tagged->tag(), std::move(bytes), index);
        }
        EXPECT_TRUE(dynamic_cast<const framing::DataFrame&>(sent).settled());
        return std::make_unique<framing::DataFrame>(sent.type(), 7, std::move(bytes), true, index);
    }

    const std::shared_ptr<layers::serialization::Registry> registry_ =
        std::make_shared<layers::serialization::Registry>();
    const layers::serialization::SerializationContext context_{1};
    std::vector<layers::session::FeatureRequest> offered_;
    std::pair<unsigned int, unsigned int> version_;
    std::vector<Seen> seen_;
};

/// The dynamic type.
template <class T>
const std::type_info& typeOf(const T& object) {
    return typeid(object);
}

class RoundTrips : public testing::Test {
  protected:
    /// Sends an object of a family and returns what arrives, as the concrete class. The last frame is the object's own.
    template <class Object, class T>
    Shared<Object> travel(const Shared<T>& object, const std::string& tag, int type) {
        const Shared<T> arrived = session.travel<T, Shared<T>>(object, typeid(Object));
        EXPECT_EQ(session.seen().back(), (Seen{tag, type}));
        EXPECT_EQ(typeOf(*arrived), typeid(Object));
        return boost::dynamic_pointer_cast<const Object>(arrived);
    }

    template <class Object>
    Shared<Object> travelAsEvent(const Object& object, const std::string& tag, int type = 29) {
        return travel<Object>(Event(boost::make_shared<const Object>(object)), tag, type);
    }

    template <class Object>
    std::unique_ptr<Object> travelAsResult(Result result, const std::string& tag) {
        Result arrived = session.travel<cmddistributor::IIPResult, Result>(result, typeid(Object));
        EXPECT_EQ(session.seen().back(), (Seen{tag, 29}));
        EXPECT_EQ(typeOf(*arrived), typeid(Object));
        return std::unique_ptr<Object>(dynamic_cast<Object*>(arrived.release()));
    }

    template <std::string (*Type)(), class Base = cmddistributor::IIPStateEvent>
    void stateEvent(const std::string& tag, const std::string& kind) {
        const auto event = travelAsEvent(cmddistributor::DefaultIIPStateEvent<Type, Base>(IDType{-12}), tag);
        EXPECT_EQ(event->getRequestId(), IDType{-12});
        EXPECT_EQ(event->type(), kind);
    }

    template <class Object>
    void warningEvent(const std::string& tag, int type) {
        using korvel::lang::PrintfArgument;
        using Value = PrintfArgument::Variant;
        const std::vector<PrintfArgument> arguments{
            PrintfArgument(Value(-1)),  PrintfArgument(Value(4000000000U)),
            PrintfArgument(Value(-5L)), PrintfArgument(Value(~0UL)),
            PrintfArgument(Value(0.1)), PrintfArgument(Value(std::u16string(u"ß")))};
        const korvel::lang::diagnostic::Warning warning(
            "a:b", u"%d ö", arguments, u"1 ö", {{u"f.py", u"outer", 12}, {u"g.py", u"inner", 0}}, true, 738000.5);
        const auto event = travelAsEvent(Object(IDType{6}, warning), tag, type);
        EXPECT_EQ(event->getRequestId(), IDType{6});
        EXPECT_TRUE(event->getWarning() == warning);
    }

    Session session;
};

CapabilityList listOf(std::initializer_list<Capability> members) {
    CapabilityList list;
    for (const Capability member : members) {
        list |= member;
    }
    return list;
}

/// Two planes of four bytes.
Array twoPlanes() {
    ArrayFactory factory;
    return Array(7, {2, 2}, {factory.plane("abcd"), factory.plane(std::string("e\0gh", 4))});
}

void expectSame(const Array& arrived, const Array& sent) {
    EXPECT_EQ(arrived.code(), sent.code());
    EXPECT_EQ(arrived.extents(), sent.extents());
    ASSERT_EQ(arrived.planes().size(), sent.planes().size());
    for (std::size_t plane = 0; plane < sent.planes().size(); ++plane) {
        EXPECT_EQ(arrived.bytes(plane), sent.bytes(plane));
    }
}

cmddistributor::RuntimeException error() {
    using krutil::cmddistributor::inExecutionStatus;
    const cmddistributor::RuntimeException root(inExecutionStatus::cutOff, u"root", "r:id", "r", {}, {}, false);
    const cmddistributor::RuntimeException other(inExecutionStatus::unreadable, u"", "", "", {}, {}, false);
    const cmddistributor::RuntimeException cause(inExecutionStatus::interrupted, u"cause", "c:id", "c",
                                                 {{u"c.py", "c", 3}}, {root}, false);
    return cmddistributor::RuntimeException(inExecutionStatus::failed, u"täxt", "e:id", "e",
                                            {{u"ä.py", "e", 12.5}, {u"b.py", "main", 0}}, {cause, other}, false);
}

const krutil::io::SinkTraits outTraits(true, true, false, true, false, true);
const krutil::io::SinkTraits errTraits(true, false, true, false, true, false);

void expectArrived(const krutil::io::SinkTraits& traits, const krutil::io::SinkTraits& sent) {
    EXPECT_FALSE(traits.own());
    EXPECT_EQ(traits.getSupportsHotlinks(), sent.getSupportsHotlinks());
    EXPECT_EQ(traits.getNeedsFormattingForDisplay(), sent.getNeedsFormattingForDisplay());
    EXPECT_EQ(traits.getUseDiary(), sent.getUseDiary());
    EXPECT_EQ(traits.getUseEcho(), sent.getUseEcho());
    EXPECT_EQ(traits.getUseLogging(), sent.getUseLogging());
}

void expectCore(const cmddistributor::IIP& request, cmddistributor::IqmStreamID stream) {
    EXPECT_EQ(request.getPluginType(), "plugin");
    EXPECT_EQ(request.getStreamID(), stream);
    expectArrived(request.getOutTraits(), outTraits);
    expectArrived(request.getErrTraits(), errTraits);
}

Request evaluation() {
    return boost::make_shared<const cmddistributor::EvalIIP>("plugin", cmddistributor::machine, nullptr, outTraits,
                                                             errTraits, u"α = 1", cmddistributor::CodeType::line);
}

void expectEvaluation(const cmddistributor::EvalIIP& request) {
    expectCore(request, cmddistributor::machine);
    EXPECT_EQ(request.getCommand(), u"α = 1");
    EXPECT_EQ(request.getCodeType(), cmddistributor::CodeType::line);
    EXPECT_FALSE(request.hasWorkspace());
}

boost::shared_ptr<const cmddistributor::FEvalIIP> call(std::vector<Array> arrays, unsigned long client,
                                                       unsigned long server) {
    krutil::cmddistributor::EDIDataWrapper arguments(std::move(arrays));
    auto data = cmddistributor::FEvalIIP::Data::makeServerSideData(std::move(arguments), client, server, false);
    return boost::make_shared<const cmddistributor::FEvalIIP>("plugin", "numpy.dot", 2UL, std::move(data),
                                                              cmddistributor::nowhere, outTraits, errTraits, client,
                                                              server, true);
}

TEST_F(RoundTrips, SessionSetsTheProtocolUp) {
    EXPECT_EQ(session.version(), std::make_pair(1U, 0U));
    ASSERT_EQ(session.offered().size(), 2U);
    for (const auto& [choice, offered] :
         {std::make_pair("enable", session.offered()[0]), std::make_pair("disable", session.offered()[1])}) {
        EXPECT_EQ(offered.feature, "ZEROCOPY");
        EXPECT_EQ(offered.choice, choice);
        EXPECT_EQ(offered.handling, layers::session::FeatureHandling::always);
    }
    for (const auto& serializer : session.registry().entries()) {
        EXPECT_EQ(serializer->version(), std::make_pair(1U, 0U)) << serializer->name();
    }
}

TEST_F(RoundTrips, QVMShutdownEvent) {
    travelAsEvent(krutil::eventmgr::QVMShutdownEvent(), "krutil:QVMShutdownEvent");
}

TEST_F(RoundTrips, DebugLoopEvent) {
    using cmddistributor::DebugLoopEvent;
    for (int loop = -1; loop <= 11; ++loop) {
        const auto which = static_cast<krutil::prompt::InputRequester>(loop);
        for (const auto state : {DebugLoopEvent::State::over, DebugLoopEvent::State::begun}) {
            const auto event = travelAsEvent(DebugLoopEvent(IDType{9}, state, which), "krutil:DebugLoopEvent");
            EXPECT_EQ(event->getRequestId(), IDType{9});
            EXPECT_EQ(event->getLoopState(), state);
            EXPECT_EQ(event->getWhichDebugLoop(), which);
        }
    }
}

using cmddistributor::IIPStateEventTypes;

TEST_F(RoundTrips, IIPStartedEvent) {
    stateEvent<&IIPStateEventTypes::getStartedEventType>("krutil:IIPStartedEvent", "runs");
}

TEST_F(RoundTrips, IIPSuspendedEvent) {
    stateEvent<&IIPStateEventTypes::getSuspendedEventType>("krutil:IIPSuspendedEvent", "stands");
}

TEST_F(RoundTrips, IIPResumedEvent) {
    stateEvent<&IIPStateEventTypes::getResumedEventType>("krutil:IIPResumedEvent", "runs again");
}

TEST_F(RoundTrips, IIPDiscardedEvent) {
    stateEvent<&IIPStateEventTypes::getDiscardedEventType>("krutil:IIPDiscardedEvent", "dropped");
}

TEST_F(RoundTrips, IIPRequeuedEvent) {
    stateEvent<&IIPStateEventTypes::getRequeuedEventType>("krutil:IIPRequeuedEvent", "put back");
}

TEST_F(RoundTrips, IIPReactivatedEvent) {
    stateEvent<&IIPStateEventTypes::getReactivatedEventType>("krutil:IIPReactivatedEvent", "taken again");
}

TEST_F(RoundTrips, IIPCompletedEvent) {
    stateEvent<&IIPStateEventTypes::getCompletedEventType>("krutil:IIPCompletedEvent", "over");
}

TEST_F(RoundTrips, LastIIPEvent) {
    using Completed =
        cmddistributor::DefaultIIPStateEvent<&IIPStateEventTypes::getCompletedEventType, cmddistributor::IIPStateEvent>;
    stateEvent<&IIPStateEventTypes::getLastEventType, Completed>("krutil:detail::LastIIPEvent", "closed");
}

TEST_F(RoundTrips, TextBaseEvent) {
    const krutil::io::TextBaseEvent sent(IDType{1}, krutil::io::complained, u"zwölf 😀");
    const auto event = travelAsEvent(sent, "krutil:TextBaseEvent");
    EXPECT_EQ(event->getRequestId(), IDType{1});
    EXPECT_EQ(event->getStreamType(), krutil::io::complained);
    EXPECT_EQ(event->getText(), u"zwölf 😀");
}

TEST_F(RoundTrips, SinkTextEvent) {
    const krutil::io::SinkTextEvent sent(IDType{2}, krutil::io::other, u"elf");
    const auto event = travelAsEvent(sent, "krutil:SinkTextEvent");
    EXPECT_EQ(event->getRequestId(), IDType{2});
    EXPECT_EQ(event->getStreamType(), krutil::io::other);
    EXPECT_EQ(event->getText(), u"elf");
}

TEST_F(RoundTrips, IIPCancelMessage) {
    const Message sent = boost::make_shared<const cmddistributor::IIPCancelMessage>(IDType{3}, true);
    const auto message = travel<cmddistributor::IIPCancelMessage>(sent, "krutil:IIPCancelMessage", 27);
    EXPECT_EQ(message->getID(), IDType{3});
    EXPECT_TRUE(message->getEvenIfRunning());
}

TEST_F(RoundTrips, IIPCancelReply) {
    using cmddistributor::IIPCancelReply;
    const Reply sent = boost::make_shared<const IIPCancelReply>(IIPCancelReply::CancelStatus::soon);
    const auto reply = travel<IIPCancelReply>(sent, "krutil:IIPCancelReply", 29);
    EXPECT_EQ(reply->getStatus(), IIPCancelReply::CancelStatus::soon);
}

TEST_F(RoundTrips, IIPEnqueueMessage) {
    using cmddistributor::IIPEnqueueMessage;
    const CapabilityList needs = listOf({Capability::line, Capability::questions, Capability::steps});
    const Message sent = boost::make_shared<const IIPEnqueueMessage>(
        evaluation(), IDType{4}, -3, krutil::contextmgr::QvmID(8), nullptr, krutil::cmddistributor::WhenToDequeue::idle,
        u"näme", needs, nullptr, true);
    const auto message = travel<IIPEnqueueMessage>(sent, "krutil:IIPEnqueueMessage", 27);
    EXPECT_EQ(session.seen(), (std::vector<Seen>{{"krutil:EvalIIP", 29}, {"krutil:IIPEnqueueMessage", 27}}));
    expectEvaluation(dynamic_cast<const cmddistributor::EvalIIP&>(*message->getIIP()));
    EXPECT_EQ(message->getID(), IDType{4});
    EXPECT_EQ(message->getQcrID(), -3);
    EXPECT_EQ(*message->getQvmID(), 8U);
    EXPECT_EQ(message->getDequeueMode(), krutil::cmddistributor::WhenToDequeue::idle);
    EXPECT_EQ(message->getDynamicName(), u"näme");
    EXPECT_EQ(message->getCapabilities(), needs);
    EXPECT_TRUE(message->getOkToFlushSparingly());
    EXPECT_FALSE(message->bound());
}

TEST_F(RoundTrips, EvalIIP) {
    expectEvaluation(*travel<cmddistributor::EvalIIP>(evaluation(), "krutil:EvalIIP", 29));
}

TEST_F(RoundTrips, IIPResult) {
    const auto failed = travelAsResult<cmddistributor::IIPResult>(
        std::make_unique<cmddistributor::IIPResult>(IDType{5}, error()), "krutil:IIPResult");
    EXPECT_EQ(failed->id, IDType{5});
    EXPECT_TRUE(failed->getException() == error());

    const auto succeeded = travelAsResult<cmddistributor::IIPResult>(
        std::make_unique<cmddistributor::IIPResult>(IDType{5}, boost::none), "krutil:IIPResult");
    EXPECT_FALSE(succeeded->getException().has_value());
}

TEST_F(RoundTrips, IIPReply) {
    using krutil::cmddistributor::IIPReply;
    Result result = std::make_unique<cmddistributor::IIPResult>(IDType{7}, error());
    const Reply sent = boost::make_shared<const IIPReply>(IDType{8}, std::move(result));
    const auto reply = travel<IIPReply>(sent, "krutil:IIPReply", 29);
    EXPECT_EQ(session.seen(), (std::vector<Seen>{{"krutil:IIPResult", 29}, {"krutil:IIPReply", 29}}));
    EXPECT_EQ(reply->getID(), IDType{8});
    EXPECT_EQ(reply->getResult()->id, IDType{7});
    EXPECT_TRUE(reply->getResult()->getException() == error());
}

TEST_F(RoundTrips, FEvalIIP) {
    ArrayFactory factory;
    const std::vector<Array> arrays{twoPlanes(), Array(1, {0}, {factory.plane("")})};
    const auto request = travel<cmddistributor::FEvalIIP>(Request(call(arrays, 11, 12)), "krutil:FEvalIIP", 29);
    expectCore(*request, cmddistributor::nowhere);
    EXPECT_EQ(request->getFunctionName(), "numpy.dot");
    EXPECT_EQ(request->getNlhs(), 2U);
    EXPECT_EQ(request->getClientQvmID(), 11U);
    EXPECT_EQ(request->getQvmID(), 12U);
    EXPECT_TRUE(request->received());
    EXPECT_FALSE(request->urgent());
    const auto& arguments = boost::get<krutil::cmddistributor::EDIDataWrapper>(request->getInputArguments()).arrays();
    ASSERT_EQ(arguments.size(), 2U);
    expectSame(arguments[0], arrays[0]);
    expectSame(arguments[1], arrays[1]);
}

TEST_F(RoundTrips, FEvalResult) {
    const auto result = travelAsResult<cmddistributor::FEvalResult>(
        std::make_unique<cmddistributor::FEvalResult>(IDType{10}, std::vector<Array>{twoPlanes()}),
        "krutil:FEvalResult");
    EXPECT_EQ(result->id, IDType{10});
    EXPECT_FALSE(result->getException().has_value());
    const auto results = result->getResults();
    ASSERT_EQ(boost::get<std::vector<Array>>(results).size(), 1U);
    expectSame(boost::get<std::vector<Array>>(results)[0], twoPlanes());
}

TEST_F(RoundTrips, Array) {
    expectSame(session.travel<Array, Array>(twoPlanes(), typeid(Array)), twoPlanes());
    const char* off = std::getenv("QX_DISABLE_ZEROCOPY");
    if (off != nullptr && *off != '\0') {
        EXPECT_EQ(session.seen(), (std::vector<Seen>{{"krutil:QDA", 29}}));
    } else {
        EXPECT_EQ(session.seen(), (std::vector<Seen>{{"", 4}, {"", 4}, {"krutil:QDA", 29}}));
    }
}

TEST_F(RoundTrips, IssuedWarningEvent) {
    warningEvent<korvel::lang::diagnostic::IssuedWarningEvent>("korvel:lang:diagnostic:IssuedWarningEvent", 29);
}

TEST_F(RoundTrips, IssuedEnabledWarningEvent) {
    warningEvent<korvel::lang::diagnostic::IssuedEnabledWarningEvent>(
        "korvel:lang:diagnostic:IssuedEnabledWarningEvent", 27);
}

TEST_F(RoundTrips, PrintableErrorEvent) {
    const auto event =
        travelAsEvent(krutil::io::PrintableErrorEvent(IDType{13}, error(), u"Fehler"), "krutil:PrintableErrorEvent");
    EXPECT_EQ(event->getRequestId(), IDType{13});
    EXPECT_TRUE(event->getException() == error());
    EXPECT_EQ(event->getText(), u"Fehler");
}

TEST_F(RoundTrips, CapabilitiesChanged) {
    const CapabilityList previous = listOf({Capability::panes});
    const CapabilityList qvm = listOf({Capability::richPanes, Capability::neighbour});
    const CapabilityList client = listOf({Capability::pages, Capability::steps});
    const CapabilityList request = listOf({Capability::line, Capability::questions});
    const auto event = travelAsEvent(krutil::capabilities_api::CapabilitiesChanged(previous, qvm, client, request),
                                     "krutil:capabilities_api:CapabilitiesChanged");
    EXPECT_EQ(event->getPreviousCapabilities(), previous);
    EXPECT_EQ(event->getQvmCapabilities(), qvm);
    EXPECT_EQ(event->getClientCapabilities(), client);
    EXPECT_EQ(event->getRequestCapabilities(), request);
}

// A test above is named after the last part of each registered name, but for the array's.
TEST_F(RoundTrips, NoTypeIsLeftOut) {
    std::set<std::string> types;
    for (const auto& serializer : session.registry().entries()) {
        const std::string name = serializer->name().substr(serializer->name().rfind(':') + 1);
        types.insert(name == "QDA" ? "Array" : name);
    }
    std::set<std::string> tests;
    const auto* suite = testing::UnitTest::GetInstance()->current_test_suite();
    for (int i = 0; i < suite->total_test_count(); ++i) {
        tests.insert(suite->GetTestInfo(i)->name());
    }
    EXPECT_EQ(session.registry().entries().size(), 25U);
    EXPECT_EQ(types.size(), 25U);
    EXPECT_TRUE(std::includes(tests.begin(), tests.end(), types.begin(), types.end())) << testing::PrintToString(types);
}

TEST_F(RoundTrips, FatalReportsAreThePlatforms) {
    const Request request = call({}, 0, 12);
    EXPECT_DEATH(session.travel<cmddistributor::IIP>(request, typeid(cmddistributor::FEvalIIP)),
                 "FEvalIIPSerializer, line 80: fevaliip->getClientQvmID\\(\\)");
}

}  // namespace
