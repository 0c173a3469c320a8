// Messages for readers of the protocol to be checked with: all samples as they travel, and malformed ones made of them,
// each with what a reader makes of it.
//
// Built on first use, from main on, and immutable then; any thread may read them.
#pragma once

#include <string>
#include <utility>
#include <vector>

#include "krutil_protobuf/support/TestTransport.hpp"

namespace conformance {

using transport::FrameContent;

/// Readers in other languages, by the names that the manifest has for them.
inline constexpr const char* python = "python";
inline constexpr const char* javascript = "javascript";

struct Vector {
    std::string type;  ///< registered name of the serializer of the last frame
    std::string name;  ///< unique among those of the type
    std::vector<FrameContent> frames;
    bool wellFormed = false;

    bool accepted = true;
    std::string reading;  ///< accepted: what the object holds, one "name: value" line for each value
    std::string refusal;  ///< refused: the words with which a session says why

    /// Whether the content of the last frame is a message for a parser of Protocol Buffers that refuses what it cannot
    /// parse. All other frames are.
    bool parses = true;
    /// Readers of which the opposite is true, and why that is not wrong.
    std::vector<std::string> differing;
    std::string note;
    /// Whether the manifest lists the fields of the last frame. JSON has no place for text that is not UTF-8, and
    /// libraries make none of a message that lacks required fields.
    bool fieldsListed = true;
};

const std::vector<Vector>& vectors();

// What vectors are made of.

/// The note of a text in proto3 that is not UTF-8.
inline constexpr const char* textNote =
    "The library keeps what came up to the fault, with U+FFFD for bytes that are not UTF-8; most parsers refuse all.";

/// The frames of a sample as the library writes them, the first at index 1. Throws std::out_of_range when there is
/// none.
std::vector<FrameContent> sampleFrames(const std::string& type, const std::string& sample);

/// What the object of that sample holds when it has travelled.
std::string sampleReading(const std::string& type, const std::string& sample);

/// `text` with one occurrence of `from` as `to`. Throws std::logic_error when there is not exactly one.
std::string replaced(const std::string& text, const std::string& from, const std::string& to);

/// The words for a frame with this tag whose content is not one whole message: the byte at which the field in question
/// begins, and `why`, which begins with "field PATH: " or is about none.
std::string refusedAt(const std::string& type, std::size_t place, const std::string& why);

Vector refused(const std::string& type, const std::string& name, std::vector<FrameContent> frames,
               const std::string& refusal);
Vector accepted(const std::string& type, const std::string& name, std::vector<FrameContent> frames,
                const std::string& reading);
/// The same vector, for content that parsers refuse, except for `differing`.
Vector unparsable(Vector vector, std::vector<std::string> differing, const std::string& note);

/// `frames` after `edit` has changed the message in the one at this position (0 is the first).
template <class Proto, class Edit>
std::vector<FrameContent> edited(std::vector<FrameContent> frames, std::size_t position, const Edit& edit) {
    Proto proto;
    if (!proto.ParsePartialFromString(frames.at(position).bytes)) {
        throw std::logic_error("the frame to be edited is no " + proto.GetTypeName());
    }
    edit(proto);
    frames[position].bytes = proto.SerializePartialAsString();
    return frames;
}

/// The same for the last frame.
template <class Proto, class Edit>
std::vector<FrameContent> edited(std::vector<FrameContent> frames, const Edit& edit) {
    const std::size_t last = frames.size() - 1;
    return edited<Proto>(std::move(frames), last, edit);
}

// What single types add, by where they stand in the protocol.
void addMalformedRequests(std::vector<Vector>& vectors);
void addMalformedResults(std::vector<Vector>& vectors);
void addMalformedArrays(std::vector<Vector>& vectors);
void addMalformedEvents(std::vector<Vector>& vectors);

}  // namespace conformance
