#include "CapabilityConversions.hpp"

#include <boost/bimap.hpp>
#include <stdexcept>

#include "krutil.protobuf.Capability.pb.h"

namespace krutil::protobuf_serializer {
namespace {

using CapabilityMap = boost::bimap<::capabilities::Capability, protobuf::Capability>;

// Left the host's value, right the wire's.
const CapabilityMap& capabilityMap() {
    static const CapabilityMap map = [] {
        using ::capabilities::Capability;
        CapabilityMap pairs;
        pairs.insert({Capability::InteractiveCommandLine, protobuf::InteractiveCommandLine});
        pairs.insert({Capability::Swing, protobuf::Swing});
        pairs.insert({Capability::ComplexSwing, protobuf::ComplexSwing});
        pairs.insert({Capability::LocalClient, protobuf::LocalClient});
        pairs.insert({Capability::WebWindow, protobuf::WebWindow});
        pairs.insert({Capability::ModalDialogs, protobuf::ModalDialogs});
        pairs.insert({Capability::Debugging, protobuf::Debugging});
        return pairs;
    }();
    return map;
}

}  // namespace

::capabilities::CapabilityList fromProtobuf(const google::protobuf::RepeatedField<int>& repeatedField) {
    ::capabilities::CapabilityList list;
    const auto& byWire = capabilityMap().right;
    for (const int value : repeatedField) {
        if (const auto found = byWire.find(static_cast<protobuf::Capability>(value)); found != byWire.end()) {
            list |= found->second;
        }
    }
    return list;
}

void toProtobuf(const ::capabilities::CapabilityList& list, google::protobuf::RepeatedField<int>* repeatedField) {
    if (repeatedField == nullptr) {
        // The misspelling is settled: peers and logs match the text.
        throw std::invalid_argument("repeatedField must not be nulptr");
    }
    const auto& byHost = capabilityMap().left;
    for (const ::capabilities::Capability capability : list.getEnabledCapabilitySequence()) {
        if (const auto found = byHost.find(capability); found != byHost.end()) {
            repeatedField->Add(found->second);
        }
    }
}

}  // namespace krutil::protobuf_serializer
