#include "common/RecordedState.hpp"

#include <algorithm>
#include <string_view>
#include <utility>

#include "common/FrameBytes.hpp"

namespace apps {
namespace {

// Tags are shorter, unless a peer's limit was raised.
constexpr std::uint64_t longestTag = 128;

// What an event of an engine means for the state of its exchange.
enum class Meaning { Nothing, State, Loop, Resumed, Reply };

Meaning meaningOf(std::string_view tag) {
    static const std::map<std::string_view, Meaning> meanings{
        {"krutil:IIPStartedEvent", Meaning::State},   {"krutil:IIPDiscardedEvent", Meaning::State},
        {"krutil:IIPCompletedEvent", Meaning::State}, {"krutil:detail::LastIIPEvent", Meaning::State},
        {"krutil:IIPSuspendedEvent", Meaning::Loop},  {"krutil:DebugLoopEvent", Meaning::Loop},
        {"krutil:IIPResumedEvent", Meaning::Resumed}, {"krutil:IIPReply", Meaning::Reply},
        {"krutil:IIPCancelReply", Meaning::Reply},
    };
    const auto found = meanings.find(tag);
    return found == meanings.end() ? Meaning::Nothing : found->second;
}

// The first `count` bytes, or as many as there are.
std::string firstBytes(std::span<const iovec> unit, std::uint64_t count) {
    std::string bytes;
    for (const iovec& piece : unit) {
        const std::uint64_t taken = std::min<std::uint64_t>(count - bytes.size(), piece.iov_len);
        bytes.append(static_cast<const char*>(piece.iov_base), taken);
    }
    return bytes;
}

std::string tagOf(const std::string& frame) {
    return frame.substr(FrameHeader::size, headerOf(frame).tagSize);
}

std::uint64_t costOf(const RecordedState::Unit& unit) {
    return unit.bytes.size() + RecordedState::overhead;
}

}  // namespace

void RecordedState::beginSession(Role role) {
    *this = RecordedState(bound_);
    fromClient_ = role == Role::Client ? Direction::Sent : Direction::Received;
}

void RecordedState::note(Direction direction, Part part, std::uint64_t nanoseconds, std::span<const iovec> unit,
                         std::uint64_t size) {
    Unit kept{++lastNumber_, direction, part, nanoseconds, size, {}};
    if (part == Part::Handshake) {
        kept.bytes = firstBytes(unit, size);
        handshake_.push_back(std::move(kept));
        return;
    }
    const std::string begin = firstBytes(unit, FrameHeader::size + longestTag);
    if (begin.size() < FrameHeader::size) {
        return;
    }
    const FrameHeader header = headerOf(begin);
    const std::uint64_t head = std::min<std::uint64_t>(begin.size(), FrameHeader::size + header.tagSize);
    const bool client = direction == fromClient_;
    switch (static_cast<FrameKind>(header.kind)) {
        case FrameKind::Tagged:
        case FrameKind::Data:
        case FrameKind::SharedData:
            break;
        case FrameKind::Goodbye:
            keep(kept, unit, head, goodbye_);
            return;
        default:
            return;
    }
    Begun& message = begun_[client ? 0 : 1];
    if (!header.last || client) {
        message.leftOut = message.leftOut || !keep(kept, unit, head, message.frames);
        if (message.leftOut) {
            drop(message.frames);
        }
    }
    if (!header.last) {
        return;
    }
    if (client) {
        clientSaid(header.stream, message);
    } else {
        drop(message.frames);
        engineSaid(header.stream, tagOf(begin), std::move(kept), unit, head);
    }
    message.leftOut = false;
}

// The message is complete. Without a stream it is an event, which begins nothing.
void RecordedState::clientSaid(std::uint32_t stream, Begun& message) {
    if (stream == 0 || message.leftOut || exchanges_.contains(stream)) {
        drop(message.frames);
    } else {
        exchanges_[stream] = std::exchange(message.frames, {});
    }
}

void RecordedState::engineSaid(std::uint32_t stream, const std::string& tag, Unit unit, std::span<const iovec> bytes,
                               std::uint64_t head) {
    const auto exchange = exchanges_.find(stream);
    if (exchange == exchanges_.end()) {
        return;
    }
    switch (meaningOf(tag)) {
        case Meaning::Nothing:
            break;
        case Meaning::State:
        case Meaning::Loop:
            keep(std::move(unit), bytes, head, exchange->second);
            break;
        case Meaning::Resumed: {
            // As if the prompt had never been there.
            const auto isOver = [](const Unit& kept) { return meaningOf(tagOf(kept.bytes)) == Meaning::Loop; };
            for (const Unit& kept : exchange->second) {
                used_ -= isOver(kept) ? costOf(kept) : 0;
            }
            std::erase_if(exchange->second, isOver);
            break;
        }
        case Meaning::Reply:
            drop(exchange->second);
            exchanges_.erase(exchange);
            break;
    }
}

// Returns whether there was room. `head` bytes are the header and the tag.
bool RecordedState::keep(Unit unit, std::span<const iovec> bytes, std::uint64_t head, Units& where) {
    for (const std::uint64_t count : {unit.size <= wholeFrame ? unit.size : head, head}) {
        if (used_ + count + overhead <= bound_) {
            unit.bytes = firstBytes(bytes, count);
            used_ += costOf(unit);
            where.push_back(std::move(unit));
            return true;
        }
    }
    return false;
}

void RecordedState::drop(Units& units) {
    for (const Unit& unit : units) {
        used_ -= costOf(unit);
    }
    units.clear();
}

std::vector<const RecordedState::Unit*> RecordedState::units() const {
    std::vector<const Unit*> all;
    const auto add = [&all](const Units& units) {
        for (const Unit& unit : units) {
            all.push_back(&unit);
        }
    };
    add(handshake_);
    for (const auto& [stream, frames] : exchanges_) {
        add(frames);
    }
    for (const Begun& message : begun_) {
        add(message.frames);
    }
    add(goodbye_);
    std::sort(all.begin(), all.end(), [](const Unit* left, const Unit* right) { return left->number < right->number; });
    return all;
}

}  // namespace apps
