#include "CapabilityConversions.hpp"

#include <array>
#include <boost/bimap.hpp>
#include <cstddef>
#include <cstdint>
#include <stdexcept>

#include "krutil.protobuf.Capability.pb.h"

namespace krutil::protobuf_serializer {
namespace {

using CapabilityMap = boost::bimap<::capabilities::Capability, protobuf::Capability>;

// The host's values are wider than the wire's; only those of the map travel.
static_assert(sizeof(::capabilities::Capability) == sizeof(std::uint64_t));

// Indexed by the host's number: a platform calls its capabilities what it likes.
constexpr std::array wireValues{protobuf::InteractiveCommandLine,
                                protobuf::Swing,
                                protobuf::ComplexSwing,
                                protobuf::LocalClient,
                                protobuf::WebWindow,
                                protobuf::ModalDialogs,
                                protobuf::Debugging};

// Left the host's value, right the wire's.
const CapabilityMap& capabilityMap() {
    static const CapabilityMap map = [] {
        CapabilityMap pairs;
        for (std::size_t number = 0; number < wireValues.size(); ++number) {
            pairs.insert({static_cast<::capabilities::Capability>(number), wireValues[number]});
        }
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
