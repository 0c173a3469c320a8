// Any file as a recording: whatever units are in it can be shown in every form, checked with the rules of sessions and
// redacted, or the file is refused.

#include <algorithm>
#include <cstdint>
#include <optional>
#include <string>
#include <system_error>
#include <utility>

#include "common/RecordingReader.hpp"
#include "input/MemoryFile.hpp"
#include "input/Require.hpp"
#include "krutil/base/ExitCode.hpp"
#include "krutil/base/Options.hpp"
#include "krutil/inspect/InspectedMessage.hpp"
#include "krutil/inspect/Lint.hpp"
#include "krutil/inspect/MessageText.hpp"
#include "krutil/inspect/Redaction.hpp"
#include "krutil/inspect/Timelines.hpp"

namespace {

using krutil_client::InspectedMessage;

// Control characters of a peer must not reach a terminal.
bool isForATerminal(const std::string& text) {
    return std::none_of(text.begin(), text.end(), [](char c) {
        const auto byte = static_cast<unsigned char>(c);
        return (byte < 0x20 && c != '\n') || byte == 0x7F;
    });
}

void show(const InspectedMessage& message, krutil_client::Timelines& timelines) {
    krutil_client::InspectOptions options;
    options.frames = true;
    options.fields = true;
    options.hex = true;
    const std::uint64_t begin = message.first().nanoseconds;
    fuzz::require(isForATerminal(krutil_client::messageText(message, begin, options)),
                  "lines have no control characters of a peer");
    fuzz::require(isForATerminal(krutil_client::messageJson(message, begin, options)),
                  "JSON has no control characters of a peer");
    fuzz::require(isForATerminal(timelines.take(message)), "timelines have no control characters of a peer");
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const fuzz::MemoryFile file(data, size);
    try {
        apps::RecordingReader reader(file.path());
        krutil_client::MessageAssembler messages(true);
        krutil_client::Lint lint;
        krutil_client::Timelines timelines;
        while (auto unit = reader.next()) {
            fuzz::require(unit->bytes.size() <= size, "memory is taken for what is there");
            if (unit->whole()) {
                lint.take(*unit, reader.sessions()[unit->session]);
            }
            apps::RecordedUnit redacted = *unit;
            krutil_client::redact(redacted);
            fuzz::require(redacted.bytes.size() == unit->bytes.size(), "redaction keeps sizes");
            if (const auto message = messages.take(std::move(*unit))) {
                show(*message, timelines);
            }
        }
        for (const InspectedMessage& message : messages.rest()) {
            show(message, timelines);
        }
        timelines.rest();
        static_cast<void>(reader.unfinished());
    } catch (const apps::RecordingError&) {
    } catch (const krutil_client::Failure&) {
    } catch (const std::system_error&) {
    }
    return 0;
}
