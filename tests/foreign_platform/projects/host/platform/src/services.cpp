#include <boost/locale/encoding_utf.hpp>

#include "foundation/msg_svc/transport/layers/session/ProtocolRegistry.hpp"
#include "msg_svc.protobuf.IDType.pb.h"
#include "msg_svc/protobuf/ustring.hpp"
#include "msg_svc/protobuf_serializer/IDTypeSerializer.hpp"

namespace foundation::msg_svc::transport::layers::session {

std::shared_ptr<ProtocolRegistry> ProtocolRegistry::getRegistry() {
    static const auto registry = std::make_shared<ProtocolRegistry>();
    return registry;
}

}  // namespace foundation::msg_svc::transport::layers::session

namespace msg_svc::protobuf {

std::string ustring_to_utf8(const std::u16string& text) {
    return boost::locale::conv::utf_to_utf<char>(text);
}

std::u16string utf8_to_ustring(const std::string& text) {
    return boost::locale::conv::utf_to_utf<char16_t>(text);
}

}  // namespace msg_svc::protobuf

namespace msg_svc::protobuf_serializer {

protobuf::IDType IDTypeSerializer::toProtobuf(foundation::msg_svc::exchange::IDType id) {
    protobuf::IDType message;
    message.set_number(id.number);
    return message;
}

foundation::msg_svc::exchange::IDType IDTypeSerializer::fromProtobuf(const protobuf::IDType& message) {
    return {message.number()};
}

}  // namespace msg_svc::protobuf_serializer
