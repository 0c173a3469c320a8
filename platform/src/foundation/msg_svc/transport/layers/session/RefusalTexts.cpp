#include "foundation/msg_svc/transport/layers/session/RefusalTexts.hpp"

#include <boost/core/demangle.hpp>
#include <system_error>

#include "foundation/msg_svc/transport/layers/session/PrintableText.hpp"

namespace foundation::msg_svc::transport::layers::session {

std::string refusalToSend(Refusal refusal, Saying saying, Role own, framing::StreamID stream,
                          const std::type_info& type) {
    const std::string got = ", got " + std::to_string(stream);
    switch (saying) {
        case Saying::Message:
            return refusal == Refusal::WrongSpeaker ? "only a client begins exchanges"
                   : refusal == Refusal::AfterGoodbye
                       ? "no exchange can begin after the goodbye"
                       : "a new exchange needs a stream ID that is not 0 and not in use" + got;
        case Saying::Reply:
            return "a reply needs the stream ID of an exchange that the peer began and that is still open" + got;
        case Saying::Goodbye:
            return "only a client says goodbye";
        case Saying::Event:
        case Saying::SharedEvent:
        case Saying::Shutdown:
            break;
    }
    switch (refusal) {
        case Refusal::WrongSpeaker:
            return "a client does not send events of the type " + boost::core::demangle(type.name());
        case Refusal::AfterGoodbye:
            return "nothing can follow the goodbye";
        case Refusal::AfterShutdown:
            return "nothing can follow the shutdown event";
        default:
            return std::string("an event needs the stream ID 0") +
                   (own == Role::Client ? "" : " or that of an open exchange") + got;
    }
}

std::string refusalToReceive(Refusal refusal, Saying saying, Role own, framing::StreamID stream, std::string_view tag) {
    const std::string message = "message on stream " + std::to_string(stream) + ": " + quoted(tag);
    switch (refusal) {
        case Refusal::WrongSpeaker:
            return saying == Saying::Goodbye ? "goodbye frame: expected one from clients only, got one from the engine"
                   : own == Role::Client     ? message + " goes to an engine, not to a client"
                                             : message + " goes to a client, not to an engine";
        case Refusal::AfterGoodbye:
            return "expected nothing after the client's goodbye, got another frame";
        case Refusal::AfterShutdown:
            return "expected nothing after the engine's shutdown event, got another frame";
        case Refusal::StreamNotNew:
            return message + " begins an exchange: expected a stream ID that is not 0 and not in use";
        case Refusal::StreamNotOpen:
            return message + " is a reply: expected the stream ID of an open exchange";
        case Refusal::StreamNotZero:
        case Refusal::StreamNotZeroOrOpen:
            break;
    }
    return message + " is an event: expected the stream ID 0 or that of an open exchange";
}

std::string cannotWrite(int error) {
    return "cannot write to the stream: " + std::generic_category().message(error);
}

}  // namespace foundation::msg_svc::transport::layers::session
