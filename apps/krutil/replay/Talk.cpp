#include "krutil/replay/Talk.hpp"

#include <algorithm>
#include <array>
#include <system_error>
#include <utility>

#include "common/RecordingReader.hpp"
#include "krutil/base/ExitCode.hpp"

namespace krutil_client {
namespace {

enum FrameKind : unsigned { tagged = 1, data, goodbye, abort, sharedData, giveBack };

constexpr unsigned lastFrame = 0x80;
constexpr std::size_t sizeOfShared = 24;

std::uint64_t littleEndianNumber(std::string_view bytes) {
    std::uint64_t number = 0;
    for (std::size_t i = bytes.size(); i > 0; --i) {
        number = number << 8U | static_cast<unsigned char>(bytes[i - 1]);
    }
    return number;
}

void appendLittleEndian(std::string& bytes, std::uint64_t number, std::size_t size) {
    for (std::size_t i = 0; i < size; ++i) {
        bytes += static_cast<char>(static_cast<unsigned char>(number >> (8 * i)));
    }
}

[[noreturn]] void cannotReplay(const std::string& file, std::uint64_t offset, const std::string& reason) {
    throw Failure(ExitCode::Usage, "cannot replay '" + file + "': byte " + std::to_string(offset) + ": " + reason);
}

// Whether all of a frame had come when its stream ended.
bool isWholeFrame(std::string_view bytes) {
    if (bytes.size() < SaidHeader::size) {
        return false;
    }
    const SaidHeader header = SaidHeader::of(bytes);
    const std::size_t behind = bytes.size() - SaidHeader::size;
    return behind >= header.tagSize && behind - header.tagSize >= header.contentSize;
}

// A session while it is read.
class TalkReader {
  public:
    TalkReader(const std::string& file, const apps::RecordedSession& session) : file_(file) {
        talk_.process = session.process;
    }

    void take(const apps::RecordedUnit& unit) {
        const bool client = unit.sender == apps::RecordedUnit::Role::Client;
        switch (unit.kind) {
            case apps::RecordedUnit::Kind::FirstMessage:
                checkWhole(unit);
                if (client) {
                    talk_.hello = unit.bytes;
                }
                hello_[client ? 0 : 1] = true;
                break;
            case apps::RecordedUnit::Kind::Verdict:
            case apps::RecordedUnit::Kind::Token:
            case apps::RecordedUnit::Kind::Answer:
                break;
            case apps::RecordedUnit::Kind::Frame:
                takeFrame(unit, client);
        }
    }

    Talk finish(std::uint64_t offset) {
        if (!hello_[0] || !hello_[1]) {
            cannotReplay(file_, offset,
                         "expected the first messages of both ends in the session of " + talk_.process +
                             ", got none; the session was over before, or the recording begins later");
        }
        return std::move(talk_);
    }

  private:
    void checkWhole(const apps::RecordedUnit& unit) const {
        if (!unit.whole()) {
            cannotReplay(file_, unit.offset,
                         "expected " + std::to_string(unit.size) + " bytes of a frame, got " +
                             std::to_string(unit.bytes.size()) +
                             "; record without --record-snap, and with a larger --record-size if there is one");
        }
    }

    void takeFrame(const apps::RecordedUnit& unit, bool client) {
        if (!hello_[0] || !hello_[1]) {
            cannotReplay(file_, unit.offset,
                         "expected the first messages of both ends, got a frame; the recording begins later");
        }
        checkWhole(unit);
        if (!isWholeFrame(unit.bytes)) {
            return;
        }
        std::optional<Said> said = listeners_[client ? 0 : 1].take(unit.bytes);
        if (!said) {
            return;
        }
        said->offset = unit.offset;
        said->nanoseconds = unit.nanoseconds;
        if (client) {
            talk_.client.push_back({std::move(*said), talk_.engine.size()});
        } else {
            talk_.engine.push_back(std::move(*said));
        }
    }

    const std::string& file_;
    Talk talk_;
    std::array<bool, 2> hello_{};
    std::array<Listener, 2> listeners_;
};

}  // namespace

SaidHeader SaidHeader::of(std::string_view frame) {
    const auto first = static_cast<unsigned char>(frame[0]);
    return {first & (lastFrame - 1),
            (first & lastFrame) != 0,
            static_cast<unsigned char>(frame[1]),
            static_cast<std::uint32_t>(littleEndianNumber(frame.substr(4, 4))),
            static_cast<std::size_t>(littleEndianNumber(frame.substr(2, 2))),
            littleEndianNumber(frame.substr(16, 8))};
}

std::optional<Said> Listener::take(std::string_view frame) {
    const SaidHeader header = SaidHeader::of(frame);
    const std::string_view behind = frame.substr(SaidHeader::size);
    const std::string_view tag = behind.substr(0, header.tagSize);
    const std::string_view content = behind.substr(tag.size());
    switch (header.kind) {
        case tagged:
        case data:
            frames_.push_back({header.kind == tagged, header.type, std::string(tag), std::string(content)});
            break;
        case sharedData:
            frames_.push_back(
                {false, header.type, {}, std::string(content.substr(std::min(sizeOfShared, content.size())))});
            break;
        case goodbye:
            return Said{Said::Kind::Goodbye, 0, {}, 0, 0};
        case abort:
            return Said{Said::Kind::Abort, 0, {{false, 0, {}, std::string(content)}}, 0, 0};
        case giveBack:
            return std::nullopt;
        default:
            throw Failure(ExitCode::Violation, "frame kind: expected 1 to 6, got " + std::to_string(header.kind));
    }
    if (!header.last) {
        return std::nullopt;
    }
    return Said{Said::Kind::Message, header.stream, std::exchange(frames_, {}), 0, 0};
}

std::string framesOf(const Said& said) {
    std::string bytes;
    if (said.kind == Said::Kind::Goodbye) {
        bytes += static_cast<char>(goodbye);
        bytes.append(SaidHeader::size - 1, '\0');
        return bytes;
    }
    for (std::size_t i = 0; i < said.frames.size(); ++i) {
        const SaidFrame& frame = said.frames[i];
        const unsigned last = i + 1 == said.frames.size() ? lastFrame : 0U;
        bytes += static_cast<char>((frame.tagged ? tagged : data) | last);
        bytes += static_cast<char>(frame.type);
        appendLittleEndian(bytes, frame.tag.size(), 2);
        appendLittleEndian(bytes, said.stream, 4);
        appendLittleEndian(bytes, i + 1, 8);
        appendLittleEndian(bytes, frame.content.size(), 8);
        bytes += frame.tag;
        bytes += frame.content;
    }
    return bytes;
}

std::vector<Talk> readTalks(const std::string& file) {
    std::vector<TalkReader> readers;
    std::uint64_t last = 0;
    try {
        apps::RecordingReader reader(file);
        while (const auto unit = reader.next()) {
            for (std::size_t i = readers.size(); i <= unit->session; ++i) {
                readers.emplace_back(file, reader.sessions()[i]);
            }
            readers[unit->session].take(*unit);
            last = unit->offset;
        }
    } catch (const apps::RecordingError& error) {
        throw Failure(ExitCode::Usage, error.what());
    } catch (const std::system_error& error) {
        throw Failure(ExitCode::Usage, error.what());
    }
    std::vector<Talk> talks;
    talks.reserve(readers.size());
    for (TalkReader& reader : readers) {
        talks.push_back(reader.finish(last));
    }
    if (talks.empty()) {
        cannotReplay(file, last, "expected a session, got none");
    }
    return talks;
}

}  // namespace krutil_client
