#include "common/MessageNames.hpp"

#include <algorithm>
#include <array>

namespace apps {
namespace {

struct Row {
    std::string_view tag;
    std::string_view message;
};

constexpr std::string_view protocolPrefix = "krutil:";
constexpr std::string_view messagePrefix = "krutil.protobuf.";

// Where the message is not simply what follows the protocol's prefix.
constexpr std::array exceptions{
    Row{"krutil:IIPStartedEvent", "krutil.protobuf.IIPStateEvent"},
    Row{"krutil:IIPSuspendedEvent", "krutil.protobuf.IIPStateEvent"},
    Row{"krutil:IIPResumedEvent", "krutil.protobuf.IIPStateEvent"},
    Row{"krutil:IIPDiscardedEvent", "krutil.protobuf.IIPStateEvent"},
    Row{"krutil:IIPRequeuedEvent", "krutil.protobuf.IIPStateEvent"},
    Row{"krutil:IIPReactivatedEvent", "krutil.protobuf.IIPStateEvent"},
    Row{"krutil:IIPCompletedEvent", "krutil.protobuf.IIPStateEvent"},
    Row{"krutil:detail::LastIIPEvent", "krutil.protobuf.IIPStateEvent"},
    Row{"krutil:QDA", "foundation.korveldata.protobuf.KORVEL_Array"},
    Row{"krutil:capabilities_api:CapabilitiesChanged", "krutil.protobuf.CapabilitiesChanged"},
    Row{"korvel:lang:diagnostic:IssuedWarningEvent", "krutil.protobuf.IssuedWarningEvent"},
    Row{"korvel:lang:diagnostic:IssuedEnabledWarningEvent", "krutil.protobuf.IssuedEnabledWarningEvent"},
};

}  // namespace

std::string messageNameOfTag(std::string_view tag) {
    const auto row = std::find_if(exceptions.begin(), exceptions.end(),
                                  [tag](const Row& candidate) { return candidate.tag == tag; });
    if (row != exceptions.end()) {
        return std::string(row->message);
    }
    if (tag.substr(0, protocolPrefix.size()) != protocolPrefix || tag.size() == protocolPrefix.size() ||
        tag.find(':', protocolPrefix.size()) != std::string_view::npos) {
        return {};
    }
    return std::string(messagePrefix) + std::string(tag.substr(protocolPrefix.size()));
}

}  // namespace apps
