// Malformed messages from the client.

#include "conformance/vectors/Vectors.hpp"
#include "krutil.protobuf.EvalIIP.pb.h"
#include "krutil.protobuf.FEvalIIP.pb.h"
#include "krutil.protobuf.IIPCancelMessage.pb.h"
#include "krutil.protobuf.IIPEnqueueMessage.pb.h"

namespace conformance {
namespace {

namespace wire = krutil::protobuf;

constexpr const char* enqueue = "krutil:IIPEnqueueMessage";
constexpr const char* eval = "krutil:EvalIIP";
constexpr const char* call = "krutil:FEvalIIP";
constexpr const char* cancel = "krutil:IIPCancelMessage";

void addEnqueueMessages(std::vector<Vector>& vectors) {
    const auto message = sampleFrames(enqueue, "typical");
    const auto reading = sampleReading(enqueue, "typical");
    const auto with = [&](const auto& edit) { return edited<wire::IIPEnqueueMessage>(message, edit); };
    const auto refuse = [&](const std::string& name, std::vector<FrameContent> frames, const std::string& why) {
        vectors.push_back(refused(enqueue, name, std::move(frames), why));
    };
    const auto withHandle = [&](std::uint64_t handle) {
        return with([handle](auto& proto) { proto.set_iiphandle(handle); });
    };
    const auto withTag = [&](const std::string& tag) {
        auto frames = message;
        frames.front().tag = tag;
        return frames;
    };

    refuse("handle_0", withHandle(0), "frame 0: expected a frame, got none: the message has 2");
    refuse("handle_past_the_end", withHandle(3), "frame 3: expected a frame, got none: the message has 2");
    refuse("largest_handle", withHandle(~std::uint64_t{0}),
           "frame 18446744073709551615: expected a frame, got none: the message has 2");
    refuse("handle_of_itself", withHandle(2), "frame 2: expected a frame, got none: it was read already");
    refuse("request_of_an_unknown_tag", withTag("krutil:NoSuchType"),
           "frame 1: no serializer is registered for its tag \"krutil:NoSuchType\"");
    auto other = message;
    other.front() = sampleFrames("krutil:IIPResult", "success").front();
    refuse("result_as_request", std::move(other),
           "frame 1: expected an object that \"krutil:IIPEnqueueMessage\" can refer to, got one with tag "
           "\"krutil:IIPResult\"");
    auto data = message;
    data.front().tagged = false;
    data.front().type = static_cast<transport::FrameType>(4);
    data.front().tag.clear();
    refuse("data_frame_as_request", std::move(data), "frame 1: expected a tagged frame, got a data frame of type 4");
    const std::string mode = "Invalid enum field value krutil::protobuf::IIPEnqueueMessage.WhenToDequeue = ";
    for (const auto& [name, number] : {std::pair{"dequeue_mode_8", 8}, {"dequeue_mode_minus_1", -1}}) {
        refuse(name,
               with([value = number](auto& proto) { proto.set_dequeuemode(static_cast<wire::WhenToDequeue>(value)); }),
               mode + std::to_string(number));
    }

    vectors.push_back(accepted(enqueue, "unknown_capabilities", with([](auto& proto) {
                                   proto.add_capability(static_cast<wire::Capability>(0));
                                   proto.add_capability(static_cast<wire::Capability>(8));
                                   proto.add_capability(static_cast<wire::Capability>(-1));
                               }),
                               reading));
    vectors.back().note = "Capabilities without a meaning are skipped.";
    auto unnamed = with([](auto& proto) { proto.clear_name(); });
    unnamed.back().bytes += "\x32\x02\xC3\x28";
    vectors.push_back(unparsable(
        accepted(enqueue, "name_is_not_utf8", std::move(unnamed), replaced(reading, "u\"a name\"", "u\"\\u{fffd}(\"")),
        {}, textNote));
}

void addEvaluations(std::vector<Vector>& vectors) {
    const auto request = sampleFrames(eval, "typical");
    const auto with = [&](const auto& edit) { return edited<wire::EvalIIP>(request, edit); };
    const auto refuse = [&](const std::string& name, std::vector<FrameContent> frames, const std::string& why) {
        vectors.push_back(refused(eval, name, std::move(frames), why));
    };
    refuse("core_absent", with([](auto& proto) { proto.clear_iip(); }),
           "Required field missing: protobuf::EvalIIP.iip");
    refuse("core_empty", with([](auto& proto) { proto.mutable_iip()->Clear(); }),
           "Required string field protobuf::IIP.pluginType is empty.");
    refuse("plugin_type_absent", with([](auto& proto) { proto.mutable_iip()->clear_plugintype(); }),
           "Required string field protobuf::IIP.pluginType is empty.");
    refuse("output_traits_absent", with([](auto& proto) { proto.mutable_iip()->clear_outtraits(); }),
           "Required field protobuf::IIP.outTraits is missing.");
    refuse("error_traits_absent", with([](auto& proto) { proto.mutable_iip()->clear_errtraits(); }),
           "Required field protobuf::IIP.errTraits is missing.");
    for (const auto& [name, number] : {std::pair{"code_type_4", 4}, {"code_type_minus_1", -1}}) {
        refuse(name, with([value = number](auto& proto) { proto.set_codetype(static_cast<wire::CodeType>(value)); }),
               "Invalid enum krutil::protobuf::CodeType field value = " + std::to_string(number));
    }
    vectors.push_back(accepted(eval, "unknown_stream", with([](auto& proto) {
                                   proto.mutable_iip()->set_streamid(static_cast<wire::IqmStreamID>(7));
                               }),
                               replaced(sampleReading(eval, "typical"), "streamID: -1", "streamID: 7")));
    vectors.back().note = "The number is kept, and an engine acts as on 0.";
    vectors.push_back(accepted(eval, "workspace",
                               with([](auto& proto) { proto.mutable_wsholder()->set_clientexchangename("x"); }),
                               sampleReading(eval, "typical")));
    vectors.back().note = "The field is for other components, and is not read.";
    auto uncoded = with([](auto& proto) { proto.clear_cmd(); });
    uncoded.back().bytes += "\x12\x02\xC3\x28";
    vectors.push_back(
        unparsable(accepted(eval, "code_is_not_utf8", std::move(uncoded),
                            replaced(sampleReading(eval, "typical"), "u\"print(6 * 7)\"", "u\"\\u{fffd}(\"")),
                   {}, textNote));
}

void addCalls(std::vector<Vector>& vectors) {
    const auto request = sampleFrames(call, "typical");
    const auto with = [&](const auto& edit) { return edited<wire::FEvalIIP>(request, edit); };
    const auto refuse = [&](const std::string& name, std::vector<FrameContent> frames, const std::string& why) {
        vectors.push_back(refused(call, name, std::move(frames), why));
    };
    refuse("core_absent", with([](auto& proto) { proto.clear_iip(); }),
           "Required field missing: protobuf::FEvalIIP.iip");
    refuse("plugin_type_absent", with([](auto& proto) { proto.mutable_iip()->clear_plugintype(); }),
           "Required string field protobuf::IIP.pluginType is empty.");
    refuse("client_absent", with([](auto& proto) { proto.clear_clientqvmid(); }),
           "Invalid krutil::protobuf::FEvalIIP.clientQvmID field value of 0");
    refuse("server_absent", with([](auto& proto) { proto.clear_serverqvmid(); }),
           "Invalid krutil::protobuf::FEvalIIP.serverQvmID field value of 0");
    refuse("argument_0", with([](auto& proto) { proto.set_dataids(0, 0); }),
           "frame 0: expected a frame, got none: the message has 4");
    refuse("argument_past_the_end", with([](auto& proto) { proto.add_dataids(5); }),
           "frame 5: expected a frame, got none: the message has 4");
    refuse("one_argument_twice", with([](auto& proto) { proto.add_dataids(1); }),
           "frame 1: expected a frame, got none: it was read already");
    refuse("argument_is_the_call", with([](auto& proto) { proto.add_dataids(4); }),
           "frame 4: expected a frame, got none: it was read already");
    auto faulty = request;
    faulty[1].bytes.clear();
    refuse("argument_is_no_array", std::move(faulty), "Array: elements of type unknown (code 0) are not supported");
    vectors.push_back(accepted(call, "unpacked_arguments", with([](auto& proto) { proto.clear_dataids(); }),
                               sampleReading(call, "typical")));
    vectors.back().frames.back().bytes += "\x20\x01\x20\x02\x20\x03";
    vectors.back().note = "Numbers of a repeated field may stand one by one.";
}

}  // namespace

void addMalformedRequests(std::vector<Vector>& vectors) {
    addEnqueueMessages(vectors);
    addEvaluations(vectors);
    addCalls(vectors);
    vectors.push_back(refused(
        cancel, "identifier_absent",
        edited<wire::IIPCancelMessage>(sampleFrames(cancel, "typical"), [](auto& proto) { proto.clear_iipid(); }),
        "Requied field is missing: protobuf::IIPCancelMessage.iipId"));
}

}  // namespace conformance
