#include "krutil/replay/Talk.hpp"

#include <algorithm>
#include <array>
#include <system_error>
#include <utility>

#include "common/FrameBytes.hpp"
#include "common/RecordingReader.hpp"
#include "krutil/base/ExitCode.hpp"
#include "krutil/base/Interrupt.hpp"

namespace krutil_client {
namespace {

using apps::FrameHeader;
using apps::FrameKind;
using foundation::vantor::carrier::framing::FrameType;

// In front of a content that was in shared memory.
constexpr std::size_t sizeOfSharedPlace = 24;
constexpr std::size_t sizeOfVerdictHead = 4;

[[noreturn]] void cannotReplay(const std::string& file, std::uint64_t offset, const std::string& reason) {
    throw Failure(ExitCode::Usage, "cannot replay '" + file + "': byte " + std::to_string(offset) + ": " + reason);
}

// Whether all of a frame had come when its stream ended.
bool isWholeFrame(std::string_view bytes) {
    if (bytes.size() < FrameHeader::size) {
        return false;
    }
    const FrameHeader header = apps::headerOf(bytes);
    const std::size_t behind = bytes.size() - FrameHeader::size;
    return behind >= header.tagSize && behind - header.tagSize >= header.contentSize;
}

// A session while it is read.
class TalkReader {
  public:
    TalkReader(const std::string& file, const apps::RecordedSession& session) : file_(file) {
        talk_.process = session.process;
        talk_.wholeFromBeginning = !session.repeated;
    }

    void take(const apps::RecordedUnit& unit) {
        const bool client = unit.sender == apps::RecordedUnit::Role::Client;
        switch (unit.kind) {
            case apps::RecordedUnit::Kind::FirstMessage:
                checkWhole(unit);
                (client ? talk_.clientHello : talk_.engineHello) = unit.bytes;
                break;
            case apps::RecordedUnit::Kind::Verdict:
                // One that cannot be read accepts nothing.
                static_cast<void>(
                    talk_.verdict.ParseFromString(unit.bytes.substr(std::min(sizeOfVerdictHead, unit.bytes.size()))));
                break;
            case apps::RecordedUnit::Kind::Token:
            case apps::RecordedUnit::Kind::Answer:
                break;
            case apps::RecordedUnit::Kind::Frame:
                takeFrame(unit, client);
        }
    }

    Talk finish(std::uint64_t offset) {
        if (!shookHands()) {
            cannotReplay(file_, offset,
                         "expected the first messages of both ends in the session of " + talk_.process +
                             ", got none; the session was over before, or the recording begins later");
        }
        return std::move(talk_);
    }

  private:
    bool shookHands() const { return !talk_.clientHello.empty() && !talk_.engineHello.empty(); }

    void checkWhole(const apps::RecordedUnit& unit) const {
        if (!unit.whole()) {
            cannotReplay(file_, unit.offset,
                         "expected " + std::to_string(unit.size) + " bytes of a frame, got " +
                             std::to_string(unit.bytes.size()) +
                             "; record without --record-snap, and with a larger --record-size if there is one");
        }
    }

    void takeFrame(const apps::RecordedUnit& unit, bool client) {
        if (!shookHands()) {
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
    std::array<Listener, 2> listeners_;
};

}  // namespace

std::optional<Said> Listener::take(std::string_view frame) {
    const FrameHeader header = apps::headerOf(frame);
    const std::string_view behind = frame.substr(FrameHeader::size);
    const std::string_view tag = behind.substr(0, header.tagSize);
    const std::string_view content = behind.substr(tag.size());
    const auto type = static_cast<unsigned>(header.type);
    switch (static_cast<FrameKind>(header.kind)) {
        case FrameKind::Tagged:
            frames_.push_back({true, type, std::string(tag), std::string(content)});
            break;
        case FrameKind::Data:
            frames_.push_back({false, type, {}, std::string(content)});
            break;
        case FrameKind::SharedData:
            frames_.push_back(
                {false, type, {}, std::string(content.substr(std::min(sizeOfSharedPlace, content.size())))});
            break;
        case FrameKind::Goodbye:
            return Said{Said::Kind::Goodbye, 0, {}, 0, 0};
        case FrameKind::Abort:
            return Said{Said::Kind::Abort, 0, {{false, 0, {}, std::string(content)}}, 0, 0};
        case FrameKind::Return:
        case FrameKind::KeepAlive:
            return std::nullopt;
        default:
            throw Failure(ExitCode::Violation, "frame kind: expected 1 to 7, got " + std::to_string(header.kind));
    }
    if (!header.last) {
        return std::nullopt;
    }
    return Said{Said::Kind::Message, header.stream, std::exchange(frames_, {}), 0, 0};
}

std::string framesOf(const Said& said) {
    const auto bytesOf = [](const FrameHeader& header) {
        const FrameHeader::Bytes bytes = encode(header);
        return std::string(bytes.begin(), bytes.end());
    };
    if (said.kind == Said::Kind::Goodbye) {
        FrameHeader header;
        header.kind = static_cast<std::uint8_t>(FrameKind::Goodbye);
        return bytesOf(header);
    }
    std::string bytes;
    for (std::size_t i = 0; i < said.frames.size(); ++i) {
        const SaidFrame& frame = said.frames[i];
        bytes += bytesOf({static_cast<std::uint8_t>(frame.tagged ? FrameKind::Tagged : FrameKind::Data),
                          i + 1 == said.frames.size(), static_cast<FrameType>(frame.type),
                          static_cast<std::uint16_t>(frame.tag.size()), said.stream, i + 1, frame.content.size()});
        bytes += frame.tag;
        bytes += frame.content;
    }
    return bytes;
}

std::vector<Talk> readTalks(const std::string& file, Interrupt& interrupt) {
    std::vector<TalkReader> readers;
    std::uint64_t last = 0;
    try {
        apps::RecordingReader reader(file, [&interrupt](int fd) { interrupt.waitForInput(fd); });
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
