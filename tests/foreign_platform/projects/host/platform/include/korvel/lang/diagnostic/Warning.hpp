// Warnings of the interpreter. Values.
#pragma once

#include <boost/variant.hpp>
#include <string>
#include <vector>

namespace korvel::lang {

class PrintfArgument {
  public:
    using Variant = boost::variant<int, unsigned int, long, unsigned long, double, std::u16string>;

    explicit PrintfArgument(Variant value) : value_(std::move(value)) {}

    Variant getValue() const { return value_; }

    bool operator==(const PrintfArgument& other) const { return value_ == other.value_; }

  private:
    Variant value_;
};

struct StackFrame {
    std::u16string file, name;
    unsigned int line;

    bool operator==(const StackFrame&) const = default;
};

}  // namespace korvel::lang

namespace korvel::lang::diagnostic {

class Warning {
  public:
    explicit Warning(std::string identifier, std::u16string format, std::vector<PrintfArgument> arguments,
                     std::u16string message, std::vector<StackFrame> stack, bool hidden, double time)
        : time_(time),
          hidden_(hidden),
          stack_(std::move(stack)),
          message_(std::move(message)),
          arguments_(std::move(arguments)),
          format_(std::move(format)),
          identifier_(std::move(identifier)) {}

    std::string getIdentifier() const { return identifier_; }
    std::u16string getFormat() const { return format_; }
    std::vector<PrintfArgument> getArguments() const { return arguments_; }
    std::u16string getMessage() const { return message_; }
    std::vector<StackFrame> getStack() const { return stack_; }
    bool getWasDisabled() const { return hidden_; }
    double getTime() const { return time_; }

    bool operator==(const Warning&) const = default;

  private:
    double time_;
    bool hidden_;
    std::vector<StackFrame> stack_;
    std::u16string message_;
    std::vector<PrintfArgument> arguments_;
    std::u16string format_;
    std::string identifier_;
};

}  // namespace korvel::lang::diagnostic
