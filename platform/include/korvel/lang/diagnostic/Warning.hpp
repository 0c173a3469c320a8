// A warning that the interpreter issued.
#pragma once

#include <string>
#include <vector>

#include "korvel/lang/PrintfArgument.hpp"
#include "korvel/lang/StackFrame.hpp"

namespace korvel::lang::diagnostic {

/// A value.
class Warning {
  public:
    /// `time` is a date number: days since the first of January of year 0 (day 1), the fraction being the time of day.
    Warning(std::string identifier, std::u16string format, std::vector<PrintfArgument> arguments,
            std::u16string message, std::vector<StackFrame> stack, bool wasDisabled, double time);

    /// Warning identifier, 8-bit text.
    const std::string& getIdentifier() const noexcept { return identifier_; }
    /// Format text before its arguments are put in.
    const std::u16string& getFormat() const noexcept { return format_; }
    /// What is put into the format text, in order.
    const std::vector<PrintfArgument>& getArguments() const noexcept { return arguments_; }
    /// The text with its arguments put in.
    const std::u16string& getMessage() const noexcept { return message_; }
    /// Where the warning was issued, in the order in which the interpreter listed it.
    const std::vector<StackFrame>& getStack() const noexcept { return stack_; }
    /// Whether a filter hid the warning.
    bool getWasDisabled() const noexcept { return wasDisabled_; }
    /// Time of issue, a date number.
    double getTime() const noexcept { return time_; }

    bool operator==(const Warning&) const = default;  ///< the same in every part

  private:
    std::string identifier_;
    std::u16string format_;
    std::vector<PrintfArgument> arguments_;
    std::u16string message_;
    std::vector<StackFrame> stack_;
    bool wasDisabled_;
    double time_;
};

}  // namespace korvel::lang::diagnostic
