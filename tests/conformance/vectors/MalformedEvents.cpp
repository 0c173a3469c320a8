// Malformed events.

#include "conformance/vectors/Vectors.hpp"
#include "krutil.protobuf.CapabilitiesChanged.pb.h"
#include "krutil.protobuf.DebugLoopEvent.pb.h"
#include "krutil.protobuf.IIPStateEvent.pb.h"
#include "krutil.protobuf.IssuedEnabledWarningEvent.pb.h"
#include "krutil.protobuf.PrintableErrorEvent.pb.h"
#include "krutil.protobuf.SinkTextEvent.pb.h"
#include "krutil.protobuf.TextBaseEvent.pb.h"
#include "samples/Samples.hpp"

namespace conformance {
namespace {

namespace wire = krutil::protobuf;

// How the identifier of a typical sample reads, and one that is absent.
constexpr const char* typicalID = "0123456789abcdeffedcba9876543210";
constexpr const char* noID = "00000000000000000000000000000000";

template <class Proto>
void addTextEvents(std::vector<Vector>& vectors, const std::string& type) {
    const auto message = sampleFrames(type, "typical");
    for (const auto& [name, number] : {std::pair{"stream_3", 3}, {"stream_minus_1", -1}}) {
        vectors.push_back(refused(
            type, name,
            edited<Proto>(message,
                          [value = number](auto& proto) { proto.set_stream(static_cast<wire::StreamType>(value)); }),
            refusedAt(type, 23, "field stream: expected a stream from 0 to 2, got " + std::to_string(number))));
    }
    auto textless = edited<Proto>(message, [](auto& proto) { proto.clear_text(); });
    textless.back().bytes += "\x1A\x02\xC3\x28";
    vectors.push_back(
        unparsable(accepted(type, "text_is_not_utf8", std::move(textless),
                            replaced(sampleReading(type, "typical"), R"(u"x =\u{000a}\u{000a}    42\u{000a}\u{000a}")",
                                     "u\"\\u{fffd}(\"")),
                   {}, textNote));
    vectors.push_back(accepted(type, "identifier_absent", edited<Proto>(message, [](auto& proto) { proto.clear_id(); }),
                               replaced(sampleReading(type, "typical"), typicalID, noID)));
}

void addStateEvents(std::vector<Vector>& vectors) {
    for (const samples::SampleSet& set : samples::sampleSets()) {
        if (set.message != "krutil.protobuf.IIPStateEvent") {
            continue;
        }
        vectors.push_back(accepted(
            set.serializer, "type_8",
            edited<wire::IIPStateEvent>(sampleFrames(set.serializer, "typical"),
                                        [](auto& proto) { proto.set_type(static_cast<wire::IIPStateEventType>(8)); }),
            sampleReading(set.serializer, "typical")));
        vectors.back().note = "The tag tells the kind; the number is not read.";
    }
}

void addDebugLoopEvents(std::vector<Vector>& vectors) {
    const std::string type = "krutil:DebugLoopEvent";
    const auto message = sampleFrames(type, "typical");
    for (const auto& [name, number] : {std::pair{"state_0", 0}, {"state_3", 3}}) {
        vectors.push_back(refused(
            type, name,
            edited<wire::DebugLoopEvent>(
                message,
                [value = number](auto& proto) { proto.set_state(static_cast<wire::DebugLoopEvent::State>(value)); }),
            "Invalid enum krutil::protobuf::DebugLoopEvent_State field value = " + std::to_string(number)));
    }
    for (const auto& [name, number] : {std::pair{"loop_12", 12}, {"loop_minus_2", -2}}) {
        vectors.push_back(refused(
            type, name,
            edited<wire::DebugLoopEvent>(
                message,
                [value = number](auto& proto) { proto.set_whichloop(static_cast<wire::InputRequester>(value)); }),
            "Invalid enum krutil::protobuf::InputRequester field value = " + std::to_string(number)));
    }
}

void addWarnings(std::vector<Vector>& vectors) {
    const std::string issued = "korvel:lang:diagnostic:IssuedWarningEvent";
    const auto message = sampleFrames(issued, "typical");
    const auto reading = sampleReading(issued, "typical");
    const auto with = [&](const auto& edit) { return edited<wire::IssuedWarningEvent>(message, edit); };
    vectors.push_back(accepted(issued, "warning_absent", with([](auto& proto) { proto.clear_warning(); }),
                               replaced(sampleReading(issued, "default"), noID, typicalID)));
    vectors.back().note = "Absent fields read as their defaults, the required ones too.";
    vectors.back().fieldsListed = false;
    vectors.push_back(accepted(issued, "argument_without_a_value",
                               with([](auto& proto) { proto.mutable_warning()->mutable_arguments(0)->Clear(); }),
                               replaced(reading, "argument0.value: 6", "argument0.value: 0")));
    vectors.back().note = "An argument without a value is the 32-bit integer 0.";
    vectors.push_back(accepted(issued, "text_is_not_utf8",
                               with([](auto& proto) { proto.mutable_warning()->set_message("\xC3\x28"); }),
                               replaced(reading, "message: u\"ratio of 6 to 7\"", "message: u\"\\u{fffd}(\"")));
    vectors.back().fieldsListed = false;
    vectors.back().differing = {python};
    vectors.back().note = "These messages are proto2, where a parser may take any bytes for text.";

    const std::string enabled = "korvel:lang:diagnostic:IssuedEnabledWarningEvent";
    vectors.push_back(
        accepted(enabled, "identifier_absent",
                 edited<wire::IssuedEnabledWarningEvent>(sampleFrames(enabled, "typical"),
                                                         [](auto& proto) { proto.mutable_warningevent()->clear_id(); }),
                 replaced(sampleReading(enabled, "typical"), typicalID, noID)));
    vectors.back().note = "Absent fields read as their defaults, the required ones too.";
    vectors.back().fieldsListed = false;
}

void addErrors(std::vector<Vector>& vectors) {
    const std::string type = "krutil:PrintableErrorEvent";
    const auto message = sampleFrames(type, "typical");
    vectors.push_back(refused(
        type, "status_6",
        edited<wire::PrintableErrorEvent>(
            message, [](auto& proto) { proto.mutable_except()->set_status(static_cast<wire::ExecutionStatus>(6)); }),
        refusedAt(type, 25, "field except.status: expected a status from 0 to 5, got 6")));
    vectors.push_back(accepted(type, "error_absent",
                               edited<wire::PrintableErrorEvent>(message,
                                                                 [](auto& proto) {
                                                                     proto.clear_id();
                                                                     proto.clear_except();
                                                                     proto.clear_text();
                                                                 }),
                               sampleReading(type, "default")));
    vectors.back().note = "An absent error reads as the empty one.";
}

void addCapabilities(std::vector<Vector>& vectors) {
    const std::string type = "krutil:capabilities_api:CapabilitiesChanged";
    const auto message = sampleFrames(type, "typical");
    vectors.push_back(accepted(
        type, "unknown_capabilities",
        edited<wire::CapabilitiesChanged>(message,
                                          [](auto& proto) {
                                              for (const int number : {0, 8, -1, 2'147'483'647}) {
                                                  proto.add_qvmcapabilities(static_cast<wire::Capability>(number));
                                              }
                                          }),
        sampleReading(type, "typical")));
    vectors.back().note = "Capabilities without a meaning are skipped.";
}

}  // namespace

void addMalformedEvents(std::vector<Vector>& vectors) {
    addTextEvents<wire::TextBaseEvent>(vectors, "krutil:TextBaseEvent");
    addTextEvents<wire::SinkTextEvent>(vectors, "krutil:SinkTextEvent");
    addStateEvents(vectors);
    addDebugLoopEvents(vectors);
    addWarnings(vectors);
    addErrors(vectors);
    addCapabilities(vectors);
}

}  // namespace conformance
