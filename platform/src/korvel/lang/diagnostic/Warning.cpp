#include "korvel/lang/diagnostic/Warning.hpp"

#include "korvel/lang/diagnostic/IssuedEnabledWarningEvent.hpp"
#include "korvel/lang/diagnostic/IssuedWarningEvent.hpp"

namespace korvel::lang::diagnostic {

Warning::Warning(std::string identifier, std::u16string format, std::vector<PrintfArgument> arguments,
                 std::u16string message, std::vector<StackFrame> stack, bool wasDisabled, double time)
    : identifier_(std::move(identifier)),
      format_(std::move(format)),
      arguments_(std::move(arguments)),
      message_(std::move(message)),
      stack_(std::move(stack)),
      wasDisabled_(wasDisabled),
      time_(time) {}

IssuedWarningEvent::IssuedWarningEvent(foundation::msg_svc::exchange::IDType id, const Warning& warning)
    : RequestIdAdapter(id), warning_(warning) {}

IssuedWarningEvent::~IssuedWarningEvent() = default;

IssuedEnabledWarningEvent::IssuedEnabledWarningEvent(foundation::msg_svc::exchange::IDType id, const Warning& warning)
    : RequestIdAdapter(id), warning_(warning) {}

IssuedEnabledWarningEvent::~IssuedEnabledWarningEvent() = default;

}  // namespace korvel::lang::diagnostic
