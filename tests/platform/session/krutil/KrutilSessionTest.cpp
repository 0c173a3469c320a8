// Sessions of the real protocol, both ends in one process.

#include <boost/make_shared.hpp>
#include <thread>

#include "KrutilProtocol.hpp"
#include "cmddistributor/EvalIIP.hpp"
#include "cmddistributor/IIPEnqueueMessage.hpp"
#include "cmddistributor/IIPStateEvent.hpp"
#include "foundation.korveldata.protobuf.KORVEL_Array.pb.h"
#include "foundation/korveldata/ElementType.hpp"
#include "krutil/capabilities_api/CapabilitiesChanged.hpp"
#include "krutil/cmddistributor/IIPReply.hpp"
#include "krutil/eventmgr/QVMShutdownEvent.hpp"
#include "krutil/io/TextBaseEvent.hpp"
#include "platform/session/support/TestSessions.hpp"
#include "platform/session/support/WireBytes.hpp"

namespace testing_sessions {
namespace {

using cmddistributor::EvalIIP;
using cmddistributor::IIPEnqueueMessage;
using exchange::IDType;
using krutil::io::SinkTraits;
using testing::ElementsAre;

// Keeps a line for each object, told apart by its dynamic type.
class KrutilRecorder : public Recorder {
  public:
    void onMessage(framing::StreamID stream, const boost::shared_ptr<const exchange::Message>& message) override {
        const auto& enqueued = dynamic_cast<const IIPEnqueueMessage&>(*message);
        const auto& eval = dynamic_cast<const EvalIIP&>(*enqueued.getIIP());
        const std::u16string& command = eval.getCommand();
        keep("enqueue " + std::to_string(stream) + " " + std::string(command.begin(), command.end()));
        if (serve) {
            serve(stream, enqueued);
        }
    }
    void onReply(framing::StreamID stream, const boost::shared_ptr<const exchange::Reply>& reply) override {
        const auto& typed = dynamic_cast<const krutil::cmddistributor::IIPReply&>(*reply);
        keep("reply " + std::to_string(stream) + " " + toString(typed.getResult()->id));
    }
    void onEvent(framing::StreamID stream, const boost::shared_ptr<const eventmgr::BaseEvent>& event) override {
        std::string text = "?";
        if (const auto* const state = dynamic_cast<const cmddistributor::IIPStateEvent*>(event.get())) {
            text = state->getType();
        } else if (const auto* const output = dynamic_cast<const krutil::io::TextBaseEvent*>(event.get())) {
            text.assign(output->getText().begin(), output->getText().end());
        } else if (dynamic_cast<const krutil::eventmgr::QVMShutdownEvent*>(event.get()) != nullptr) {
            text = "shutdown";
        } else if (dynamic_cast<const krutil::capabilities_api::CapabilitiesChanged*>(event.get()) != nullptr) {
            text = "capabilities";
        }
        keep("event " + std::to_string(stream) + " " + text);
    }

    std::function<void(framing::StreamID, const IIPEnqueueMessage&)> serve;
};

SessionConfig krutilConfig(Role role) {
    SessionConfig config = configOf(role);
    config.protocol = krutil::protobuf::KrutilProtocol::protocolName;
    config.version = krutil::protobuf::KrutilProtocol::protocolVersion;
    config.shutdownEvent = typeid(krutil::eventmgr::QVMShutdownEvent);
    config.clientEvents = {typeid(krutil::capabilities_api::CapabilitiesChanged)};
    return config;
}

boost::shared_ptr<const exchange::Message> enqueue(const std::u16string& command) {
    const auto eval = boost::make_shared<const EvalIIP>("eval", cmddistributor::IqmStreamID::ekIqmCmdWinStream, nullptr,
                                                        SinkTraits(false, true, false, true, false, true),
                                                        SinkTraits(true, false, true, false, true, false), command,
                                                        cmddistributor::CodeType::CodeBlockType);
    return boost::make_shared<const IIPEnqueueMessage>(eval, IDType(1, 2), 3, boost::none, nullptr,
                                                       krutil::cmddistributor::WhenToDequeue::DEQUEUE_AT_IDLE, u"name",
                                                       capabilities::CapabilityList(), nullptr, false);
}

class KrutilSessionTest : public testing::Test {
  protected:
    KrutilSessionTest() { krutil::protobuf::KrutilProtocol::init(); }

    // What an engine says to these bytes of a client.
    static SessionEnd refusalOf(Role role, const std::string& bytes) {
        SessionWithBytes end(krutilConfig(role));
        end.peer->write(bytes);
        const SessionEnd ended = end.saw.waitForEnd();
        EXPECT_EQ(end.peer->readAll(), wire::abort(ended.text));
        return ended;
    }
};

TEST_F(KrutilSessionTest, RequestRunsFromItsQueueToItsReply) {
    KrutilRecorder clientSaw;
    KrutilRecorder engineSaw;
    const OpenedPair opened = openPair(krutilConfig(Role::Client), krutilConfig(Role::Engine));
    EXPECT_EQ(opened.client->features().size(), 1U);
    EXPECT_EQ(opened.client->features(), opened.engine->features());
    engineSaw.serve = [&](framing::StreamID stream, const IIPEnqueueMessage& message) {
        const IDType id = message.getID();
        opened.engine->send(stream, boost::make_shared<const cmddistributor::IIPStartedEvent>(id));
        opened.engine->send(
            stream, boost::make_shared<const krutil::io::TextBaseEvent>(id, krutil::io::StreamTypeEnum{}, u"2\n"));
        opened.engine->send(stream, boost::make_shared<const cmddistributor::IIPCompletedEvent>(id));
        opened.engine->send(stream, boost::make_shared<const cmddistributor::LastIIPEvent>(id));
        opened.engine->send(stream, boost::make_shared<const krutil::cmddistributor::IIPReply>(
                                        id, std::make_unique<cmddistributor::IIPResult>(id, boost::none)));
    };
    opened.engine->start(engineSaw);
    opened.client->start(clientSaw);
    opened.client->send(opened.client->newStreamID(), enqueue(u"print(1+1)"));
    EXPECT_THAT(clientSaw.waitForLines(5), ElementsAre("event 1 started", "event 1 2\n", "event 1 completed",
                                                       "event 1 last", "reply 1 " + toString(IDType(1, 2))));
    opened.client->send(0, boost::make_shared<const krutil::capabilities_api::CapabilitiesChanged>(
                               capabilities::CapabilityList(), capabilities::CapabilityList(),
                               capabilities::CapabilityList(), capabilities::CapabilityList()));
    opened.client->sayGoodbye();
    EXPECT_THAT(engineSaw.waitForLines(3), ElementsAre("enqueue 1 print(1+1)", "event 0 capabilities", "goodbye"));
    opened.engine->send(0, boost::make_shared<const krutil::eventmgr::QVMShutdownEvent>());
    opened.engine->close();
    EXPECT_EQ(clientSaw.waitForEnd().reason, Reason::Finished);
    EXPECT_EQ(engineSaw.waitForEnd().reason, Reason::Finished);
}

TEST_F(KrutilSessionTest, RequestIsAFrameOfItsOwnBeforeTheMessageThatEnqueuesIt) {
    SessionConfig config = krutilConfig(Role::Client);
    std::vector<std::string> traced;
    config.trace = [&](const session::FrameTrace& trace) {
        traced.push_back(std::to_string(trace.frame.index()) + " " +
                         std::string(dynamic_cast<const framing::TaggedFrame&>(trace.frame).tag()) +
                         (trace.last ? " last" : ""));
    };
    SessionWithBytes end(config);
    end.session->send(1, enqueue(u"1"));
    EXPECT_THAT(traced, ElementsAre("1 krutil:EvalIIP", "2 krutil:IIPEnqueueMessage last"));
}

TEST_F(KrutilSessionTest, OtherVersionsAreRefused) {
    const Ends ends = socketPair();
    SessionConfig config = krutilConfig(Role::Client);
    config.version = {2, 0};
    wire::ByteEnd peer(ends.otherIn, ends.otherOut);
    std::thread playing([&] {
        auto hello = peer.readHello();
        hello.set_role(msg_svc::protobuf::SessionHello::ENGINE);
        peer.write(wire::helloBytes(hello));
        const auto verdict = peer.readVerdict();
        EXPECT_FALSE(verdict.accepted());
        peer.write(wire::verdictBytes(verdict));
    });
    EXPECT_EQ(textOf<session::HandshakeRefused>([&] { Session::open(ends.in, ends.out, config); }),
              "the session is refused: protocol version: the client cannot set up version (2, 0) of \"krutil\"");
    playing.join();
}

TEST_F(KrutilSessionTest, TypesThatAreOnlyReferredToAreNoRoots) {
    for (const std::string tag :
         {"krutil:EvalIIP", "krutil:FEvalIIP", "krutil:IIPResult", "krutil:FEvalResult", "krutil:QDA"}) {
        const SessionEnd ended = refusalOf(Role::Engine, wire::tagged(1, 1, true, tag, ""));
        EXPECT_EQ(ended.reason, Reason::Violation);
        EXPECT_EQ(ended.text,
                  "message on stream 1: \"" + tag + "\" is only ever referred to and cannot be the last frame");
    }
}

TEST_F(KrutilSessionTest, RootsOfTheWrongDirectionAreRefused) {
    for (const std::string tag : {"krutil:IIPReply", "krutil:IIPCancelReply", "krutil:TextBaseEvent",
                                  "krutil:IIPStartedEvent", "krutil:QVMShutdownEvent"}) {
        EXPECT_EQ(refusalOf(Role::Engine, wire::tagged(1, 1, true, tag, "")).text,
                  "message on stream 1: \"" + tag + "\" goes to a client, not to an engine");
    }
    for (const std::string tag : {"krutil:IIPEnqueueMessage", "krutil:IIPCancelMessage"}) {
        EXPECT_EQ(refusalOf(Role::Client, wire::tagged(1, 1, true, tag, "", 27)).text,
                  "message on stream 1: \"" + tag + "\" goes to an engine, not to a client");
    }
}

TEST_F(KrutilSessionTest, MissingFieldsAndFramesCloseTheSessionWithTheSerializersReason) {
    EXPECT_TRUE(refusalOf(Role::Engine, wire::tagged(1, 1, true, "krutil:IIPCancelMessage", "", 27))
                    .text.starts_with("cannot read \"krutil:IIPCancelMessage\": Requied field is missing: "));
}

// Requests whose frames are not what they refer to. Field 1 of an enqueue message is the index of its request, field 2
// of a call the indexes of its arrays; an array names its data frame.
TEST_F(KrutilSessionTest, UnreadableMessagesAreExplainedByTheirFrames) {
    const std::string enqueueTag = "krutil:IIPEnqueueMessage";
    const auto refusal = [&](const std::string& before, std::uint64_t root, std::uint64_t handle, unsigned type = 27) {
        const std::string content = "\x08" + std::string(1, static_cast<char>(handle));
        const std::string text =
            refusalOf(Role::Engine, before + wire::tagged(1, root, true, enqueueTag, content, type)).text;
        const std::string start = "cannot read \"krutil:IIPEnqueueMessage\": ";
        EXPECT_TRUE(text.starts_with(start)) << text;
        return text.substr(start.size());
    };
    const auto tagged = [](std::uint64_t index, const std::string& tag, const std::string& content = "",
                           unsigned type = 29) { return wire::tagged(1, index, false, tag, content, type); };

    EXPECT_EQ(refusal("", 1, 0, 29), "frame 1: expected the frame type of \"krutil:IIPEnqueueMessage\", got 29");
    EXPECT_EQ(refusal("", 1, 0), "frame 0: expected a frame, got none: the message has 1");
    EXPECT_EQ(refusal("", 1, 9), "frame 9: expected a frame, got none: the message has 1");
    EXPECT_EQ(refusal("", 1, 1), "frame 1: expected a frame, got none: it was read already");
    EXPECT_EQ(refusal(wire::data(1, 1, false, "12345678"), 2, 1),
              "frame 1: expected a tagged frame, got a data frame of type 4");
    EXPECT_EQ(refusal(tagged(1, "krutil:IIPReply"), 2, 1),
              "frame 1: expected an object that \"krutil:IIPEnqueueMessage\" can refer to, got one with tag "
              "\"krutil:IIPReply\"");
    EXPECT_EQ(refusal(tagged(1, "krutil:Nonsense\x1B"), 2, 1),
              "frame 1: no serializer is registered for its tag \"krutil:Nonsense\\x1b\"");
    EXPECT_EQ(refusal(tagged(1, "krutil:EvalIIP", "", 27), 2, 1),
              "frame 1: expected the frame type of \"krutil:EvalIIP\", got 27");
    const auto callOf = [](char array) { return std::string("\x22\x01") + array; };
    EXPECT_EQ(refusal(tagged(1, "krutil:TextBaseEvent") + tagged(2, "krutil:FEvalIIP", callOf(1)), 3, 2),
              "frame 1: expected an object that \"krutil:FEvalIIP\" can refer to, got one with tag "
              "\"krutil:TextBaseEvent\"");
    foundation::korveldata::protobuf::KORVEL_Array array;
    array.set_elementtype(static_cast<int>(foundation::korveldata::ElementType::Double));
    array.add_dimensions(1);
    array.set_order(foundation::korveldata::protobuf::KORVEL_Array::ROW_MAJOR);
    array.set_dataid(1);
    EXPECT_EQ(refusal(tagged(1, "krutil:EvalIIP") + tagged(2, "krutil:QDA", array.SerializeAsString()) +
                          tagged(3, "krutil:FEvalIIP", callOf(2)),
                      4, 3),
              "frame 1: expected a data frame, got a tagged frame with tag \"krutil:EvalIIP\"");
    // What says in words what is wrong says it itself.
    EXPECT_EQ(refusal(tagged(1, "krutil:FEvalIIP"), 2, 1), "Required field missing: protobuf::FEvalIIP.iip");
}

TEST_F(KrutilSessionTest, ArraysHaveALimitOfTheirOwn) {
    SessionConfig config = krutilConfig(Role::Engine);
    config.limits.taggedFrame = 10;
    config.limits.arrayMessage = 50;
    const auto refusal = [&](const std::string& bytes) {
        SessionWithBytes end(config);
        end.peer->write(bytes);
        return end.saw.waitForEnd().text;
    };
    EXPECT_EQ(refusal(wire::tagged(1, 1, true, "krutil:QDA", std::string(50, 'x'))),
              "message on stream 1: \"krutil:QDA\" is only ever referred to and cannot be the last frame");
    EXPECT_EQ(refusal(wire::header({1, true, 29, 10, 1, 1, 51}) + "krutil:QDA"),
              "content of frame 1 on stream 1 exceeds the limit \"arrayMessage\": expected at most 50 bytes, got 51");
    EXPECT_EQ(refusal(wire::tagged(1, 1, true, "krutil:EvalIIP", std::string(11, 'x'))),
              "content of frame 1 with tag \"krutil:EvalIIP\" exceeds the limit \"taggedFrame\": expected at most 10 "
              "bytes, got 11");
}

}  // namespace
}  // namespace testing_sessions
