// The record of an error that a request raised.
#pragma once

#include <string>
#include <vector>

#include "cmddistributor/StackFrame.hpp"
#include "krutil/cmddistributor/inExecutionStatus.hpp"

namespace cmddistributor {

/// Status, identifier and text of an error, where it arose, and the errors that caused it, each a full record. A value.
/// Nesting has no limit here: conversion, copying and destruction recurse once per level, so whoever builds records
/// bounds their depth.
class RuntimeException {
  public:
    /// `shown` says that the error's text has been shown to the user already; it stays in the process.
    RuntimeException(krutil::cmddistributor::inExecutionStatus status, std::u16string msgText, std::string msgID,
                     std::string functionName, std::vector<StackFrame> frames, std::vector<RuntimeException> causes,
                     bool shown);

    /// How the request ended.
    krutil::cmddistributor::inExecutionStatus getExecutionStatus() const noexcept { return status_; }
    /// Message identifier, UTF-8.
    const std::string& GetID() const noexcept { return msgID_; }
    /// Message text, UTF-16.
    const std::u16string& GetUnicodeMessageTxt() const noexcept { return msgText_; }
    /// Function in which the error arose, UTF-8.
    const std::string& getFunctionName() const noexcept { return functionName_; }
    /// The stack, in the order in which the raiser listed it.
    const std::vector<StackFrame>& getStackFrames() const noexcept { return frames_; }
    /// The errors that caused this one, in the order in which the raiser listed them.
    const std::vector<RuntimeException>& getCauses() const noexcept { return causes_; }
    /// Whether the text has been shown to the user already. False in a record from a peer.
    bool getShown() const noexcept { return shown_; }

    bool operator==(const RuntimeException&) const = default;  ///< the same in every part, causes included

  private:
    krutil::cmddistributor::inExecutionStatus status_;
    std::u16string msgText_;
    std::string msgID_;
    std::string functionName_;
    std::vector<StackFrame> frames_;
    std::vector<RuntimeException> causes_;
    bool shown_;
};

}  // namespace cmddistributor
