#include "common/MessageNames.hpp"

#include <algorithm>
#include <array>

namespace apps {
namespace {

constexpr std::array names{
    MessageName{"korvel:lang:diagnostic:IssuedEnabledWarningEvent", "krutil.protobuf.IssuedEnabledWarningEvent"},
    MessageName{"korvel:lang:diagnostic:IssuedWarningEvent", "krutil.protobuf.IssuedWarningEvent"},
    MessageName{"krutil:DebugLoopEvent", "krutil.protobuf.DebugLoopEvent"},
    MessageName{"krutil:EvalIIP", "krutil.protobuf.EvalIIP"},
    MessageName{"krutil:FEvalIIP", "krutil.protobuf.FEvalIIP"},
    MessageName{"krutil:FEvalResult", "krutil.protobuf.FEvalResult"},
    MessageName{"krutil:IIPCancelMessage", "krutil.protobuf.IIPCancelMessage"},
    MessageName{"krutil:IIPCancelReply", "krutil.protobuf.IIPCancelReply"},
    MessageName{"krutil:IIPCompletedEvent", "krutil.protobuf.IIPStateEvent"},
    MessageName{"krutil:IIPDiscardedEvent", "krutil.protobuf.IIPStateEvent"},
    MessageName{"krutil:IIPEnqueueMessage", "krutil.protobuf.IIPEnqueueMessage"},
    MessageName{"krutil:IIPReactivatedEvent", "krutil.protobuf.IIPStateEvent"},
    MessageName{"krutil:IIPReply", "krutil.protobuf.IIPReply"},
    MessageName{"krutil:IIPRequeuedEvent", "krutil.protobuf.IIPStateEvent"},
    MessageName{"krutil:IIPResult", "krutil.protobuf.IIPResult"},
    MessageName{"krutil:IIPResumedEvent", "krutil.protobuf.IIPStateEvent"},
    MessageName{"krutil:IIPStartedEvent", "krutil.protobuf.IIPStateEvent"},
    MessageName{"krutil:IIPSuspendedEvent", "krutil.protobuf.IIPStateEvent"},
    MessageName{"krutil:PrintableErrorEvent", "krutil.protobuf.PrintableErrorEvent"},
    MessageName{"krutil:QDA", "foundation.korveldata.protobuf.KORVEL_Array"},
    MessageName{"krutil:QVMShutdownEvent", "krutil.protobuf.QVMShutdownEvent"},
    MessageName{"krutil:SinkTextEvent", "krutil.protobuf.SinkTextEvent"},
    MessageName{"krutil:TextBaseEvent", "krutil.protobuf.TextBaseEvent"},
    MessageName{"krutil:capabilities_api:CapabilitiesChanged", "krutil.protobuf.CapabilitiesChanged"},
    MessageName{"krutil:detail::LastIIPEvent", "krutil.protobuf.IIPStateEvent"},
};

}  // namespace

std::span<const MessageName> messageNames() noexcept {
    return names;
}

std::string messageNameOfTag(std::string_view tag) {
    const auto row =
        std::find_if(names.begin(), names.end(), [tag](const MessageName& name) { return name.tag == tag; });
    return row == names.end() ? std::string() : std::string(row->message);
}

}  // namespace apps
