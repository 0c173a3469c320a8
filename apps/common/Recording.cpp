#include "common/Recording.hpp"

#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <stdexcept>
#include <system_error>
#include <utility>

#include "common/Pcapng.hpp"
#include "foundation/core/posix/writeFully.hpp"

namespace apps {
namespace {

// So much is always kept of a frame.
constexpr std::uint64_t frameHeader = 24;

constexpr std::uint64_t largestPart = pcapng::longestPacket - pcapng::tags.size();

// Errors have the name that the user gave.
OwnFile openRecording(const std::string& path, const std::string& name) {
    return openOwnFile(path, Begin::Empty, "cannot record to '" + name + "'");
}

timespec now() {
    timespec time{};
    ::clock_gettime(CLOCK_REALTIME, &time);
    return time;
}

// Bytes that so many bytes of a unit take in a file besides themselves, at most.
std::uint64_t overheadOf(std::uint64_t kept) {
    return (kept / largestPart + 1) * RecordedState::overhead;
}

// The memory for frames that are repeated: what is left of a file is most of it.
std::uint64_t boundOfState(std::uint64_t limit) {
    return std::min<std::uint64_t>(limit / 4, 4'194'304);
}

}  // namespace

Recording::Recording(const RecordOptions& options, std::function<void(const std::string&)> complain)
    : file_(options.file),
      path_(std::filesystem::absolute(options.file)),
      snap_(std::max(options.snap, frameHeader)),
      limit_(options.size),
      complain_(std::move(complain)),
      clock_(now),
      opened_(openRecording(path_, file_)) {
    if (limit_ != 0) {
        if (!opened_.regular) {
            throw std::runtime_error(
                "cannot record to '" + file_ +
                "': expected a regular file, because its size is bounded; leave out --record-size");
        }
        state_.emplace(boundOfState(limit_));
    }
    // Nothing that happens while a packet is written needs much memory.
    block_.reserve(pcapng::longestPacket + 256);
}

void Recording::beginSession(Role role, const std::string& build) {
    const std::lock_guard lock(mutex_);
    role_ = role;
    build_ = build;
    try {
        if (state_) {
            state_->beginSession(role);
            makeRoom(build.size() + RecordedState::overhead);
        }
        writeSection(std::nullopt);
    } catch (const std::exception& error) {
        end(error.what());
    }
}

// With the mutex held. The first `repeated` units of the section were in an earlier file; without, a session begins.
void Recording::writeSection(std::optional<std::size_t> repeated) {
    pcapng::makeSection(
        block_,
        repeated ? "continued: repeats " + std::to_string(*repeated) + " packets of an earlier file" : std::string(),
        build_, (role_ == Role::Client ? "client " : "engine ") + std::to_string(::getpid()));
    write();
}

void Recording::record(Direction direction, Part part, std::span<const iovec> unit) noexcept {
    const std::lock_guard lock(mutex_);
    if (!complete_) {
        return;
    }
    try {
        recordUnit(direction, part, unit);
    } catch (const std::exception& error) {
        end(error.what());
    }
}

// With the mutex held.
void Recording::recordUnit(Direction direction, Part part, std::span<const iovec> unit) {
    std::uint64_t size = 0;
    for (const iovec& piece : unit) {
        size += piece.iov_len;
    }
    std::uint64_t kept = part == Part::Frame ? std::min(size, snap_) : size;
    const timespec time = clock_();
    const auto nanoseconds =
        static_cast<std::uint64_t>(time.tv_sec) * 1'000'000'000U + static_cast<std::uint64_t>(time.tv_nsec);
    if (state_) {
        if (makeRoom(kept + overheadOf(kept))) {
            repeatState();
        }
        const std::uint64_t room = limit_ - written_;
        if (kept + overheadOf(kept) > room) {
            kept = room - overheadOf(room);
        }
    }
    writeUnit({direction == Direction::Sent, nanoseconds, unit, kept, size});
    fresh_ = false;
    if (state_) {
        state_->note(direction, part, nanoseconds, unit, size);
    }
}

// With the mutex held. Begins another file unless so many bytes fit into this one, or it would not help. Returns
// whether there is another one. Throws what the system refuses.
bool Recording::makeRoom(std::uint64_t bytes) {
    if (fresh_ || bytes <= limit_ - written_) {
        return false;
    }
    if (std::rename(path_.c_str(), (path_ + ".1").c_str()) != 0) {
        throw std::system_error(errno, std::generic_category(), "cannot rename '" + file_ + "' to '" + file_ + ".1'");
    }
    opened_ = openRecording(path_, file_);
    written_ = 0;
    fresh_ = true;
    return true;
}

// With the mutex held. The session goes on in another file.
void Recording::repeatState() {
    const auto units = state_->units();
    writeSection(units.size());
    for (const RecordedState::Unit* unit : units) {
        std::string bytes = unit->bytes;
        const std::uint64_t kept =
            unit->part == Part::Frame ? std::min<std::uint64_t>(bytes.size(), snap_) : bytes.size();
        const iovec piece{bytes.data(), bytes.size()};
        writeUnit({unit->direction == Direction::Sent, unit->nanoseconds, {&piece, 1}, kept, unit->size});
    }
}

// With the mutex held.
void Recording::writeUnit(const pcapng::Unit& unit) {
    for (std::uint64_t first = 0; first < unit.kept && complete_;) {
        first += pcapng::makePacket(block_, unit, first);
        write();
    }
}

// With the mutex held.
void Recording::write() {
    if (!complete_) {
        return;
    }
    if (foundation::core::posix::writeFully(opened_.descriptor.get(), block_)) {
        written_ += block_.size();
        return;
    }
    const std::string reason = std::generic_category().message(errno);
    // Readers take a part of a block for damage. Where that cannot be undone, they still read what is before it.
    if (opened_.regular && ::ftruncate(opened_.descriptor.get(), static_cast<off_t>(written_)) != 0) {
        opened_.regular = false;
    }
    end("cannot write to '" + file_ + "': " + reason);
}

// With the mutex held.
void Recording::end(const std::string& reason) {
    if (std::exchange(complete_, false)) {
        complain_(reason + "; the recording ends here");
    }
}

bool Recording::isComplete() const {
    const std::lock_guard lock(mutex_);
    return complete_;
}

}  // namespace apps
