// Recordings of sessions, in the format pcapng. docs/recording.md describes the file.
#pragma once

#include <cstdint>
#include <ctime>
#include <functional>
#include <limits>
#include <mutex>
#include <optional>
#include <string>

#include "common/OwnFile.hpp"
#include "common/PcapngBlocks.hpp"
#include "common/RecordedState.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionConfig.hpp"

namespace apps {

/// What a command line asks for about recordings.
struct RecordOptions {
    std::string file;  ///< empty for no recording
    std::uint64_t snap =
        std::numeric_limits<std::uint64_t>::max();  ///< bytes of a frame that are kept; its header always is
    std::uint64_t size = 0;  ///< bytes of a file at most; 0 for as many as come, otherwise `smallestSize` or more
    static constexpr std::uint64_t smallestSize = 1'048'576;
};

/// Writes the units of sessions to a file, each as soon as it is there: what ends the program ends no recording early.
/// One session at a time; a second one of the same process begins another section of the file.
///
/// With a size, a file that would become larger is renamed to its name with ".1" behind, in the place of an earlier
/// one, and another is begun. That repeats what a reader needs of the one before (RecordedState). A frame that does not
/// even fit into a file of its own is cut.
///
/// When the file cannot be written, `complain` is told once, in a sentence, and the recording ends with its last whole
/// packet. The session goes on. `complain` must not use the session.
class Recording final : public foundation::msg_svc::transport::layers::session::SessionRecorder {
  public:
    using Role = foundation::msg_svc::transport::layers::session::Role;

    /// Creates the file for this user alone, or empties one that is there and is this user's; see openOwnFile(). Throws
    /// std::runtime_error with a sentence.
    Recording(const RecordOptions& options, std::function<void(const std::string&)> complain);

    /// A session begins in which this process has that role; `build` names the program. To be called before its
    /// handshake.
    void beginSession(Role role, const std::string& build);

    void record(Direction direction, Part part, std::span<const iovec> unit) noexcept override;

    /// Whether all could be written so far. May be called from any thread.
    bool isComplete() const;

    /// The time of a packet; another one makes packets repeatable.
    using Clock = std::function<timespec()>;
    void setClock(Clock clock) { clock_ = std::move(clock); }

  private:
    void recordUnit(Direction direction, Part part, std::span<const iovec> unit);
    bool makeRoom(std::uint64_t bytes);
    void repeatState();
    void writeSection(std::optional<std::size_t> repeated);
    void writeUnit(const pcapng::Unit& unit);
    void write();
    void end(const std::string& reason);

    const std::string file_;
    const std::string path_;  ///< the same wherever the process goes
    const std::uint64_t snap_;
    const std::uint64_t limit_;  ///< bytes of a file; 0 for none
    const std::function<void(const std::string&)> complain_;
    Clock clock_;
    OwnFile opened_;  ///< a regular one can be cut

    mutable std::mutex mutex_;
    std::string block_;                   ///< that is being written; its memory is kept for the next one
    std::uint64_t written_ = 0;           ///< bytes of whole blocks in this file
    bool fresh_ = true;                   ///< this file has nothing yet that the one before has not
    std::optional<RecordedState> state_;  ///< with a limit
    Role role_ = Role::Client;            ///< of the session
    std::string build_;                   ///< of the session
    bool complete_ = true;
};

}  // namespace apps
