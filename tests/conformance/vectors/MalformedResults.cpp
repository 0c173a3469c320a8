// Malformed replies and results from the engine.

#include "conformance/vectors/Vectors.hpp"
#include "krutil.protobuf.FEvalResult.pb.h"
#include "krutil.protobuf.IIPCancelReply.pb.h"
#include "krutil.protobuf.IIPReply.pb.h"
#include "krutil.protobuf.IIPResult.pb.h"

namespace conformance {
namespace {

namespace wire = krutil::protobuf;

constexpr const char* reply = "krutil:IIPReply";
constexpr const char* result = "krutil:IIPResult";
constexpr const char* callResult = "krutil:FEvalResult";
constexpr const char* cancelReply = "krutil:IIPCancelReply";

void addReplies(std::vector<Vector>& vectors) {
    const auto message = sampleFrames(reply, "typical");
    const auto with = [&](const auto& edit) { return edited<wire::IIPReply>(message, edit); };
    const auto refuse = [&](const std::string& name, std::vector<FrameContent> frames, const std::string& why) {
        vectors.push_back(refused(reply, name, std::move(frames), why));
    };
    const auto withTag = [&](const std::string& tag) {
        auto frames = message;
        frames.front().tag = tag;
        return frames;
    };
    refuse("identifier_absent", with([](auto& proto) { proto.clear_id(); }),
           "Required field is missing: protobuf::IIPReply.id");
    refuse("result_past_the_end", with([](auto& proto) { proto.set_resultid(3); }),
           "frame 3: expected a frame, got none: the message has 2");
    refuse("result_is_the_reply", with([](auto& proto) { proto.set_resultid(2); }),
           "frame 2: expected a frame, got none: it was read already");
    refuse("result_of_an_unknown_tag", withTag("krutil:NoSuchType"),
           "frame 1: no serializer is registered for its tag \"krutil:NoSuchType\"");
    refuse("event_as_result", withTag("krutil:TextBaseEvent"),
           "frame 1: expected an object that \"krutil:IIPReply\" can refer to, got one with tag "
           "\"krutil:TextBaseEvent\"");
    auto unnamed = message;
    unnamed.front().bytes.clear();
    refuse("result_without_identifier", std::move(unnamed), "Required field is missing: protobuf::IIPResult.id");
}

// `levels` errors, each the cause of the one before.
wire::RuntimeException nested(int levels) {
    wire::RuntimeException error;
    for (wire::RuntimeException* at = &error; levels > 1; --levels) {
        at = at->add_causes();
    }
    return error;
}

void addResults(std::vector<Vector>& vectors) {
    const auto message = sampleFrames(result, "typical");
    const auto with = [&](const auto& edit) { return edited<wire::IIPResult>(message, edit); };
    const auto refuse = [&](const std::string& name, std::vector<FrameContent> frames, const std::string& why) {
        vectors.push_back(refused(result, name, std::move(frames), why));
    };
    refuse("identifier_absent", with([](auto& proto) { proto.clear_id(); }),
           "Required field is missing: protobuf::IIPResult.id");
    for (const auto& [name, number] : {std::pair{"status_6", 6}, {"status_minus_1", -1}}) {
        const auto status = static_cast<wire::ExecutionStatus>(number);
        const std::string why = "status: expected a status from 0 to 5, got " + std::to_string(number);
        refuse(name, with([&](auto& proto) { proto.mutable_exception()->set_status(status); }),
               refusedAt(result, 25, "field exception." + why));
        refuse(std::string(name) + "_of_a_cause",
               with([&](auto& proto) { proto.mutable_exception()->add_causes()->set_status(status); }),
               refusedAt(result, 133, "field exception.causes." + why));
    }

    auto deep = message;
    wire::IIPResult error;
    error.mutable_id()->set_lo(9);
    *error.mutable_exception() = nested(101);
    deep.back().bytes = error.SerializeAsString();
    // The innermost cause is empty: its field is the last two bytes.
    const std::size_t innermost = deep.back().bytes.size() - 2;
    vectors.push_back(unparsable(
        refused(result, "error_of_101_levels", std::move(deep),
                refusedAt(result, innermost,
                          "field exception.causes (100 times): expected at most 100 messages inside one another, got "
                          "more")),
        {}, "Parsers take 100 messages inside one another, or as many as they are told to. Engines write 64 levels."));

    auto unnamed = with([](auto& proto) {
        proto.mutable_exception()->Clear();
        proto.mutable_exception()->set_status(wire::inRUNTIME_ERROR);
    });
    unnamed.back().bytes += "\x12\x04\x1A\x02\xC3\x28";
    vectors.push_back(
        unparsable(accepted(result, "text_is_not_utf8", std::move(unnamed),
                            "class: IIPResult\nid: 0123456789abcdeffedcba9876543210\n"
                            "exception.status: 2\nexception.msgID: \"\"\nexception.msgText: u\"\\u{fffd}(\"\n"
                            "exception.functionName: \"\"\nexception.shown: false\n"),
                   {}, textNote));
}

void addCallResults(std::vector<Vector>& vectors) {
    const auto message = sampleFrames(callResult, "typical");
    const auto with = [&](const auto& edit) { return edited<wire::FEvalResult>(message, edit); };
    const auto refuse = [&](const std::string& name, std::vector<FrameContent> frames, const std::string& why) {
        vectors.push_back(refused(callResult, name, std::move(frames), why));
    };
    refuse("result_absent", with([](auto& proto) { proto.clear_iipresult(); }),
           "Required field is missing: protobuf::FEvalResult.iipResult");
    refuse("identifier_absent", with([](auto& proto) { proto.mutable_iipresult()->Clear(); }),
           "Required field is missing: protobuf::IIPResult.id");
    refuse("output_past_the_end", with([](auto& proto) { proto.add_dataids(5); }),
           "frame 5: expected a frame, got none: the message has 4");
    refuse("one_output_twice", with([](auto& proto) { proto.add_dataids(1); }),
           "frame 1: expected a frame, got none: it was read already");
    refuse("status_6", with([](auto& proto) {
               proto.mutable_iipresult()->mutable_exception()->set_status(static_cast<wire::ExecutionStatus>(6));
           }),
           refusedAt(callResult, 27, "field iipResult.exception.status: expected a status from 0 to 5, got 6"));
    vectors.push_back(accepted(callResult, "error", with([](auto& proto) {
                                   proto.mutable_iipresult()->mutable_exception()->set_status(wire::inRUNTIME_ERROR);
                               }),
                               sampleReading(callResult, "typical")));
    vectors.back().note = "The error of such a result is not read; a failed call is answered with an IIPResult.";
}

}  // namespace

void addMalformedResults(std::vector<Vector>& vectors) {
    addReplies(vectors);
    addResults(vectors);
    addCallResults(vectors);
    vectors.push_back(accepted(
        cancelReply, "unknown_status",
        edited<wire::IIPCancelReply>(sampleFrames(cancelReply, "default"),
                                     [](auto& proto) { proto.set_status(static_cast<wire::CancelStatus>(4)); }),
        replaced(sampleReading(cancelReply, "default"), "status: 0", "status: 4")));
    vectors.back().note = "Any number is carried unchanged.";
}

}  // namespace conformance
