// The messages of a recorded session.
#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "common/FrameBytes.hpp"
#include "common/RecordingReader.hpp"

namespace krutil_client {

using apps::FrameHeader;
using apps::FrameKind;

/// One frame of a message, as far as it was recorded and kept.
struct InspectedFrame {
    apps::RecordedUnit unit;
    FrameHeader header;         ///< nothing but zeros for a unit that is too short to have one
    std::string tag;            ///< any bytes; empty for other kinds than tagged
    std::uint64_t content = 0;  ///< bytes of the content, those in shared memory for a frame that says where they are

    /// What there is of the content.
    std::string_view bytes() const noexcept;

    /// "data", "abort" and the like, "hello" for a part of the handshake; of a tagged frame the last part of its tag.
    /// Any bytes.
    std::string type() const;
};

/// What one end has said: a message, a frame that belongs to none, or a part of the handshake.
struct InspectedMessage {
    std::vector<InspectedFrame> frames;  ///< one for what is not a message; never empty
    std::string request;                 ///< identifier in 32 hexadecimal digits; empty for none
    bool complete = true;                ///< false when the recording ends before the message does

    const apps::RecordedUnit& first() const noexcept { return frames.front().unit; }
    const InspectedFrame& root() const noexcept { return frames.back(); }
    bool isHandshake() const noexcept { return first().kind != apps::RecordedUnit::Kind::Frame; }

    /// Bytes on the stream, and those in shared memory.
    std::uint64_t size() const noexcept;

    /// That of its last frame.
    std::string type() const { return root().type(); }

    /// The frame with this index; null where there is none.
    const InspectedFrame* frame(std::uint64_t index) const noexcept {
        return index >= 1 && index <= frames.size() ? &frames[index - 1] : nullptr;
    }
};

/// Puts the frames of recorded sessions together to messages, and finds out which requests they belong to. Not
/// synchronised.
class MessageAssembler {
  public:
    /// With `keepData` the bytes of arrays are kept, too.
    explicit MessageAssembler(bool keepData) : keepData_(keepData) {}

    /// The message that this unit completes; empty when it is not the last frame.
    std::optional<InspectedMessage> take(apps::RecordedUnit unit);

    /// What was begun and not completed.
    std::vector<InspectedMessage> rest();

  private:
    struct Session {
        std::array<std::vector<InspectedFrame>, 2> begun;         ///< by sender
        std::unordered_map<std::uint32_t, std::string> requests;  ///< of open exchanges, by stream
    };

    void findRequest(InspectedMessage& message, Session& session) const;

    const bool keepData_;
    std::vector<Session> sessions_;
};

}  // namespace krutil_client
