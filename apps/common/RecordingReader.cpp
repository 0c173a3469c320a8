#include "common/RecordingReader.hpp"

#include <algorithm>
#include <charconv>
#include <utility>

namespace apps {
namespace {

using UnitKind = RecordedUnit::Kind;

constexpr std::string_view magic = "\x89KRUTIL\n";

// "PREFIX NUMBER", both taken away from the front of `text`.
bool takeNumber(std::string_view& text, std::string_view prefix, std::uint64_t& number) {
    if (!text.starts_with(prefix)) {
        return false;
    }
    text.remove_prefix(prefix.size());
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
    text.remove_prefix(static_cast<std::size_t>(end - text.data()));
    return error == std::errc();
}

// Of a session that an earlier file began.
std::optional<std::uint64_t> repeatedPackets(std::string_view comment) {
    std::uint64_t count = 0;
    return takeNumber(comment, "continued: repeats ", count) ? std::optional(count) : std::nullopt;
}

UnitKind kindOf(unsigned place, std::uint64_t size) {
    switch (place) {
        case 1:
            return UnitKind::FirstMessage;
        case 2:
            return UnitKind::Verdict;
        case 3:
            return size == 8 ? UnitKind::Token : UnitKind::Frame;
        case 4:
            return size == 1 ? UnitKind::Answer : UnitKind::Frame;
        default:
            return UnitKind::Frame;
    }
}

RecordedUnit::Role otherThan(RecordedUnit::Role role) {
    return role == RecordedUnit::Role::Client ? RecordedUnit::Role::Engine : RecordedUnit::Role::Client;
}

std::string rangeText(std::uint64_t first, std::uint64_t size) {
    return "bytes from " + std::to_string(first) + " on of " + std::to_string(size);
}

}  // namespace

RecordingReader::RecordingReader(const std::string& file, std::function<void(int)> wait, std::uint64_t keep)
    : packets_(file, std::move(wait)), keep_(keep) {}

// Which bytes of its unit a packet has: its comment says so, one without such a comment is a unit.
RecordingReader::Part RecordingReader::partOf(const PcapngReader::Packet& packet) const {
    for (const std::string& comment : packet.comments) {
        std::string_view text = comment;
        std::uint64_t first = 0;
        std::uint64_t last = 0;
        std::uint64_t size = 0;
        if (takeNumber(text, "bytes ", first) && takeNumber(text, "-", last) && takeNumber(text, " of ", size) &&
            text.empty()) {
            if (last < first || last - first != packet.data.size() - 1 || last >= size) {
                packets_.fail(packet.offset,
                              "comment of a packet with " + std::to_string(packet.data.size()) + " bytes of a unit",
                              "its first and last byte, below the size", "\"" + comment + "\"");
            }
            return {first, size};
        }
    }
    return {0, packet.data.size() + packet.missing};
}

void RecordingReader::addSessions() {
    for (std::size_t i = sessions_.size(); i < packets_.interfaces().size(); ++i) {
        const PcapngReader::Interface& interface = packets_.interfaces()[i];
        sessions_.push_back(
            {interface.name.starts_with("engine ") ? RecordedUnit::Role::Engine : RecordedUnit::Role::Client,
             interface.name, interface.program, repeatedPackets(interface.comment)});
    }
    streams_.resize(sessions_.size());
}

RecordingReader::Stream& RecordingReader::streamOf(const PcapngReader::Packet& packet) {
    return streams_[packet.interface][packet.outbound ? 1 : 0];
}

RecordedUnit RecordingReader::begin(const PcapngReader::Packet& packet, std::uint64_t size) {
    const std::string& process = packets_.interfaces()[packet.interface].name;
    if (!process.starts_with("client ") && !process.starts_with("engine ")) {
        packets_.fail(packet.offset, "name of the packet's interface", "\"client PID\" or \"engine PID\"",
                      "\"" + process + "\"");
    }
    Stream& stream = streamOf(packet);
    stream.units = packet.data.starts_with(magic) ? 1 : std::min(stream.units, 4U) + 1;
    stream.there = 0;
    RecordedUnit unit;
    unit.session = packet.interface;
    unit.kind = kindOf(stream.units, size);
    unit.direction = packet.outbound ? RecordedUnit::Direction::Sent : RecordedUnit::Direction::Received;
    const RecordedUnit::Role recorder = sessions_[packet.interface].recorder;
    unit.sender = packet.outbound ? recorder : otherThan(recorder);
    unit.nanoseconds = packet.nanoseconds;
    unit.offset = packet.offset;
    unit.size = size;
    return unit;
}

std::optional<RecordedUnit> RecordingReader::next() {
    while (const auto packet = packets_.next()) {
        addSessions();
        const Part part = partOf(*packet);
        Stream& stream = streamOf(*packet);
        const std::uint64_t expected = stream.open ? stream.there : 0;
        if (part.first != expected || (stream.open && part.size != stream.open->size)) {
            packets_.fail(packet->offset,
                          stream.open
                              ? "packet behind a part of the unit at byte " + std::to_string(stream.open->offset)
                              : "first packet of a unit",
                          stream.open ? rangeText(expected, stream.open->size) : "bytes from 0 on",
                          rangeText(part.first, part.size));
        }
        if (!stream.open) {
            stream.open = begin(*packet, part.size);
        }
        RecordedUnit& unit = *stream.open;
        unit.bytes += packet->data.substr(0, keep_ - std::min<std::uint64_t>(keep_, unit.bytes.size()));
        stream.there += packet->data.size();
        if (packet->missing > 0 || stream.there == unit.size) {
            unit.missing = unit.size - stream.there;
            return std::exchange(stream.open, std::nullopt);
        }
    }
    return std::nullopt;
}

std::optional<std::string> RecordingReader::unfinished() const {
    if (!packets_.atBoundary()) {
        return "the recording ends within a block, at byte " + std::to_string(packets_.size());
    }
    for (const auto& session : streams_) {
        for (const Stream& stream : session) {
            if (stream.open) {
                return "the recording ends within a unit, at byte " + std::to_string(packets_.size()) +
                       ": the one at byte " + std::to_string(stream.open->offset) + " has " +
                       std::to_string(stream.there) + " of " + std::to_string(stream.open->size) + " bytes";
            }
        }
    }
    return std::nullopt;
}

}  // namespace apps
