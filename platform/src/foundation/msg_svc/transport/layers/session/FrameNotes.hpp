// What the frames of a message were, for the report of a message that cannot be read.
#pragma once

#include <cstddef>
#include <exception>
#include <memory>
#include <string>
#include <vector>

#include "foundation/msg_svc/transport/layers/serialization/Registry.hpp"
#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace foundation::msg_svc::transport::layers::session {

namespace framing = ::foundation::vantor::carrier::framing;

/// Serializers take frames out of their message and throw what does not tell which frame was wrong. So the frames are
/// noted before, in memory that is used again for each message. One thread, the one that reads.
class FrameNotes {
  public:
    /// Notes all frames of a message that is about to be read; the element at position i has index i + 1.
    void take(const std::vector<std::unique_ptr<framing::Frame>>& frames);

    /// What was wrong when reading that message ended with `error`: the frame that was asked for last, what was
    /// expected there and what was there. An error that says in words what is wrong says it itself. `arrayTag` is the
    /// tag of what refers to data frames.
    std::string explain(const std::exception& error, const serialization::Registry& registry,
                        const std::string& arrayTag) const;

  private:
    struct Note {
        bool tagged = false;
        framing::FrameType type{};
        unsigned long size = 0;
        std::string tag;
    };

    const Note* at(unsigned long index) const noexcept;
    std::string explainBadCast(const std::string& arrayTag) const;

    std::vector<Note> notes_;
    std::size_t count_ = 0;
};

}  // namespace foundation::msg_svc::transport::layers::session
