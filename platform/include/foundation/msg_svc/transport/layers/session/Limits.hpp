// What a session accepts, in bytes, frames and fields.
#pragma once

#include <cstdint>

namespace msg_svc::protobuf {
class SessionLimits;
}

namespace foundation::msg_svc::transport::layers::session {

/// Each end states its own limits in the handshake, so that a sender refuses first what the receiver would refuse. A
/// size is compared with its limit before memory is asked for.
struct Limits {
    static constexpr std::uint64_t longestTag = 65'535;  ///< what a frame's header can tell

    std::uint64_t tag = 128;                   ///< bytes of a tag; at most `longestTag`
    std::uint64_t taggedFrame = 4ULL << 20;    ///< bytes of a tagged frame's content
    std::uint64_t arrayMessage = 64ULL << 20;  ///< the same for the tagged frame of an array
    std::uint64_t message = 4ULL << 30;        ///< bytes of all frames of one message, data frames included
    std::uint64_t frames = 65'536;             ///< frames of one message
    std::uint64_t parts = 262'144;             ///< fields of a tagged frame's content, as WireWalk counts them

    bool operator==(const Limits&) const = default;  ///< the same in every part
};

/// What an end accepts that has told these limits in its first message.
Limits limitsFrom(const ::msg_svc::protobuf::SessionLimits& told);

}  // namespace foundation::msg_svc::transport::layers::session
