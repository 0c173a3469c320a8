// Any file as a recording: whatever units are in it can be shown in every form, as lines and as a page for a browser,
// checked with the rules of sessions and redacted, or the file is refused.

#include <algorithm>
#include <cstdint>
#include <optional>
#include <regex>
#include <set>
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
#include "krutil/inspect/MessagePage.hpp"
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

// What stands between "<" and ">", with the content of rows. Numbers of lanes are as good as each other.
std::set<std::string> markup(const std::string& page) {
    static const std::regex lane("data-lane=\"[0-9]+\"");
    std::set<std::string> found;
    for (std::size_t begin = page.find('<'); begin != std::string::npos; begin = page.find('<', begin + 1)) {
        const std::string tag = page.substr(begin, page.find('>', begin) - begin + 1);
        found.insert(tag.find("data-lane") == std::string::npos ? tag : std::regex_replace(tag, lane, "data-lane"));
    }
    return found;
}

void requireOwnMarkup(const std::string& page) {
    static const std::set<std::string> own = [] {
        std::set<std::string> tags = markup(krutil_client::MessagePage().html({}, "", {"a note"}));
        tags.insert({"<tr data-lane>", "<tr>", "<td>", "</td>", "</tr>"});
        return tags;
    }();
    const std::set<std::string> found = markup(page);
    fuzz::require(std::includes(own.begin(), own.end(), found.begin(), found.end()), "a page has no markup of a peer");
}

void show(const InspectedMessage& message, krutil_client::Timelines& timelines, krutil_client::MessagePage& page) {
    krutil_client::InspectOptions options;
    options.frames = true;
    options.fields = true;
    options.hex = true;
    const std::uint64_t begin = message.first().nanoseconds;
    fuzz::require(isForATerminal(krutil_client::messageText(message, begin, options)),
                  "lines have no control characters of a peer");
    fuzz::require(isForATerminal(krutil_client::messageJson(message, begin, options)),
                  "JSON has no control characters of a peer");
    page.take(message, begin, true);
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
        krutil_client::MessagePage page;
        while (auto unit = reader.next()) {
            fuzz::require(unit->bytes.size() <= size, "memory is taken for what is there");
            if (unit->whole()) {
                lint.take(*unit, reader.sessions()[unit->session]);
            }
            apps::RecordedUnit redacted = *unit;
            krutil_client::redact(redacted);
            fuzz::require(redacted.bytes.size() == unit->bytes.size(), "redaction keeps sizes");
            if (const auto message = messages.take(std::move(*unit))) {
                show(*message, timelines, page);
            }
        }
        for (const InspectedMessage& message : messages.rest()) {
            show(message, timelines, page);
        }
        timelines.rest();
        const std::string html = page.html(reader.sessions(), "<file>", {});
        fuzz::require(isForATerminal(html), "a page has no control characters of a peer");
        requireOwnMarkup(html);
        static_cast<void>(reader.unfinished());
    } catch (const apps::RecordingError&) {
    } catch (const krutil_client::Failure&) {
    } catch (const std::system_error&) {
    }
    return 0;
}
