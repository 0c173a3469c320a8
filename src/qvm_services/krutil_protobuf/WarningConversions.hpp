// Warnings, which both warning events carry.
#pragma once

#include <boost/shared_ptr.hpp>

#include "korvel/lang/diagnostic/IssuedEnabledWarningEvent.hpp"
#include "korvel/lang/diagnostic/IssuedWarningEvent.hpp"

namespace krutil::protobuf {
class IssuedEnabledWarningEvent;
class IssuedWarningEvent;
class PrintfArgument;
class Warning;
class WarningStackFrame;
}  // namespace krutil::protobuf

namespace krutil::protobuf_serializer {

/// Nothing here fails but for memory. Out: every required field is set, empty ones too. In: absent fields read as
/// defaults. Numbers are copied bit for bit. Each fill() sets every field of a message that may hold another object's
/// values.
class WarningConversions {
  public:
    /// Sets the one field of the argument's type; none read back is the int 0.
    static void fill(const korvel::lang::PrintfArgument& argument, protobuf::PrintfArgument& proto);
    static protobuf::PrintfArgument toProtobuf(const korvel::lang::PrintfArgument& argument);
    static korvel::lang::PrintfArgument fromProtobuf(const protobuf::PrintfArgument& proto);

    static void fill(const korvel::lang::StackFrame& frame, protobuf::WarningStackFrame& proto);
    static protobuf::WarningStackFrame toProtobuf(const korvel::lang::StackFrame& frame);
    static korvel::lang::StackFrame fromProtobuf(const protobuf::WarningStackFrame& proto);

    static void fill(const korvel::lang::diagnostic::Warning& warning, protobuf::Warning& proto);
    static protobuf::Warning toProtobuf(const korvel::lang::diagnostic::Warning& warning);
    static korvel::lang::diagnostic::Warning fromProtobuf(const protobuf::Warning& proto);

    static void fill(const korvel::lang::diagnostic::IssuedWarningEvent& event, protobuf::IssuedWarningEvent& proto);
    static boost::shared_ptr<const korvel::lang::diagnostic::IssuedWarningEvent> fromProtobuf(
        const protobuf::IssuedWarningEvent& proto);

    /// The message wraps the complete message of an issued warning, and the event is made of that one's values.
    static void fill(const korvel::lang::diagnostic::IssuedEnabledWarningEvent& event,
                     protobuf::IssuedEnabledWarningEvent& proto);
    static boost::shared_ptr<const korvel::lang::diagnostic::IssuedEnabledWarningEvent> fromProtobuf(
        const protobuf::IssuedEnabledWarningEvent& proto);
};

}  // namespace krutil::protobuf_serializer
