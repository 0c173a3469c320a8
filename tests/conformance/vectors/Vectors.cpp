#include "conformance/vectors/Vectors.hpp"

#include <map>
#include <stdexcept>

#include "samples/Samples.hpp"

namespace conformance {
namespace {

const samples::Sample& sampleOf(const std::string& type, const std::string& name) {
    for (const samples::Sample& sample : samples::sampleSet(type).samples) {
        if (sample.name == name) {
            return sample;
        }
    }
    throw std::out_of_range(type + " has no sample " + name);
}

std::vector<FrameContent> framesOf(const std::string& type, const samples::Object& object) {
    static const auto registry = transport::sessionRegistry();
    return transport::writtenFrames(*registry->find(type), object, registry);
}

std::vector<FrameContent> withMoreContent(std::vector<FrameContent> frames, const std::string& bytes) {
    frames.back().bytes += bytes;
    return frames;
}

// What follows a whole content and is none of its fields. Fields from 1000 on are nobody's.
void addStrayContent(std::vector<Vector>& vectors, const samples::SampleSet& set) {
    const std::string& type = set.serializer;
    const std::string sample = set.samples.front().name;
    const auto frames = sampleFrames(type, sample);
    const std::size_t size = frames.back().bytes.size();
    vectors.push_back(
        accepted(type, "unknown_field", withMoreContent(frames, "\xC0\x3E\x2A"), sampleReading(type, sample)));
    vectors.back().note = "Unknown fields are skipped.";
    const auto addUnparsable = [&](const std::string& name, const std::string& bytes, const std::string& why,
                                   std::vector<std::string> differing = {}, const std::string& note = "") {
        vectors.push_back(unparsable(refused(type, name, withMoreContent(frames, bytes), refusedAt(type, size, why)),
                                     std::move(differing), note));
    };
    addUnparsable("ends_behind_a_key", "\xC0\x3E", "field 1000: expected 1 more byte, got none");
    addUnparsable("ends_before_its_claimed_length", "\xC2\x3E\x7F", "field 1000: expected 127 more bytes, got none");
    addUnparsable("claims_two_gibibytes", "\xC2\x3E\xFF\xFF\xFF\xFF\x07",
                  "field 1000: expected 2147483647 more bytes, got none", {},
                  "No reader may take memory for a length that is merely claimed.");
    addUnparsable("wire_type_of_no_meaning", "\xC7\x3E", "field 1000: expected a wire type from 0 to 5, got 7");
    addUnparsable("field_number_zero", std::string("\x00\x01", 2), "expected a field number from 1 on, got 0");
    addUnparsable("varint_of_eleven_bytes", "\xC0\x3E\xFF\xFF\xFF\xFF\xFF\xFF\xFF\xFF\xFF\xFF\x01",
                  "field 1000: expected a number of at most 10 bytes, got more", {javascript},
                  "A number has ten bytes at most; a parser may skip a longer one of a field that it does not know.");
    // It is missed where the content ends.
    vectors.push_back(unparsable(
        refused(type, "group_without_end", withMoreContent(frames, "\xC3\x3E"),
                refusedAt(type, size + 2, "field 1000: expected the end of group 1000, got the end of what it is in")),
        {}, ""));
}

void addWrongFrameType(std::vector<Vector>& vectors, const samples::SampleSet& set) {
    auto frames = sampleFrames(set.serializer, set.samples.front().name);
    auto& type = frames.back().type;
    const int other = static_cast<int>(type) == 27 ? 29 : 27;
    type = static_cast<transport::FrameType>(other);
    const std::string index = std::to_string(frames.back().index);
    vectors.push_back(refused(
        set.serializer, "wrong_frame_type", std::move(frames),
        "frame " + index + ": expected the frame type of \"" + set.serializer + "\", got " + std::to_string(other)));
}

// An empty content, where that is refused, by type.
const std::map<std::string, std::string>& refusalsOfNothing() {
    static const std::map<std::string, std::string> byType{
        {"krutil:DebugLoopEvent", "Invalid enum krutil::protobuf::DebugLoopEvent_State field value = 0"},
        {"krutil:EvalIIP", "Required field missing: protobuf::EvalIIP.iip"},
        {"krutil:FEvalIIP", "Required field missing: protobuf::FEvalIIP.iip"},
        {"krutil:FEvalResult", "Required field is missing: protobuf::FEvalResult.iipResult"},
        {"krutil:IIPCancelMessage", "Requied field is missing: protobuf::IIPCancelMessage.iipId"},
        {"krutil:IIPEnqueueMessage", "frame 0: expected a frame, got none: the message has 1"},
        {"krutil:IIPReply", "Required field is missing: protobuf::IIPReply.id"},
        {"krutil:IIPResult", "Required field is missing: protobuf::IIPResult.id"},
        {"krutil:QDA", "Array: elements of type unknown (code 0) are not supported"},
    };
    return byType;
}

// Their messages have required fields.
bool isWarning(const samples::SampleSet& set) {
    return set.serializer.starts_with("korvel:lang:diagnostic:");
}

void addNothing(std::vector<Vector>& vectors, const samples::SampleSet& set) {
    FrameContent frame = sampleFrames(set.serializer, set.samples.front().name).back();
    frame.index = 1;
    frame.bytes.clear();
    if (const auto found = refusalsOfNothing().find(set.serializer); found != refusalsOfNothing().end()) {
        vectors.push_back(refused(set.serializer, "empty", {frame}, found->second));
        return;
    }
    // What the emptiest sample reads as; its fields are the defaults, so their absence says the same.
    vectors.push_back(accepted(set.serializer, "empty", {frame}, sampleReading(set.serializer, "default")));
    vectors.back().note = "Absent fields read as their defaults.";
    vectors.back().fieldsListed = !isWarning(set);
}

std::vector<Vector> makeVectors() {
    std::vector<Vector> all;
    for (const samples::SampleSet& set : samples::sampleSets()) {
        for (const samples::Sample& sample : set.samples) {
            all.push_back(accepted(set.serializer, sample.name, framesOf(set.serializer, sample.object),
                                   set.describe(sample.object, samples::View::AfterTrip)));
            all.back().wellFormed = true;
        }
        addStrayContent(all, set);
        addWrongFrameType(all, set);
        addNothing(all, set);
    }
    addMalformedRequests(all);
    addMalformedResults(all);
    addMalformedArrays(all);
    addMalformedEvents(all);
    return all;
}

}  // namespace

std::vector<FrameContent> sampleFrames(const std::string& type, const std::string& sample) {
    return framesOf(type, sampleOf(type, sample).object);
}

std::string sampleReading(const std::string& type, const std::string& sample) {
    return samples::sampleSet(type).describe(sampleOf(type, sample).object, samples::View::AfterTrip);
}

std::string replaced(const std::string& text, const std::string& from, const std::string& to) {
    const std::size_t place = text.find(from);
    if (place == std::string::npos || text.find(from, place + 1) != std::string::npos) {
        throw std::logic_error("\"" + from + "\" is not once in: " + text);
    }
    return text.substr(0, place) + to + text.substr(place + from.size());
}

std::string refusedAt(const std::string& type, std::size_t place, const std::string& why) {
    return "frame \"" + type + "\", byte " + std::to_string(place) + (why.starts_with("field") ? ", " : ": ") + why;
}

Vector refused(const std::string& type, const std::string& name, std::vector<FrameContent> frames,
               const std::string& refusal) {
    Vector vector;
    vector.type = type;
    vector.name = name;
    vector.frames = std::move(frames);
    vector.accepted = false;
    vector.refusal = refusal;
    return vector;
}

Vector accepted(const std::string& type, const std::string& name, std::vector<FrameContent> frames,
                const std::string& reading) {
    Vector vector;
    vector.type = type;
    vector.name = name;
    vector.frames = std::move(frames);
    vector.reading = reading;
    return vector;
}

Vector unparsable(Vector vector, std::vector<std::string> differing, const std::string& note) {
    vector.parses = false;
    vector.differing = std::move(differing);
    vector.note = note;
    return vector;
}

const std::vector<Vector>& vectors() {
    static const std::vector<Vector> all = makeVectors();
    return all;
}

}  // namespace conformance
