// Messages as bytes of a session, and what the library makes of such bytes.
#pragma once

#include <cstddef>
#include <functional>
#include <string>
#include <string_view>
#include <vector>

#include "krutil_protobuf/support/TestTransport.hpp"
#include "samples/Samples.hpp"

namespace conformance {

/// Bytes in front of a frame's tag and content.
inline constexpr std::size_t headerSize = 24;

/// The frames of one message, as they travel.
std::string bytesOf(const std::vector<transport::FrameContent>& frames);

/// What came of reading one message: an object and its description, or the reason against it.
struct Reading {
    std::string type;  ///< tag of the last frame
    transport::StreamID stream = 0;
    bool accepted = false;
    samples::Object object;
    std::string description;  ///< accepted: see SampleSet::describe()
    std::string refusal;      ///< refused: what a session of this protocol says, without the tag of the message
};

/// Hands the messages of a stream to `take` one by one, as they arrive, read as a session reads them: with its limits,
/// with the check of numbers that end a process, and with its words for what is wrong. `bytes` may be a part of the
/// stream; the rest follows with the next call.
class StreamOfMessages {
  public:
    StreamOfMessages();
    ~StreamOfMessages();
    StreamOfMessages(const StreamOfMessages&) = delete;
    StreamOfMessages& operator=(const StreamOfMessages&) = delete;

    /// Throws ProtocolViolation for bytes that are no frames.
    void feed(std::string_view bytes, const std::function<void(Reading)>& take);

    /// True between two messages.
    bool atBoundary() const;

    const std::shared_ptr<transport::Registry>& registry() const;

  private:
    struct Parts;
    const std::unique_ptr<Parts> parts_;
};

}  // namespace conformance
