// Reads recordings of sessions: packets put together to what the ends of a session have said. docs/recording.md
// describes the file.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <limits>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "common/PcapngReader.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionConfig.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionRecorder.hpp"

namespace apps {

/// What an end of a session handed to the stream at once.
struct RecordedUnit {
    using Role = foundation::msg_svc::transport::layers::session::Role;
    using Direction = foundation::msg_svc::transport::layers::session::SessionRecorder::Direction;

    /// What it is by its place in its direction: the ones of the handshake come first, and a token has 8 bytes, an
    /// answer 1.
    enum class Kind { FirstMessage, Verdict, Token, Answer, Frame };

    std::size_t session = 0;  ///< position in RecordingReader::sessions()
    Kind kind = Kind::Frame;
    Direction direction = Direction::Sent;  ///< as the process saw it that has recorded
    Role sender = Role::Client;
    std::uint64_t nanoseconds = 0;  ///< time of its first packet, since 1970, UTC
    std::uint64_t offset = 0;       ///< in the file, of the block of its first packet
    std::string bytes;              ///< a frame with shared memory is followed by the content there
    std::uint64_t size = 0;         ///< bytes that it had
    std::uint64_t missing = 0;      ///< of these, bytes at its end that were not recorded

    /// Whether `bytes` is all of it.
    bool whole() const noexcept { return bytes.size() == size; }
};

/// A session, as one process saw it.
struct RecordedSession {
    RecordedUnit::Role recorder = RecordedUnit::Role::Client;  ///< the end that has recorded
    std::string process;                                       ///< "client PID" or "engine PID"
    std::string program;                                       ///< with its version; empty if the file does not say
    std::optional<std::uint64_t> repeated{};  ///< of a session that an earlier file began: packets that it has as well
};

/// Reads units in the order in which they are complete in the file. Text in what it returns is as the file has it.
///
///     RecordingReader reader(file);
///     while (auto unit = reader.next()) { ... }
///     if (auto sentence = reader.unfinished()) { ... }
///
/// Memory is taken for bytes that are there, not for what a size claims: the bytes of one unit in each direction. Not
/// synchronised.
class RecordingReader {
  public:
    /// "-" reads standard input. `wait` is called with the descriptor before each read, which may block otherwise;
    /// empty for nothing. Of each unit the first `keep` bytes are kept. Throws std::system_error with a sentence.
    explicit RecordingReader(const std::string& file, std::function<void(int)> wait = nullptr,
                             std::uint64_t keep = std::numeric_limits<std::uint64_t>::max());

    /// The next unit; empty at the end of what is there. A later call goes on when there is more. Throws
    /// RecordingError, and std::system_error when the file cannot be read.
    std::optional<RecordedUnit> next();

    /// All that units were returned of so far, in the order of the file.
    const std::vector<RecordedSession>& sessions() const noexcept { return sessions_; }

    /// In a sentence, what the end of the file has cut: a file that is still written to, or that a full disk has ended,
    /// ends anywhere. Empty when it ends behind a unit. To be asked when next() has returned nothing.
    std::optional<std::string> unfinished() const;

    /// How errors call the file.
    const std::string& name() const noexcept { return packets_.name(); }

  private:
    struct Part {
        std::uint64_t first;
        std::uint64_t size;  ///< of the unit
    };
    struct Stream {
        unsigned units = 0;  ///< since the last first message, it included
        std::optional<RecordedUnit> open;
        std::uint64_t there = 0;  ///< bytes of the open unit, kept or not
    };

    Part partOf(const PcapngReader::Packet& packet) const;
    void addSessions();
    RecordedUnit begin(const PcapngReader::Packet& packet, std::uint64_t size);
    Stream& streamOf(const PcapngReader::Packet& packet);

    PcapngReader packets_;
    const std::uint64_t keep_;
    std::vector<RecordedSession> sessions_;
    std::vector<std::array<Stream, 2>> streams_;  ///< by session and direction
};

}  // namespace apps
