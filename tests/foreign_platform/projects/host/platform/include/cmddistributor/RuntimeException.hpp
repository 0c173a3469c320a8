// An error and what caused it. A value.
#pragma once

#include <string>
#include <vector>

#include "cmddistributor/StackFrame.hpp"
#include "krutil/cmddistributor/inExecutionStatus.hpp"

namespace cmddistributor {

class RuntimeException {
  public:
    /// The flag stays in the process.
    explicit RuntimeException(krutil::cmddistributor::inExecutionStatus status, std::u16string text, std::string id,
                              std::string function, std::vector<StackFrame> stack, std::vector<RuntimeException> causes,
                              bool reported)
        : causes_(std::move(causes)),
          stack_(std::move(stack)),
          function_(std::move(function)),
          id_(std::move(id)),
          text_(std::move(text)),
          status_(status),
          reported_(reported) {}

    krutil::cmddistributor::inExecutionStatus getExecutionStatus() const { return status_; }
    std::string GetID() const { return id_; }
    std::u16string GetUnicodeMessageTxt() const { return text_; }
    std::string getFunctionName() const { return function_; }
    std::vector<StackFrame> getStackFrames() const { return stack_; }
    std::vector<RuntimeException> getCauses() const { return causes_; }
    bool reported() const { return reported_; }

    bool operator==(const RuntimeException&) const = default;

  private:
    std::vector<RuntimeException> causes_;
    std::vector<StackFrame> stack_;
    std::string function_;
    std::string id_;
    std::u16string text_;
    krutil::cmddistributor::inExecutionStatus status_;
    bool reported_;
};

}  // namespace cmddistributor
