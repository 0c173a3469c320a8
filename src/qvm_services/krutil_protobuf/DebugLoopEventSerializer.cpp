#include "DebugLoopEventSerializer.hpp"

#include <boost/make_shared.hpp>

#include "FieldConversions.hpp"

namespace krutil::protobuf_serializer {
namespace {

const std::string debugLoopEventName = "krutil:DebugLoopEvent";

// The placeholder is a value of the wire's enumeration, but no state.
bool isState(int number) {
    return number == protobuf::DebugLoopEvent::EXIT || number == protobuf::DebugLoopEvent::ENTER;
}

}  // namespace

DebugLoopEventSerializer::DebugLoopEventSerializer() : TaggedSerializer(debugLoopEventName) {}

protobuf::DebugLoopEvent_State DebugLoopEventSerializer::toProtobuf(::cmddistributor::DebugLoopEvent::State state) {
    return sameNumberOrTerminate<protobuf::DebugLoopEvent_State>(
        state, isState,
        {"Unsupported cmddistributor::DebugLoopEvent::State value", "DebugLoopEventSerializer", 73,
         "static krutil::protobuf::DebugLoopEvent_State "
         "krutil::protobuf_serializer::DebugLoopEventSerializer::toProtobuf(cmddistributor::DebugLoopEvent::State)"});
}

protobuf::InputRequester DebugLoopEventSerializer::toProtobuf(prompt::InputRequester prompt) {
    return sameNumberOrTerminate<protobuf::InputRequester>(
        prompt, protobuf::InputRequester_IsValid,
        {"Unsupported krutil::prompt::InputRequester value", "DebugLoopEventSerializer", 101,
         "static krutil::protobuf::InputRequester "
         "krutil::protobuf_serializer::DebugLoopEventSerializer::toProtobuf(krutil::prompt::InputRequester)"});
}

::cmddistributor::DebugLoopEvent::State DebugLoopEventSerializer::fromProtobuf(protobuf::DebugLoopEvent_State state) {
    return sameNumberOrThrow<::cmddistributor::DebugLoopEvent::State>(
        state, isState, "Invalid enum krutil::protobuf::DebugLoopEvent_State field value = ");
}

prompt::InputRequester DebugLoopEventSerializer::fromProtobuf(protobuf::InputRequester prompt) {
    return sameNumberOrThrow<prompt::InputRequester>(prompt, protobuf::InputRequester_IsValid,
                                                     "Invalid enum krutil::protobuf::InputRequester field value = ");
}

void DebugLoopEventSerializer::fill(const ::cmddistributor::DebugLoopEvent& event, protobuf::DebugLoopEvent& proto) {
    *proto.mutable_requestid() = IDTypeSerializer::toProtobuf(event.getRequestId());
    proto.set_state(toProtobuf(event.getLoopState()));
    proto.set_whichloop(toProtobuf(event.getWhichDebugLoop()));
}

boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent> DebugLoopEventSerializer::fromProtobuf(
    const protobuf::DebugLoopEvent& proto) {
    const auto id = IDTypeSerializer::fromProtobuf(proto.requestid());
    const auto state = fromProtobuf(proto.state());
    const auto whichLoop = fromProtobuf(proto.whichloop());
    return boost::make_shared<const ::cmddistributor::DebugLoopEvent>(id, state, whichLoop);
}

}  // namespace krutil::protobuf_serializer
