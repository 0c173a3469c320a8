#include "krutil/inspect/MessageText.hpp"

#include <google/protobuf/message.h>
#include <google/protobuf/text_format.h>
#include <google/protobuf/util/json_util.h>

#include <algorithm>
#include <array>
#include <cstdio>
#include <nlohmann/json.hpp>
#include <sstream>

#include "krutil/base/JsonLine.hpp"
#include "krutil/inspect/Summary.hpp"

namespace krutil_client {
namespace {

using nlohmann::ordered_json;

std::string_view senderName(const apps::RecordedUnit& unit) {
    return unit.sender == apps::RecordedUnit::Role::Client ? "client" : "engine";
}

double secondsSince(std::uint64_t nanoseconds, std::uint64_t begin) {
    return nanoseconds < begin ? -static_cast<double>(begin - nanoseconds) / 1e9
                               : static_cast<double>(nanoseconds - begin) / 1e9;
}

std::string plainHex(std::string_view bytes) {
    constexpr std::string_view digits = "0123456789abcdef";
    std::string text;
    for (const char c : bytes) {
        const auto byte = static_cast<unsigned char>(c);
        text += {digits[byte >> 4U], digits[byte & 0xFU]};
    }
    return text;
}

// Offset, 16 bytes, and what of these is printable.
std::string hexDump(std::string_view bytes) {
    constexpr std::size_t width = 16;
    std::string text;
    for (std::size_t begin = 0; begin < bytes.size(); begin += width) {
        const std::string_view row = bytes.substr(begin, width);
        std::array<char, 40> offset{};
        std::snprintf(offset.data(), offset.size(), "        %08zx ", begin);
        std::string hex;
        std::string shown;
        for (const char c : row) {
            hex += ' ' + plainHex({&c, 1});
            shown += c >= ' ' && c <= '~' ? c : '.';
        }
        text.append(offset.data()).append(hex).append(3 * (width - row.size()) + 2, ' ').append(shown).append(1, '\n');
    }
    return text;
}

std::string fieldLines(const InspectedFrame& frame) {
    const auto message = messageIn(frame);
    std::string fields;
    if (message) {
        google::protobuf::TextFormat::PrintToString(*message, &fields);
    }
    std::string lines;
    std::istringstream in(fields);
    for (std::string line; std::getline(in, line);) {
        lines += "        " + line + '\n';
    }
    return lines;
}

ordered_json fieldObject(const InspectedFrame& frame) {
    const auto message = messageIn(frame);
    std::string json;
    google::protobuf::util::JsonPrintOptions options;
    options.preserve_proto_field_names = true;
    if (!message || !google::protobuf::util::MessageToJsonString(*message, &json, options).ok()) {
        return nullptr;
    }
    return ordered_json::parse(json, nullptr, false);
}

std::string frameLine(const InspectedFrame& frame) {
    std::string text = "      byte " + std::to_string(frame.unit.offset);
    if (frame.unit.kind == apps::RecordedUnit::Kind::Frame) {
        text += ": stream " + std::to_string(frame.header.stream) + " frame " + std::to_string(frame.header.index) +
                (frame.header.last ? " last" : "") + " type " +
                std::to_string(static_cast<unsigned>(frame.header.type)) + " " +
                printableName(frame.tag.empty() ? frame.type() : frame.tag);
    }
    text += ", " + std::to_string(frame.content) + " bytes";
    if (frame.unit.missing > 0) {
        text += ", " + std::to_string(frame.unit.missing) + " of them not recorded";
    }
    return text + "\n";
}

}  // namespace

std::string secondsText(std::uint64_t nanoseconds, std::uint64_t begin) {
    std::array<char, 40> text{};
    std::snprintf(text.data(), text.size(), "%.6f", secondsSince(nanoseconds, begin));
    return text.data();
}

std::string messageText(const InspectedMessage& message, std::uint64_t begin, const InspectOptions& options) {
    const std::string seconds = secondsText(message.first().nanoseconds, begin);
    std::string text = std::string(12 - std::min<std::size_t>(12, seconds.size()), ' ') + seconds;
    text += message.first().sender == apps::RecordedUnit::Role::Client ? " --> " : " <-- ";
    text += message.request.empty() ? "-       " : message.request.substr(0, 8);
    text += " " + printableName(message.type()) + ", " + std::to_string(message.size()) + " bytes";
    if (!message.complete) {
        text += ", not complete";
    }
    const std::string summary = summaryOf(message);
    text += summary.empty() ? "\n" : ": " + summary + "\n";
    if (!options.frames && !options.fields && !options.hex) {
        return text;
    }
    for (const InspectedFrame& frame : message.frames) {
        text += frameLine(frame);
        text += options.fields ? fieldLines(frame) : std::string();
        text += options.hex ? hexDump(frame.unit.bytes) : std::string();
    }
    return text;
}

std::string messageJson(const InspectedMessage& message, std::uint64_t begin, const InspectOptions& options) {
    const apps::RecordedUnit& first = message.first();
    ordered_json object{{"event", "message"},
                        {"session", first.session},
                        {"seconds", secondsSince(first.nanoseconds, begin)},
                        {"sender", senderName(first)}};
    if (!message.request.empty()) {
        object["request"] = message.request;
    }
    object["type"] = printableName(message.type());
    object["size"] = message.size();
    object["offset"] = first.offset;
    object["complete"] = message.complete;
    if (const std::string summary = summaryOf(message); !summary.empty()) {
        object["summary"] = summary;
    }
    if (options.frames || options.fields || options.hex) {
        object["frames"] = ordered_json::array();
        for (const InspectedFrame& frame : message.frames) {
            ordered_json part{{"offset", frame.unit.offset},
                              {"type", printableName(frame.type())},
                              {"size", frame.content},
                              {"missing", frame.unit.missing}};
            if (frame.unit.kind == apps::RecordedUnit::Kind::Frame) {
                part["stream"] = frame.header.stream;
                part["index"] = frame.header.index;
                part["frameType"] = static_cast<unsigned>(frame.header.type);
            }
            if (!frame.tag.empty()) {
                part["tag"] = printableName(frame.tag);
            }
            if (options.fields) {
                if (const ordered_json fields = fieldObject(frame); fields.is_object()) {
                    part["fields"] = fields;
                }
            }
            if (options.hex) {
                part["bytes"] = plainHex(frame.unit.bytes);
            }
            object["frames"].push_back(std::move(part));
        }
    }
    return jsonLine(object);
}

}  // namespace krutil_client
