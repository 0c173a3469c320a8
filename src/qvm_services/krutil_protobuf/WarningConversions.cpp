#include "WarningConversions.hpp"

#include <boost/make_shared.hpp>
#include <boost/variant.hpp>
#include <string>
#include <vector>

#include "FieldConversions.hpp"
#include "krutil.protobuf.IssuedEnabledWarningEvent.pb.h"
#include "krutil.protobuf.IssuedWarningEvent.pb.h"
#include "krutil.protobuf.PrintfArgument.pb.h"
#include "krutil.protobuf.Warning.pb.h"
#include "krutil.protobuf.WarningStackFrame.pb.h"

namespace krutil::protobuf_serializer {
namespace {

// One overload for each alternative; overload resolution on exact types keeps `long` in i64 and `unsigned int` in u32.
struct SetValue : boost::static_visitor<> {
    explicit SetValue(protobuf::PrintfArgument& message) : proto(message) {}
    void operator()(int value) const { proto.set_i32(value); }
    void operator()(unsigned int value) const { proto.set_u32(value); }
    void operator()(long value) const { proto.set_i64(value); }
    void operator()(unsigned long value) const { proto.set_u64(value); }
    void operator()(double value) const { proto.set_dbl(value); }
    void operator()(const std::u16string& value) const { proto.set_str(ustring_to_utf8(value)); }
    protobuf::PrintfArgument& proto;
};

// Both events become the same message; they have no base in common that has their two values.
template <class EventT>
void fillIssuedWarning(const EventT& event, protobuf::IssuedWarningEvent& proto) {
    *proto.mutable_id() = IDTypeSerializer::toProtobuf(event.getRequestId());
    WarningConversions::fill(event.getWarning(), *proto.mutable_warning());
}

}  // namespace

void WarningConversions::fill(const korvel::lang::PrintfArgument& argument, protobuf::PrintfArgument& proto) {
    boost::apply_visitor(SetValue(proto), argument.getValue());
}

protobuf::PrintfArgument WarningConversions::toProtobuf(const korvel::lang::PrintfArgument& argument) {
    protobuf::PrintfArgument proto;
    fill(argument, proto);
    return proto;
}

korvel::lang::PrintfArgument WarningConversions::fromProtobuf(const protobuf::PrintfArgument& proto) {
    using korvel::lang::PrintfArgument;
    using Value = boost::variant<int, unsigned int, long, unsigned long, double, std::u16string>;
    // The casts name the alternative: the wire's 64-bit types may be long or long long, the variant's are long.
    switch (proto.Value_case()) {
        case protobuf::PrintfArgument::kI32:
            return PrintfArgument(Value(static_cast<int>(proto.i32())));
        case protobuf::PrintfArgument::kU32:
            return PrintfArgument(Value(static_cast<unsigned int>(proto.u32())));
        case protobuf::PrintfArgument::kI64:
            return PrintfArgument(Value(static_cast<long>(proto.i64())));
        case protobuf::PrintfArgument::kU64:
            return PrintfArgument(Value(static_cast<unsigned long>(proto.u64())));
        case protobuf::PrintfArgument::kDbl:
            return PrintfArgument(Value(proto.dbl()));
        case protobuf::PrintfArgument::kStr:
            return PrintfArgument(Value(utf8_to_ustring(proto.str())));
        case protobuf::PrintfArgument::VALUE_NOT_SET:
            break;
    }
    return PrintfArgument(Value());
}

void WarningConversions::fill(const korvel::lang::StackFrame& frame, protobuf::WarningStackFrame& proto) {
    proto.set_file(ustring_to_utf8(frame.file));
    proto.set_name(ustring_to_utf8(frame.name));
    proto.set_line(frame.line);
}

protobuf::WarningStackFrame WarningConversions::toProtobuf(const korvel::lang::StackFrame& frame) {
    protobuf::WarningStackFrame proto;
    fill(frame, proto);
    return proto;
}

korvel::lang::StackFrame WarningConversions::fromProtobuf(const protobuf::WarningStackFrame& proto) {
    return {utf8_to_ustring(proto.file()), utf8_to_ustring(proto.name()), proto.line()};
}

void WarningConversions::fill(const korvel::lang::diagnostic::Warning& warning, protobuf::Warning& proto) {
    proto.set_identifier(warning.getIdentifier());
    proto.set_format(ustring_to_utf8(warning.getFormat()));
    proto.clear_arguments();
    for (const auto& argument : warning.getArguments()) {
        fill(argument, *proto.add_arguments());
    }
    proto.set_message(ustring_to_utf8(warning.getMessage()));
    proto.clear_stack();
    for (const auto& frame : warning.getStack()) {
        fill(frame, *proto.add_stack());
    }
    proto.set_wasdisabled(warning.getWasDisabled());
    proto.set_datenum(warning.getTime());
}

protobuf::Warning WarningConversions::toProtobuf(const korvel::lang::diagnostic::Warning& warning) {
    protobuf::Warning proto;
    fill(warning, proto);
    return proto;
}

korvel::lang::diagnostic::Warning WarningConversions::fromProtobuf(const protobuf::Warning& proto) {
    std::vector<korvel::lang::PrintfArgument> arguments;
    arguments.reserve(static_cast<std::size_t>(proto.arguments_size()));
    for (const auto& argument : proto.arguments()) {
        arguments.push_back(fromProtobuf(argument));
    }
    std::vector<korvel::lang::StackFrame> stack;
    stack.reserve(static_cast<std::size_t>(proto.stack_size()));
    for (const auto& frame : proto.stack()) {
        stack.push_back(fromProtobuf(frame));
    }
    return korvel::lang::diagnostic::Warning(proto.identifier(), utf8_to_ustring(proto.format()), std::move(arguments),
                                             utf8_to_ustring(proto.message()), std::move(stack), proto.wasdisabled(),
                                             proto.datenum());
}

void WarningConversions::fill(const korvel::lang::diagnostic::IssuedWarningEvent& event,
                              protobuf::IssuedWarningEvent& proto) {
    fillIssuedWarning(event, proto);
}

boost::shared_ptr<const korvel::lang::diagnostic::IssuedWarningEvent> WarningConversions::fromProtobuf(
    const protobuf::IssuedWarningEvent& proto) {
    return boost::make_shared<const korvel::lang::diagnostic::IssuedWarningEvent>(
        IDTypeSerializer::fromProtobuf(proto.id()), fromProtobuf(proto.warning()));
}

void WarningConversions::fill(const korvel::lang::diagnostic::IssuedEnabledWarningEvent& event,
                              protobuf::IssuedEnabledWarningEvent& proto) {
    fillIssuedWarning(event, *proto.mutable_warningevent());
}

boost::shared_ptr<const korvel::lang::diagnostic::IssuedEnabledWarningEvent> WarningConversions::fromProtobuf(
    const protobuf::IssuedEnabledWarningEvent& proto) {
    const auto issued = fromProtobuf(proto.warningevent());
    return boost::make_shared<const korvel::lang::diagnostic::IssuedEnabledWarningEvent>(issued->getRequestId(),
                                                                                         issued->getWarning());
}

}  // namespace krutil::protobuf_serializer
