#include "FEvalIIPSerializer.hpp"

#include <boost/make_shared.hpp>
#include <boost/variant/get.hpp>
#include <cstdint>

#include "FieldConversions.hpp"
#include "IIPSerializer.hpp"
#include "NestedArrays.hpp"
#include "foundation/core/diag/assertions.hpp"

namespace krutil::protobuf_serializer {

using cmddistributor::EDIDataWrapper;

namespace {

const std::string fEvalIIPName = "krutil:FEvalIIP";

[[noreturn]] void fail(const char* message, int line) {
    foundation::core::diag::terminate(
        message, "FEvalIIPSerializer", line,
        "virtual foundation::vantor::carrier::framing::FrameIndex "
        "krutil::protobuf_serializer::FEvalIIPSerializer::serialize("
        "const boost::shared_ptr<const cmddistributor::IIP>&, foundation::vantor::carrier::framing::StreamID, "
        "foundation::vantor::carrier::framing::FrameIndex, "
        "const std::shared_ptr<foundation::msg_svc::transport::layers::message::MessageStream>&, "
        "const std::shared_ptr<const foundation::msg_svc::transport::layers::serialization::Registry>&, "
        "const foundation::msg_svc::transport::layers::serialization::SerializationContext&) const");
}

const std::vector<foundation::korveldata::Array>& argumentsOf(const ::cmddistributor::FEvalIIP& request) {
    try {
        return boost::get<EDIDataWrapper>(request.getInputArguments()).arrays();
    } catch (const boost::bad_get&) {
        fail("FEvalIIPSerializer only supports KORVEL Data Arrays", 63);
    } catch (...) {
        fail("FEvalIIPSerializer: Unexpected exception", 66);
    }
}

void assertSet(std::uint64_t id, const char* expression, int line) {
    if (id == 0 && foundation::core::diag::assertionsEnabled()) {
        fail(expression, line);
    }
}

}  // namespace

FEvalIIPSerializer::FEvalIIPSerializer() : TaggedSerializer(fEvalIIPName) {}

void FEvalIIPSerializer::fill(const ::cmddistributor::FEvalIIP& request, protobuf::FEvalIIP& proto,
                              NestedWriter& nested) {
    proto.clear_dataids();
    for (const DataID dataID : writeArrays(argumentsOf(request), nested)) {
        proto.add_dataids(dataID);
    }
    IIPSerializer::fill(request, *proto.mutable_iip());
    proto.set_functionname(request.getFunctionName());
    proto.set_nlhs(request.getNlhs());
    assertSet(request.getClientQvmID(), "fevaliip->getClientQvmID()", 80);
    proto.set_clientqvmid(request.getClientQvmID());
    assertSet(request.getQvmID(), "fevaliip->getQvmID()", 82);
    proto.set_serverqvmid(request.getQvmID());
}

boost::shared_ptr<const ::cmddistributor::IIP> FEvalIIPSerializer::fromProtobuf(const protobuf::FEvalIIP& proto,
                                                                                const NestedReader& nested) {
    EDIDataWrapper arguments(readArrays(proto.dataids(), nested));
    require(proto.has_iip(), "Required field missing: protobuf::FEvalIIP.iip");
    const auto core = IIPSerializer::fromProtobuf(proto.iip());
    require(proto.clientqvmid() != 0, "Invalid krutil::protobuf::FEvalIIP.clientQvmID field value of 0");
    require(proto.serverqvmid() != 0, "Invalid krutil::protobuf::FEvalIIP.serverQvmID field value of 0");
    auto data = ::cmddistributor::FEvalIIP::Data::makeServerSideData(std::move(arguments), proto.clientqvmid(),
                                                                     proto.serverqvmid(), true);
    return boost::make_shared<const ::cmddistributor::FEvalIIP>(
        core->getPluginType(), proto.functionname(), proto.nlhs(), std::move(data), core->getStreamID(),
        core->getOutTraits(), core->getErrTraits(), proto.clientqvmid(), proto.serverqvmid(), false);
}

}  // namespace krutil::protobuf_serializer
