#include "QVMShutdownEventSerializer.hpp"

#include <boost/make_shared.hpp>

namespace krutil::protobuf_serializer {
namespace {

const std::string qvmShutdownEventName = "krutil:QVMShutdownEvent";

}  // namespace

QVMShutdownEventSerializer::QVMShutdownEventSerializer() : TaggedSerializer(qvmShutdownEventName) {}

boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent> QVMShutdownEventSerializer::fromProtobuf(
    const protobuf::QVMShutdownEvent& /*proto*/) {
    return boost::make_shared<const eventmgr::QVMShutdownEvent>();
}

}  // namespace krutil::protobuf_serializer
