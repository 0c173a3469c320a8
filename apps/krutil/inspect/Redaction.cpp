#include "krutil/inspect/Redaction.hpp"

#include <google/protobuf/descriptor.h>
#include <google/protobuf/io/coded_stream.h>
#include <google/protobuf/wire_format_lite.h>

#include <algorithm>
#include <array>
#include <limits>
#include <regex>
#include <span>

#include "common/FrameBytes.hpp"
#include "common/MessageNames.hpp"

namespace krutil_client {
namespace {

using apps::FrameHeader;
using apps::FrameKind;
using google::protobuf::Descriptor;
using google::protobuf::FieldDescriptor;
using google::protobuf::internal::WireFormatLite;
using Bytes = std::span<char>;

constexpr std::size_t sizeOfPlace = 24;
constexpr std::string_view knownMagic = "\x89KRUTIL\n";

// Of fields that are not known: what takes two bytes.
constexpr std::uint32_t longestTag = 0x3FFF;

// No parser takes this for a field, so what could not be read stays so.
constexpr char unreadable = '\x07';

// As deep as the parser goes.
constexpr int deepest = 100;

// Numbers that say how parts belong together, and which form arrays have.
constexpr std::array<std::string_view, 14> keptNumbers{
    "msg_svc.protobuf.IDType.hi",
    "msg_svc.protobuf.IDType.lo",
    "msg_svc.protobuf.SessionHello.versionMajor",
    "msg_svc.protobuf.SessionHello.versionMinor",
    "msg_svc.protobuf.SessionHello.capabilities",
    "msg_svc.protobuf.SessionFeature.handling",
    "krutil.protobuf.IIPEnqueueMessage.iipHandle",
    "krutil.protobuf.IIPReply.resultID",
    "krutil.protobuf.FEvalIIP.nlhs",
    "krutil.protobuf.FEvalIIP.dataIDs",
    "krutil.protobuf.FEvalResult.dataIDs",
    "foundation.korveldata.protobuf.KORVEL_Array.elementType",
    "foundation.korveldata.protobuf.KORVEL_Array.dimensions",
    "foundation.korveldata.protobuf.KORVEL_Array.dataID",
};

// What a handshake agrees on.
constexpr std::array<std::string_view, 6> keptTexts{"krutil", "ZEROCOPY", "enable", "disable", "SHM", "descriptors"};

void hide(Bytes bytes, char with = 'x') {
    std::fill(bytes.begin(), bytes.end(), with);
}

// A number that takes as many bytes.
void hideVarint(Bytes bytes) {
    hide(bytes, '\x81');
    bytes.back() = '\x01';
}

// The floating-point number 1 of 4 or 8 bytes. Zero would be the same as an absent field.
void hideNumber(Bytes bytes) {
    hide(bytes, '\0');
    bytes[bytes.size() - 2] = bytes.size() == 8 ? '\xF0' : '\x80';
    bytes.back() = '\x3F';
}

const Descriptor* messageType(const std::string& name) {
    return google::protobuf::DescriptorPool::generated_pool()->FindMessageTypeByName(name);
}

bool isNumberKept(const FieldDescriptor* field) {
    if (field == nullptr) {
        return false;
    }
    if (field->cpp_type() == FieldDescriptor::CPPTYPE_ENUM || field->cpp_type() == FieldDescriptor::CPPTYPE_BOOL) {
        return true;
    }
    return field->containing_type()->full_name() == "msg_svc.protobuf.SessionLimits" ||
           std::find(keptNumbers.begin(), keptNumbers.end(), field->full_name()) != keptNumbers.end();
}

bool isTextKept(const FieldDescriptor* field, std::string_view text) {
    if (!field->full_name().starts_with("msg_svc.protobuf.Session")) {
        return false;
    }
    return std::find(keptTexts.begin(), keptTexts.end(), text) != keptTexts.end() ||
           (field->name() == "build" && isBuild(text));
}

bool isVarint(const FieldDescriptor* field) {
    return WireFormatLite::WireTypeForFieldType(static_cast<WireFormatLite::FieldType>(field->type())) ==
           WireFormatLite::WIRETYPE_VARINT;
}

// Numbers side by side.
void redactPacked(Bytes bytes, const FieldDescriptor* field) {
    if (isNumberKept(field)) {
        return;
    }
    if (!isVarint(field)) {
        hide(bytes, '\0');
        return;
    }
    while (!bytes.empty()) {
        const auto last = std::find_if(bytes.begin(), bytes.end(), [](char c) { return (c & 0x80) == 0; });
        const auto size = std::min(static_cast<std::size_t>(last - bytes.begin()) + 1, bytes.size());
        hideVarint(bytes.first(size));
        bytes = bytes.subspan(size);
    }
}

void redactMessage(Bytes bytes, const Descriptor* type, int depth);

void redactDelimited(Bytes bytes, const FieldDescriptor* field, int depth) {
    const bool isText = field != nullptr && field->type() == FieldDescriptor::TYPE_STRING;
    if (field != nullptr && field->cpp_type() == FieldDescriptor::CPPTYPE_MESSAGE) {
        redactMessage(bytes, field->message_type(), depth + 1);
    } else if (field != nullptr && field->type() == FieldDescriptor::TYPE_BYTES) {
        hide(bytes, '\0');
    } else if (field != nullptr && field->is_repeated() && !isText) {
        redactPacked(bytes, field);
    } else if (!isText || !isTextKept(field, {bytes.data(), bytes.size()})) {
        hide(bytes);
    }
}

void redactMessage(Bytes bytes, const Descriptor* type, int depth) {
    if (depth > deepest || bytes.size() > static_cast<std::size_t>(std::numeric_limits<int>::max())) {
        hide(bytes);
        return;
    }
    google::protobuf::io::CodedInputStream in(reinterpret_cast<const std::uint8_t*>(bytes.data()),
                                              static_cast<int>(bytes.size()));
    const auto position = [&in] { return static_cast<std::size_t>(in.CurrentPosition()); };
    for (;;) {
        // What is behind the last whole field is hidden.
        const Bytes rest = bytes.subspan(position());
        const std::uint32_t tag = in.ReadTag();
        const int number = WireFormatLite::GetTagFieldNumber(tag);
        const FieldDescriptor* const field = type->FindFieldByNumber(number);
        // What has a long tag and is not known is hardly a field.
        if (number == 0 || (field == nullptr && tag > longestTag)) {
            hide(rest, unreadable);
            return;
        }
        const std::size_t begin = position();
        std::uint64_t value = 0;
        std::uint32_t size = 0;
        bool whole = true;
        switch (WireFormatLite::GetTagWireType(tag)) {
            case WireFormatLite::WIRETYPE_VARINT:
                whole = in.ReadVarint64(&value);
                if (whole && !(isNumberKept(field) && isVarint(field))) {
                    hideVarint(bytes.subspan(begin, position() - begin));
                }
                break;
            case WireFormatLite::WIRETYPE_FIXED64:
            case WireFormatLite::WIRETYPE_FIXED32:
                size = WireFormatLite::GetTagWireType(tag) == WireFormatLite::WIRETYPE_FIXED64 ? 8 : 4;
                whole = in.Skip(static_cast<int>(size));
                if (whole) {
                    hideNumber(bytes.subspan(begin, size));
                }
                break;
            case WireFormatLite::WIRETYPE_LENGTH_DELIMITED: {
                whole = in.ReadVarint32(&size) && size <= bytes.size() - position();
                if (whole) {
                    redactDelimited(bytes.subspan(position(), size), field, depth);
                    in.Skip(static_cast<int>(size));
                }
                break;
            }
            default:
                // No message has groups.
                whole = false;
        }
        if (!whole) {
            hide(rest, unreadable);
            return;
        }
    }
}

void redactFrame(Bytes frame) {
    // What is no frame may be what a program has printed.
    if (frame.size() < FrameHeader::size) {
        hide(frame);
        return;
    }
    const FrameHeader header = apps::headerOf({frame.data(), frame.size()});
    const auto kind = static_cast<FrameKind>(header.kind);
    if (kind < FrameKind::Tagged || kind > FrameKind::KeepAlive) {
        hide(frame);
        return;
    }
    const Bytes behind = frame.subspan(FrameHeader::size);
    const Bytes tag = behind.first(std::min<std::size_t>(header.tagSize, behind.size()));
    const Bytes content = behind.subspan(tag.size());
    const Descriptor* const type = messageType(apps::messageNameOfTag({tag.data(), tag.size()}));
    if (type == nullptr) {
        hide(tag);
    }
    switch (kind) {
        case FrameKind::Tagged:
            if (type == nullptr) {
                hide(content);
            } else {
                redactMessage(content, type, 1);
            }
            break;
        case FrameKind::Data:
            hide(content, '\0');
            break;
        case FrameKind::SharedData:
            hide(content.subspan(std::min(sizeOfPlace, content.size())), '\0');
            break;
        default:
            hide(content);
    }
}

// `head` bytes, and a message.
void redactHandshake(Bytes bytes, std::size_t head, const char* type) {
    if (bytes.size() < head) {
        hide(bytes);
    } else {
        redactMessage(bytes.subspan(head), messageType(type), 1);
    }
}

}  // namespace

bool isBuild(std::string_view text) {
    static const std::regex form(R"(krutil(-qvm)? [0-9.]{1,20}( \(krutil_protobuf, (GCC|Clang) [0-9.]{1,20}\))?)");
    return text.size() < 100 && std::regex_match(text.begin(), text.end(), form);
}

void redact(apps::RecordedUnit& unit) {
    using Kind = apps::RecordedUnit::Kind;
    const Bytes bytes(unit.bytes);
    switch (unit.kind) {
        case Kind::FirstMessage:
            if (unit.bytes.starts_with(knownMagic)) {
                redactHandshake(bytes, 16, "msg_svc.protobuf.SessionHello");
            } else {
                hide(bytes);
            }
            break;
        case Kind::Verdict:
            redactHandshake(bytes, 4, "msg_svc.protobuf.SessionVerdict");
            break;
        case Kind::Token:
            hide(bytes, '\0');
            break;
        case Kind::Answer:
            break;
        case Kind::Frame:
            redactFrame(bytes);
            break;
    }
}

}  // namespace krutil_client
