// What the ends of a session have said to each other, as a recording has it.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "msg_svc.protobuf.SessionHandshake.pb.h"

namespace krutil_client {

class Interrupt;

/// A frame of a message. A content that was in shared memory is data like any other.
struct SaidFrame {
    bool tagged = false;
    unsigned type = 0;
    std::string tag{};
    std::string content{};
};

/// What an end said at once.
struct Said {
    enum class Kind { Message, Goodbye, Abort };

    Kind kind = Kind::Message;
    std::uint32_t stream = 0;
    std::vector<SaidFrame> frames{};  ///< the root is the last one; of an abort, one whose content is the reason
    std::uint64_t offset = 0;         ///< of its last frame in the recording
    std::uint64_t nanoseconds = 0;    ///< when it was recorded

    /// The tag of the root; empty for what is no message.
    std::string_view tag() const { return frames.empty() ? std::string_view() : frames.back().tag; }
    bool endsExchange() const { return tag() == "krutil:IIPReply" || tag() == "krutil:IIPCancelReply"; }
    bool isText() const { return tag() == "krutil:TextBaseEvent" || tag() == "krutil:SinkTextEvent"; }
};

/// Puts the frames of one direction together.
class Listener {
  public:
    /// Takes a whole frame. Returns what is complete with it; returns and signs of life say nothing. Throws
    /// Failure with ExitCode::Violation for what is no frame.
    std::optional<Said> take(std::string_view frame);

  private:
    std::vector<SaidFrame> frames_;
};

/// The frames of `said` as bytes, numbered from 1. Data is data, wherever it was.
std::string framesOf(const Said& said);

/// One session.
struct Talk {
    struct Sent {
        Said said;
        std::size_t after = 0;  ///< so many of the engine's had been recorded before it
    };

    std::string process;                          ///< that has recorded
    std::string clientHello{};                    ///< the client's first message
    std::string engineHello{};                    ///< the engine's
    msg_svc::protobuf::SessionVerdict verdict{};  ///< of either end; both have settled on the same
    bool wholeFromBeginning = true;               ///< no earlier file has the beginning of the session
    std::vector<Sent> client{};
    std::vector<Said> engine{};
};

/// The sessions of a recording that can be replayed. Throws Failure with a sentence for one that cannot be read, and
/// for one that cannot be replayed: it begins without the handshake, or has frames of which only the beginnings are
/// there. Throws what `interrupt` throws while the file, a pipe perhaps, says nothing.
std::vector<Talk> readTalks(const std::string& file, Interrupt& interrupt);

}  // namespace krutil_client
