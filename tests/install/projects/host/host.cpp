// A small host of the installed library: sets up the protocol, writes an event as a frame and reads the frame's bytes.
#include <krutil.protobuf.TextBaseEvent.pb.h>
#include <KrutilProtocol.hpp>
#include <boost/make_shared.hpp>
#include <cstdlib>
#include <foundation/msg_svc/transport/layers/serialization/SerializerAPI.hpp>
#include <foundation/msg_svc/transport/layers/session/ProtocolRegistry.hpp>
#include <foundation/vantor/carrier/framing/TaggedFrame.hpp>
#include <iostream>
#include <krutil/io/TextBaseEvent.hpp>
#include <typeinfo>

namespace layers = foundation::msg_svc::transport::layers;
namespace framing = foundation::vantor::carrier::framing;
using foundation::msg_svc::eventmgr::BaseEvent;
using Event = boost::shared_ptr<const BaseEvent>;

// Where the library puts the frames that it writes; a real host hands them to its transport.
struct LastFrame : layers::message::MessageStream {
    void append(std::unique_ptr<framing::Frame>& frame) override { taken = std::move(frame); }
    std::unique_ptr<framing::Frame> taken;
};

int main() {
    using krutil::protobuf::KrutilProtocol;
    KrutilProtocol::init();
    const auto protocol = layers::session::ProtocolRegistry::getRegistry()->find("krutil");
    const auto registry = std::make_shared<layers::serialization::Registry>();
    const auto version = protocol.initialize(registry, KrutilProtocol::protocolVersion, {{"ZEROCOPY", "enable"}});

    const Event event = boost::make_shared<const krutil::io::TextBaseEvent>(
        foundation::msg_svc::exchange::IDType(1, 2), krutil::io::StreamTypeEnum::OUTPUT_STREAM, u"zwölf");
    const BaseEvent& raised = *event;
    const auto serializer =
        std::dynamic_pointer_cast<const layers::serialization::SerializerAPI<BaseEvent, Event, Event>>(
            registry->find(std::type_index(typeid(raised))));
    const auto stream = std::make_shared<LastFrame>();
    serializer->serialize(event, 7, 1, stream, registry, {});

    const auto& frame = dynamic_cast<const framing::TaggedFrame&>(*stream->taken);
    krutil::protobuf::TextBaseEvent message;
    message.ParseFromArray(frame.data(), static_cast<int>(frame.size()));
    std::cout << "version " << version.first << '.' << version.second << ", " << registry->serializers().size()
              << " serializers, " << frame.tag() << ": " << message.text() << '\n';
    return message.text() == "zwölf" ? EXIT_SUCCESS : EXIT_FAILURE;
}
