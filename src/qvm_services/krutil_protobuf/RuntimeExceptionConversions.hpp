// Records of errors, which results and printable errors embed.
#pragma once

#include "cmddistributor/RuntimeException.hpp"
#include "cmddistributor/StackFrame.hpp"
#include "krutil.protobuf.ExecutionStatus.pb.h"
#include "krutil.protobuf.RuntimeException.pb.h"
#include "krutil/cmddistributor/inExecutionStatus.hpp"

namespace krutil::protobuf_serializer {

/// Both directions end the process for a number other than 0 to 5.
protobuf::ExecutionStatus toProtobuf(cmddistributor::inExecutionStatus status);
cmddistributor::inExecutionStatus fromProtobuf(protobuf::ExecutionStatus status);

/// Each fill() sets every field of a message that may hold another object's values.
void fill(const ::cmddistributor::StackFrame& frame, protobuf::StackFrame& proto);
protobuf::StackFrame toProtobuf(const ::cmddistributor::StackFrame& frame);
::cmddistributor::StackFrame fromProtobuf(const protobuf::StackFrame& proto);

/// Both directions recurse once for each level of causes, without a limit of their own (the parser of received messages
/// has one), and end the process for a bad status at any level. On the way out the status of a record is looked at
/// before the rest of it, on the way in after.
void fill(const ::cmddistributor::RuntimeException& exception, protobuf::RuntimeException& proto);
protobuf::RuntimeException toProtobuf(const ::cmddistributor::RuntimeException& exception);
::cmddistributor::RuntimeException fromProtobuf(const protobuf::RuntimeException& proto);

}  // namespace krutil::protobuf_serializer
