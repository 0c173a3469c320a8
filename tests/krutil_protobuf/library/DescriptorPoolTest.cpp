// The schema as other components find it once the shared library is loaded: every message by its full name, with its
// fields.

#include <google/protobuf/descriptor.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <map>
#include <string>
#include <vector>

#include "krutil.protobuf.VariableDataMessages.pb.h"
#include "krutil.protobuf.VariablesSetMessage.pb.h"

namespace {

using google::protobuf::Descriptor;
using google::protobuf::DescriptorPool;
using google::protobuf::EnumDescriptor;
using google::protobuf::FieldDescriptor;

const std::string prefix = "krutil.protobuf.";

const std::map<std::string, std::vector<std::string>>& messages() {
    static const std::map<std::string, std::vector<std::string>> expected{
        {"QVMShutdownEvent", {}},
        {"IIPStateEvent", {"1 id msg_svc.protobuf.IDType", "2 type krutil.protobuf.IIPStateEventType"}},
        {"TextBaseEvent", {"1 id msg_svc.protobuf.IDType", "2 stream krutil.protobuf.StreamType", "3 text string"}},
        {"SinkTextEvent", {"1 id msg_svc.protobuf.IDType", "2 stream krutil.protobuf.StreamType", "3 text string"}},
        {"IIPEnqueueMessage",
         {"1 iipHandle uint64", "2 iipid msg_svc.protobuf.IDType", "3 qcrid int32", "4 qvmid uint64",
          "5 dequeueMode krutil.protobuf.WhenToDequeue", "6 name string",
          "7 capability repeated krutil.protobuf.Capability", "8 okToFlushSparingly bool"}},
        {"IIP",
         {"1 streamID krutil.protobuf.IqmStreamID", "2 pluginType string", "3 outTraits krutil.protobuf.SinkTraits",
          "4 errTraits krutil.protobuf.SinkTraits"}},
        {"SinkTraits",
         {"1 supportsHotlinks bool", "2 needsFormattingForDisplay bool", "3 useDiary bool", "4 useEcho bool",
          "5 useLogging bool"}},
        {"EvalIIP",
         {"1 iip krutil.protobuf.IIP", "2 cmd string", "3 codeType krutil.protobuf.CodeType",
          "4 wsHolder krutil.protobuf.WorkspaceHolder"}},
        {"WorkspaceHolder",
         {"1 wsId msg_svc.protobuf.IDType", "2 varNames repeated string",
          "3 varEntries repeated krutil.protobuf.VariableEntry", "4 clientExchangeName string"}},
        {"IIPResult", {"1 id msg_svc.protobuf.IDType", "2 exception krutil.protobuf.RuntimeException"}},
        {"IIPReply", {"1 id msg_svc.protobuf.IDType", "2 resultID uint64"}},
        {"StackFrame", {"1 file string", "2 func string", "3 line double"}},
        {"RuntimeException",
         {"1 status krutil.protobuf.ExecutionStatus", "2 msgID string", "3 msgText string", "4 functionName string",
          "5 frames repeated krutil.protobuf.StackFrame", "6 causes repeated krutil.protobuf.RuntimeException"}},
        {"CapabilitiesChanged",
         {"1 previousCapabilities repeated krutil.protobuf.Capability",
          "2 qvmCapabilities repeated krutil.protobuf.Capability",
          "3 clientCapabilities repeated krutil.protobuf.Capability",
          "4 requestCapabilities repeated krutil.protobuf.Capability"}},
        {"DebugLoopEvent",
         {"1 requestID msg_svc.protobuf.IDType", "2 state krutil.protobuf.DebugLoopEvent.State",
          "3 whichLoop krutil.protobuf.InputRequester"}},
        {"IIPCancelMessage", {"1 iipid msg_svc.protobuf.IDType", "2 evenIfRunning bool"}},
        {"IIPCancelReply", {"1 status krutil.protobuf.CancelStatus"}},
        {"FEvalIIP",
         {"1 iip krutil.protobuf.IIP", "2 functionName string", "3 nlhs uint64", "4 dataIDs repeated uint64",
          "5 clientQvmID uint64", "6 serverQvmID uint64"}},
        {"FEvalResult", {"1 iipResult krutil.protobuf.IIPResult", "2 dataIDs repeated uint64"}},
        {"PrintfArgument",
         {"1 i32 Value int32", "2 u32 Value uint32", "3 i64 Value int64", "4 u64 Value uint64", "5 dbl Value double",
          "6 str Value string"}},
        {"WarningStackFrame", {"1 file string", "2 name string", "3 line uint32"}},
        {"Warning",
         {"1 identifier required string", "2 format required string",
          "3 arguments repeated krutil.protobuf.PrintfArgument", "4 message required string",
          "5 stack repeated krutil.protobuf.WarningStackFrame", "6 wasDisabled required bool",
          "7 datenum required double"}},
        {"IssuedWarningEvent", {"1 id required msg_svc.protobuf.IDType", "2 warning required krutil.protobuf.Warning"}},
        {"IssuedEnabledWarningEvent", {"1 warningEvent required krutil.protobuf.IssuedWarningEvent"}},
        {"PrintableErrorEvent",
         {"1 id msg_svc.protobuf.IDType", "2 except krutil.protobuf.RuntimeException", "3 text string"}},
        {"VariableData", {"1 status krutil.protobuf.VariableStatus", "2 dataID uint64"}},
        {"VariableEntry", {"1 name string", "2 variableData krutil.protobuf.VariableData"}},
        {"ReplyData", {"1 status krutil.protobuf.VariableStatus", "2 dataID uint64"}},
        {"ReplyEntry", {"1 name string", "2 replyData krutil.protobuf.ReplyData"}},
        {"VariablesGetMessage", {"1 varNames repeated string", "2 wsId msg_svc.protobuf.IDType"}},
        {"VariablesGetReply", {"1 varInfo repeated krutil.protobuf.ReplyEntry"}},
        {"VariablesSetMessage",
         {"1 varNames repeated string", "2 dataIDs repeated uint64",
          "3 opCode krutil.protobuf.VariablesSetMessage.OpCode", "4 wsId msg_svc.protobuf.IDType"}},
        {"OneVariableGetMessage", {"1 varName string", "2 wsId msg_svc.protobuf.IDType"}},
        {"WorkspaceDeletedMessage", {"1 wsId msg_svc.protobuf.IDType"}},
    };
    return expected;
}

// The values in the order of their declaration.
using EnumValues = std::vector<std::pair<std::string, int>>;

const std::map<std::string, EnumValues>& enums() {
    static const std::map<std::string, EnumValues> expected{
        {"IIPStateEventType",
         {{"IIPStartedEvent", 0},
          {"IIPSuspendedEvent", 1},
          {"IIPResumedEvent", 2},
          {"IIPDiscardedEvent", 3},
          {"IIPRequeuedEvent", 4},
          {"IIPReactivatedEvent", 5},
          {"IIPCompletedEvent", 6},
          {"LastIIPEvent", 7}}},
        {"StreamType", {{"OUTPUT_STREAM", 0}, {"ERROR_STREAM", 1}, {"GENERIC_STREAM", 2}}},
        {"WhenToDequeue",
         {{"DEQUEUE_UNKNOWN", 0},
          {"DEQUEUE_AT_PPE", 1},
          {"DEQUEUE_AT_PAUSE", 2},
          {"DEQUEUE_AT_PROMPT", 3},
          {"DEQUEUE_AT_NON_DEBUG_PROMPT", 4},
          {"DEQUEUE_AT_DEBUG_PROMPT", 5},
          {"DEQUEUE_AT_IDLE", 6},
          {"DEQUEUE_AT_BOOTSTRAP", 7}}},
        {"IqmStreamID",
         {{"ekIqmCmdWinStream", 0}, {"ekIqmNoStreams", -2}, {"ekIqmAllStreams", -1}, {"ekIqmJavaStream", 1000}}},
        {"CodeType", {{"CodeBlockType", 0}, {"ScriptType", 1}, {"ConventionalType", 2}, {"Undefined", 3}}},
        {"Capability",
         {{"CAPABILITY_ENUM_BASE", 0},
          {"InteractiveCommandLine", 1},
          {"Swing", 2},
          {"ComplexSwing", 3},
          {"LocalClient", 4},
          {"WebWindow", 5},
          {"ModalDialogs", 6},
          {"Debugging", 7}}},
        {"ExecutionStatus",
         {{"inEXECUTION_SUCCESS", 0},
          {"inCOMPILE_ERROR", 1},
          {"inRUNTIME_ERROR", 2},
          {"inEXECUTION_DBQUIT", 3},
          {"inEXECUTION_CTRLC", 4},
          {"inCOMM_ERROR", 5}}},
        {"DebugLoopEvent.State", {{"PROTOBUF3_REQUIRED_ENUM_BASE", 0}, {"EXIT", 1}, {"ENTER", 2}}},
        {"InputRequester",
         {{"mnBASE_PROMPT", 0},
          {"mnDEBUG_PROMPT", 1},
          {"mnINPUT_PROMPT", 2},
          {"mnKEYBOARD_PROMPT", 3},
          {"mnPAUSE_PROMPT", 4},
          {"mnBANG_PROMPT", 5},
          {"mnDRAVELIN_DEBUG_PROMPT", 6},
          {"mnINCOMPLETE_BLOCK_PROMPT", 7},
          {"mnMORE_PROMPT", 8},
          {"mnEMERGENCY_EXIT_PROMPT", 9},
          {"mnTOLVARENS_DEBUG_PROMPT", 10},
          {"mnTW_EQL_DEBUG_PROMPT", 11},
          {"mnNO_PROMPT", -1}}},
        {"CancelStatus",
         {{"UNABLE_TO_CANCEL_ALREADY_DONE", 0},
          {"UNABLE_TO_CANCEL_ALREADY_RUNNING", 1},
          {"SUCCESSFUL_CANCEL", 2},
          {"PENDING_CANCEL", 3}}},
        {"VariableStatus",
         {{"NOT_A_VARIABLE", 0}, {"IS_VARIABLE", 1}, {"VARIABLE_WITH_VALUE", 2}, {"VARIABLE_NOT_CHANGED", 3}}},
        {"VariablesSetMessage.OpCode", {{"VAR_NOOP", 0}, {"VAR_SET", 1}, {"VAR_CLEAR", 2}}},
    };
    return expected;
}

// Syntax and imports of each file: what a component that compiles one of them must have.
const std::map<std::string, std::vector<std::string>>& files() {
    static const std::map<std::string, std::vector<std::string>> expected{
        {"CapabilitiesChanged", {"proto3", "krutil.protobuf.Capability"}},
        {"Capability", {"proto3"}},
        {"DebugLoopEvent", {"proto3", "msg_svc.protobuf.BaseEvent", "msg_svc.protobuf.IDType"}},
        {"EvalIIP", {"proto3", "krutil.protobuf.IIP", "krutil.protobuf.WorkspaceHolder"}},
        {"ExecutionStatus", {"proto3"}},
        {"FEvalIIP", {"proto3", "krutil.protobuf.IIP"}},
        {"FEvalResult", {"proto3", "krutil.protobuf.IIPResult"}},
        {"IIP", {"proto3", "krutil.protobuf.SinkTraits"}},
        {"IIPCancelMessage", {"proto3", "msg_svc.protobuf.IDType"}},
        {"IIPCancelReply", {"proto3"}},
        {"IIPEnqueueMessage", {"proto3", "msg_svc.protobuf.IDType", "krutil.protobuf.Capability"}},
        {"IIPReply", {"proto3", "msg_svc.protobuf.IDType"}},
        {"IIPResult", {"proto3", "msg_svc.protobuf.IDType", "krutil.protobuf.RuntimeException"}},
        {"IIPStateEvent", {"proto3", "msg_svc.protobuf.IDType"}},
        {"IssuedEnabledWarningEvent", {"proto2", "krutil.protobuf.IssuedWarningEvent"}},
        {"IssuedWarningEvent", {"proto2", "msg_svc.protobuf.IDType", "krutil.protobuf.Warning"}},
        {"OneVariableGetMessage", {"proto3", "msg_svc.protobuf.IDType"}},
        {"PrintableErrorEvent", {"proto3", "msg_svc.protobuf.IDType", "krutil.protobuf.RuntimeException"}},
        {"PrintfArgument", {"proto2"}},
        {"QVMShutdownEvent", {"proto3"}},
        {"RuntimeException", {"proto3", "krutil.protobuf.ExecutionStatus"}},
        {"SinkTextEvent",
         {"proto3", "krutil.protobuf.StreamType", "msg_svc.protobuf.BaseEvent", "msg_svc.protobuf.IDType"}},
        {"SinkTraits", {"proto3"}},
        {"StreamType", {"proto3"}},
        {"TextBaseEvent",
         {"proto3", "krutil.protobuf.StreamType", "msg_svc.protobuf.BaseEvent", "msg_svc.protobuf.IDType"}},
        {"VariableDataMessages", {"proto3", "krutil.protobuf.VariableStatusEnum"}},
        {"VariableStatusEnum", {"proto3"}},
        {"VariablesGetMessage", {"proto3", "msg_svc.protobuf.IDType"}},
        {"VariablesGetReply", {"proto3", "krutil.protobuf.VariableDataMessages"}},
        {"VariablesSetMessage", {"proto3", "msg_svc.protobuf.IDType"}},
        {"Warning", {"proto2", "krutil.protobuf.PrintfArgument", "krutil.protobuf.WarningStackFrame"}},
        {"WarningStackFrame", {"proto2"}},
        {"WorkspaceDeletedMessage", {"proto3", "msg_svc.protobuf.IDType"}},
        {"WorkspaceHolder", {"proto3", "msg_svc.protobuf.IDType", "krutil.protobuf.VariableDataMessages"}},
    };
    return expected;
}

std::string typeOf(const FieldDescriptor& field) {
    if (field.message_type() != nullptr) {
        return field.message_type()->full_name();
    }
    return field.enum_type() != nullptr ? field.enum_type()->full_name() : field.type_name();
}

std::string labelOf(const FieldDescriptor& field) {
    if (field.real_containing_oneof() != nullptr) {
        return " " + field.real_containing_oneof()->name() + " ";
    }
    return field.is_repeated() ? " repeated " : field.is_required() ? " required " : " ";
}

std::vector<std::string> fieldsOf(const Descriptor& message) {
    std::vector<std::string> fields;
    for (int i = 0; i < message.field_count(); ++i) {
        const FieldDescriptor& field = *message.field(i);
        fields.push_back(std::to_string(field.number()) + " " + field.name() + labelOf(field) + typeOf(field));
    }
    return fields;
}

TEST(DescriptorPoolTest, EveryMessageIsFoundByItsFullNameWithItsFields) {
    for (const auto& [name, fields] : messages()) {
        const Descriptor* found = DescriptorPool::generated_pool()->FindMessageTypeByName("krutil.protobuf." + name);
        ASSERT_NE(found, nullptr) << name;
        EXPECT_EQ(fieldsOf(*found), fields) << name;
    }
}

TEST(DescriptorPoolTest, EveryEnumIsFoundByItsFullNameWithItsValuesInTheirOrder) {
    for (const auto& [name, values] : enums()) {
        const EnumDescriptor* found = DescriptorPool::generated_pool()->FindEnumTypeByName("krutil.protobuf." + name);
        ASSERT_NE(found, nullptr) << name;
        EnumValues declared;
        for (int i = 0; i < found->value_count(); ++i) {
            declared.emplace_back(found->value(i)->name(), found->value(i)->number());
        }
        EXPECT_EQ(declared, values) << name;
    }
}

TEST(DescriptorPoolTest, EveryFileHasItsSyntaxAndItsImports) {
    for (const auto& [name, expected] : files()) {
        const auto* file = DescriptorPool::generated_pool()->FindFileByName(prefix + name + ".proto");
        ASSERT_NE(file, nullptr) << name;
        EXPECT_EQ(file->package(), "krutil.protobuf");
        std::vector<std::string> found{google::protobuf::FileDescriptor::SyntaxName(file->syntax())};
        for (int i = 0; i < file->dependency_count(); ++i) {
            const std::string& imported = file->dependency(i)->name();
            found.push_back(imported.substr(0, imported.rfind('.')));
        }
        EXPECT_EQ(found, expected) << name;
    }
}

// Each message group is a file of its own, which other components import by name. Starts from the files, so that no
// new one stays out of the lists above.
TEST(DescriptorPoolTest, EverySchemaFileIsLoadedAndIsListedWithAllThatItHolds) {
    // What is not in a file of its own name.
    const std::map<std::string, std::string> shared{{"StackFrame", "RuntimeException"},
                                                    {"VariableData", "VariableDataMessages"},
                                                    {"VariableEntry", "VariableDataMessages"},
                                                    {"ReplyData", "VariableDataMessages"},
                                                    {"ReplyEntry", "VariableDataMessages"},
                                                    {"IIPStateEventType", "IIPStateEvent"},
                                                    {"WhenToDequeue", "IIPEnqueueMessage"},
                                                    {"IqmStreamID", "IIP"},
                                                    {"CodeType", "EvalIIP"},
                                                    {"DebugLoopEvent.State", "DebugLoopEvent"},
                                                    {"InputRequester", "DebugLoopEvent"},
                                                    {"CancelStatus", "IIPCancelReply"},
                                                    {"VariableStatus", "VariableStatusEnum"},
                                                    {"VariablesSetMessage.OpCode", "VariablesSetMessage"}};
    const auto check = [&shared](const auto& type) {
        const std::string name = type.full_name().substr(prefix.size());
        EXPECT_TRUE(messages().contains(name) || enums().contains(name))
            << name << " needs its row of `messages` or `enums` in this file.";
        EXPECT_EQ(type.file()->name(), prefix + (shared.contains(name) ? shared.at(name) : name) + ".proto");
    };
    for (const auto& entry : std::filesystem::directory_iterator(KRUTIL_PROTO_DIR)) {
        const auto* file = DescriptorPool::generated_pool()->FindFileByName(entry.path().filename());
        ASSERT_NE(file, nullptr) << entry.path();
        const std::string name = entry.path().stem().string().substr(prefix.size());
        EXPECT_TRUE(files().contains(name)) << name << " needs its row of `files` in this file.";
        for (int i = 0; i < file->enum_type_count(); ++i) {
            check(*file->enum_type(i));
        }
        for (int i = 0; i < file->message_type_count(); ++i) {
            check(*file->message_type(i));
            for (int k = 0; k < file->message_type(i)->enum_type_count(); ++k) {
                check(*file->message_type(i)->enum_type(k));
            }
        }
    }
}

TEST(DescriptorPoolTest, AnUnknownVariableStatusIsKeptAsItsNumber) {
    krutil::protobuf::VariableData data;
    ASSERT_TRUE(data.ParseFromString("\x08\x09"));
    EXPECT_EQ(static_cast<int>(data.status()), 9);
    EXPECT_FALSE(krutil::protobuf::VariableStatus_IsValid(9));
    EXPECT_EQ(data.SerializeAsString(), "\x08\x09");
}

TEST(DescriptorPoolTest, AnUnknownOpCodeIsKeptAsItsNumber) {
    krutil::protobuf::VariablesSetMessage message;
    ASSERT_TRUE(message.ParseFromString("\x18\x05"));
    EXPECT_EQ(static_cast<int>(message.opcode()), 5);
    EXPECT_FALSE(krutil::protobuf::VariablesSetMessage_OpCode_IsValid(5));
    EXPECT_EQ(message.SerializeAsString(), "\x18\x05");
}

}  // namespace
