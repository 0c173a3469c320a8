#include "foundation/msg_svc/transport/layers/session/PeerLimits.hpp"

#include <cstdint>
#include <utility>

#include "foundation/msg_svc/transport/layers/session/FrameKinds.hpp"
#include "foundation/msg_svc/transport/layers/session/PrintableText.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionError.hpp"

namespace foundation::msg_svc::transport::layers::session {

PeerLimits::PeerLimits(const Limits& limits, std::string peerName, std::string arrayTag,
                       std::shared_ptr<const WireWalk> walk)
    : limits_(limits), peerName_(std::move(peerName)), arrayTag_(std::move(arrayTag)), walk_(std::move(walk)) {}

void PeerLimits::check(const std::vector<std::unique_ptr<framing::Frame>>& frames) const {
    const auto refuse = [&](const char* limit, std::uint64_t accepted, std::uint64_t size, const std::string& what,
                            const char* unit) {
        const std::string_view root = asTagged(*frames.back())->tag();
        throw LimitExceeded(quoted(root) + " is larger than " + peerName_ + " accepts: its limit \"" + limit +
                            "\" is " + std::to_string(accepted) + " " + unit + ", " + what + " has " +
                            std::to_string(size));
    };
    if (frames.size() > limits_.frames) {
        refuse("frames", limits_.frames, frames.size(), "the message", "frames");
    }
    std::uint64_t total = 0;
    for (const auto& frame : frames) {
        total += frame->size();
        if (const auto* const tagged = asTagged(*frame)) {
            if (tagged->tag().size() > limits_.tag) {
                refuse("tag", limits_.tag, tagged->tag().size(), "the tag of frame " + std::to_string(frame->index()),
                       "bytes");
            }
            const bool array = tagged->tag() == arrayTag_;
            const std::uint64_t accepted = array ? limits_.arrayMessage : limits_.taggedFrame;
            if (frame->size() > accepted) {
                refuse(array ? "arrayMessage" : "taggedFrame", accepted, frame->size(),
                       "the content of frame " + std::to_string(frame->index()), "bytes");
            }
            // A part takes two bytes or more, so nearly no content has to be counted.
            if (walk_ && frame->size() / 2 > limits_.parts) {
                if (const std::uint64_t parts = walk_->parts(*tagged); parts > limits_.parts) {
                    refuse("parts", limits_.parts, parts, "the content of frame " + std::to_string(frame->index()),
                           "fields");
                }
            }
            total += tagged->tag().size();
        }
    }
    if (total > limits_.message) {
        refuse("message", limits_.message, total, "the message", "bytes");
    }
}

}  // namespace foundation::msg_svc::transport::layers::session
