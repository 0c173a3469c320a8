// What is repeated at the beginning of a later file of a recording.
#pragma once

#include <sys/uio.h>

#include <array>
#include <cstdint>
#include <map>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "foundation/msg_svc/transport/layers/session/SessionConfig.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionRecorder.hpp"

namespace apps {

/// Keeps what a reader needs to understand the units that follow: the handshake; the message that began each open
/// exchange, and the events that tell how far that is; what has come of messages that are not complete; the goodbye.
///
/// Frames of up to `wholeFrame` bytes are kept whole, of others the header and the tag. The memory for frames is
/// bounded: beyond the bound, messages are left out. Not synchronised.
class RecordedState {
  public:
    using Role = foundation::msg_svc::transport::layers::session::Role;
    using Direction = foundation::msg_svc::transport::layers::session::SessionRecorder::Direction;
    using Part = foundation::msg_svc::transport::layers::session::SessionRecorder::Part;

    static constexpr std::uint64_t wholeFrame = 65'536;
    /// What a unit takes in a file besides its own bytes, at most.
    static constexpr std::uint64_t overhead = 160;

    struct Unit {
        std::uint64_t number = 0;  ///< ascending in the order of the recording
        Direction direction = Direction::Received;
        Part part = Part::Frame;
        std::uint64_t nanoseconds = 0;
        std::uint64_t size = 0;  ///< of the unit; fewer bytes may be kept
        std::string bytes;
    };

    /// Frames take at most `bound` bytes, here and in a file.
    explicit RecordedState(std::uint64_t bound) noexcept : bound_(bound) {}

    /// Another session begins, in which the recording process has this role.
    void beginSession(Role role);

    /// A unit was recorded.
    void note(Direction direction, Part part, std::uint64_t nanoseconds, std::span<const iovec> unit,
              std::uint64_t size);

    /// What is kept, in the order of the recording. Valid until the next call.
    std::vector<const Unit*> units() const;

  private:
    using Units = std::vector<Unit>;

    // The frames of a direction's message that is not complete.
    struct Begun {
        Units frames{};
        bool leftOut = false;  ///< there was no room for one of them
    };

    bool keep(Unit unit, std::span<const iovec> bytes, std::uint64_t head, Units& where);
    void drop(Units& units);
    void clientSaid(std::uint32_t stream, Begun& message);
    void engineSaid(std::uint32_t stream, const std::string& tag, Unit unit, std::span<const iovec> bytes,
                    std::uint64_t head);

    std::uint64_t bound_;
    std::uint64_t used_ = 0;
    std::uint64_t lastNumber_ = 0;
    Direction fromClient_ = Direction::Received;
    Units handshake_{};
    std::array<Begun, 2> begun_{};              ///< from the client, from the engine
    std::map<std::uint32_t, Units> exchanges_;  ///< that are open, by stream
    Units goodbye_{};
};

}  // namespace apps
