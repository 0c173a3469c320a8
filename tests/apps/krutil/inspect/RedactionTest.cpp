// What is left of messages when they are redacted.
#include "krutil/inspect/Redaction.hpp"

#include <gmock/gmock.h>
#include <google/protobuf/descriptor.h>
#include <google/protobuf/message.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <fstream>
#include <iterator>
#include <nlohmann/json.hpp>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "common/FrameBytes.hpp"
#include "common/MessageWalk.hpp"
#include "krutil.protobuf.IIPEnqueueMessage.pb.h"
#include "krutil.protobuf.IssuedWarningEvent.pb.h"
#include "msg_svc.protobuf.SessionHandshake.pb.h"

namespace krutil_client {
namespace {

using apps::RecordedUnit;
using google::protobuf::FieldDescriptor;
using google::protobuf::Message;
using namespace std::string_literals;

std::string redacted(const std::string& bytes, RecordedUnit::Kind kind = RecordedUnit::Kind::Frame) {
    RecordedUnit unit;
    unit.kind = kind;
    unit.bytes = bytes;
    redact(unit);
    return unit.bytes;
}

struct Frame {
    std::string tag;
    std::string content;
    std::string bytes;
};

std::vector<Frame> framesOf(const std::string& bytes) {
    std::vector<Frame> frames;
    for (std::size_t at = 0; at < bytes.size();) {
        const apps::FrameHeader header = apps::headerOf(std::string_view(bytes).substr(at));
        const std::size_t content = at + apps::FrameHeader::size + header.tagSize;
        const std::size_t end = content + header.contentSize;
        frames.push_back({bytes.substr(content - header.tagSize, header.tagSize), bytes.substr(content, end - content),
                          bytes.substr(at, end - at)});
        at = end;
    }
    return frames;
}

std::string taggedFrame(const std::string& tag, const std::string& content) {
    std::string bytes(24, '\0');
    bytes[0] = '\x81';
    bytes[2] = static_cast<char>(tag.size());
    bytes[16] = static_cast<char>(content.size());
    return bytes + tag + content;
}

// Which fields a message and those within it have, how often, and how long their texts are.
std::string shapeOf(Message& message) {
    std::string shape;
    apps::forEachMessage(message, [&shape](Message& each) {
        const auto& reflection = *each.GetReflection();
        std::vector<const FieldDescriptor*> fields;
        reflection.ListFields(each, &fields);
        for (const FieldDescriptor* field : fields) {
            const int count = field->is_repeated() ? reflection.FieldSize(each, field) : 1;
            shape += field->full_name() + "*" + std::to_string(count) + " ";
        }
    });
    apps::forEachText(message, [&shape](std::string& text) { shape += std::to_string(text.size()) + " "; });
    return shape;
}

// A part of `text` that `bytes` has as well; empty for none. What is filled with one byte, or nearly all zero, is
// nobody's secret.
std::string survivor(const std::string& text, const std::string& bytes) {
    for (std::size_t at = 0; at + 4 <= text.size(); ++at) {
        const std::string part = text.substr(at, 4);
        const auto zeros = std::count(part.begin(), part.end(), '\0');
        if (part != std::string(4, part[0]) && zeros < 3 && bytes.find(part) != std::string::npos) {
            return part;
        }
    }
    return {};
}

TEST(RedactionTest, NoTextOfAnyTypeSurvives) {
    const std::string directory = KRUTIL_CONFORMANCE_DIR "/";
    std::ifstream in(directory + "manifest.json");
    const auto manifest = nlohmann::json::parse(in);
    std::set<std::string> types;
    std::size_t texts = 0;
    for (const auto& vector : manifest.at("vectors")) {
        SCOPED_TRACE(vector.at("bytes").get<std::string>());
        std::ifstream file(directory + vector.at("bytes").get<std::string>(), std::ios::binary);
        const std::string bytes{std::istreambuf_iterator<char>(file), {}};
        types.insert(vector.at("type").get<std::string>());
        for (const Frame& frame : framesOf(bytes)) {
            const std::string after = redacted(frame.bytes);
            ASSERT_EQ(after.size(), frame.bytes.size());
            EXPECT_EQ(after.substr(0, 24), frame.bytes.substr(0, 24));
            const std::string content = after.substr(after.size() - frame.content.size());
            const auto before = apps::parsedMessage(frame.tag, frame.content);
            if (!before) {
                continue;
            }
            const auto now = apps::parsedMessage(frame.tag, content);
            ASSERT_TRUE(now);
            EXPECT_EQ(shapeOf(*now), shapeOf(*before));
            EXPECT_EQ(after.substr(24, frame.tag.size()), frame.tag);
            apps::forEachText(*before, [&](std::string& text) {
                EXPECT_EQ(survivor(text, content), "");
                texts += text.size() >= 4 ? 1U : 0U;
            });
        }
    }
    EXPECT_EQ(types.size(), 25U);
    EXPECT_GT(texts, 400U);
}

TEST(RedactionTest, IdentifiersReferencesAndEnumerationsStay) {
    krutil::protobuf::IIPEnqueueMessage message;
    message.set_iiphandle(3);
    message.mutable_iipid()->set_hi(0x1234'5678'9ABC'DEF0U);
    message.mutable_iipid()->set_lo(77);
    message.set_qcrid(4711);
    message.set_qvmid(12);
    message.set_dequeuemode(krutil::protobuf::DEQUEUE_AT_IDLE);
    message.set_name("secret");
    message.add_capability(krutil::protobuf::Debugging);
    message.set_oktoflushsparingly(true);
    const std::string tag = "krutil:IIPEnqueueMessage";
    krutil::protobuf::IIPEnqueueMessage now;
    ASSERT_TRUE(now.ParseFromString(redacted(taggedFrame(tag, message.SerializeAsString())).substr(24 + tag.size())));
    EXPECT_EQ(now.name(), "xxxxxx");
    EXPECT_NE(now.qcrid(), 4711);
    EXPECT_NE(now.qvmid(), 12U);
    now.set_name("secret");
    now.set_qcrid(4711);
    now.set_qvmid(12);
    EXPECT_EQ(now.SerializeAsString(), message.SerializeAsString());
}

TEST(RedactionTest, NumbersOfWarningsAreReplaced) {
    krutil::protobuf::IssuedWarningEvent event;
    event.mutable_id()->set_lo(1);
    auto& warning = *event.mutable_warning();
    warning.set_identifier("id");
    warning.set_format("%d");
    warning.set_message("text");
    warning.set_wasdisabled(true);
    warning.set_datenum(738'000.5);
    warning.add_arguments()->set_i32(-5);
    warning.add_arguments()->set_u64(0xFFFF'FFFF'FFFF'FFFFU);
    warning.add_arguments()->set_dbl(2.5);
    warning.add_arguments()->set_i64(300);
    warning.add_stack()->set_line(12);
    const std::string tag = "korvel:lang:diagnostic:IssuedWarningEvent";
    krutil::protobuf::IssuedWarningEvent now;
    ASSERT_TRUE(now.ParseFromString(redacted(taggedFrame(tag, event.SerializeAsString())).substr(24 + tag.size())));
    EXPECT_EQ(now.id().lo(), 1U);
    EXPECT_TRUE(now.warning().wasdisabled());
    EXPECT_EQ(now.warning().datenum(), 1);
    EXPECT_EQ(now.warning().arguments(0).Value_case(), krutil::protobuf::PrintfArgument::kI32);
    EXPECT_NE(now.warning().arguments(0).i32(), -5);
    EXPECT_NE(now.warning().arguments(1).u64(), 0xFFFF'FFFF'FFFF'FFFFU);
    EXPECT_EQ(now.warning().arguments(2).dbl(), 1);
    EXPECT_EQ(now.warning().arguments(3).i64(), 129);
    EXPECT_EQ(now.warning().stack(0).line(), 1U);
}

TEST(RedactionTest, DataBecomesZeroAndItsPlaceStays) {
    const std::string data = "\x02\x0B"s + std::string(22, '\0');
    EXPECT_EQ(redacted(data + "elements"), data + std::string(8, '\0'));
    const std::string shared = "\x05\x0B"s + std::string(22, '\0') + std::string(24, 'p');
    EXPECT_EQ(redacted(shared + "elements"), shared + std::string(8, '\0'));
}

TEST(RedactionTest, WhatIsUnknownIsReplaced) {
    // A field that the message has not, in each form; and a group, which no message has.
    const std::string tag = "krutil:QVMShutdownEvent";
    const std::string content =
        "\x78\x85\x07"s + "\x7a\x04name" + "\x7d\x01\x02\x03\x04"s + "\x79" + "12345678" + "\x7b\x0a\x03key\x7c"s;
    EXPECT_EQ(redacted(taggedFrame(tag, content)).substr(24 + tag.size()),
              "\x78\x81\x01"s + "\x7a\x04xxxx" + "\x7d\0\0\x80\x3f\x79\0\0\0\0\0\0\xf0\x3f"s + std::string(7, '\x07'));
    EXPECT_EQ(redacted(taggedFrame(tag, "\x7a\x7fpart")).substr(24 + tag.size()), std::string(6, '\x07'));
    EXPECT_EQ(redacted(taggedFrame(tag, "\x82\x80\x01text")).substr(24 + tag.size()), std::string(7, '\x07'));
    const std::string header(22, '\0');
    EXPECT_EQ(redacted("\x01\x1d"s + "\x06"s + std::string(21, '\0') + "my:tagcontent"),
              "\x01\x1d"s + "\x06"s + std::string(21, '\0') + "xxxxxxxxxxxxx");
    EXPECT_EQ(redacted("\x04\0"s + header + "the reason"), "\x04\0"s + header + "xxxxxxxxxx");
    // What a program printed instead of a frame.
    EXPECT_EQ(redacted("Traceback (most recent call last):"), std::string(34, 'x'));
    EXPECT_EQ(redacted("short"), "xxxxx");
}

TEST(RedactionTest, HandshakeKeepsWhatIsAgreed) {
    msg_svc::protobuf::SessionHello hello;
    hello.set_role(msg_svc::protobuf::SessionHello::ENGINE);
    hello.set_protocol("krutil");
    hello.set_versionmajor(1);
    auto& feature = *hello.add_features();
    feature.set_name("ZEROCOPY");
    feature.set_value("enable");
    feature.set_handling(3);
    hello.mutable_limits()->set_message(4'294'967'296U);
    hello.add_capabilities(6);
    hello.set_build("krutil-qvm 0.1.0 (krutil_protobuf, GCC 12.2.0)");
    const std::string head = "\x89KRUTIL\n"s + "\x01\0\0\0\x10\0\0\0"s;
    const std::string known = head + hello.SerializeAsString();
    EXPECT_EQ(redacted(known, RecordedUnit::Kind::FirstMessage), known);

    hello.set_build("krutil-qvm 0.1.0 at host.example.org");
    hello.add_features()->set_name("HOSTNAME");
    hello.mutable_features(1)->set_value("host");
    const std::string foreign = redacted(head + hello.SerializeAsString(), RecordedUnit::Kind::FirstMessage);
    EXPECT_EQ(survivor("host.example.org", foreign), "");
    EXPECT_EQ(foreign.find("HOST"), std::string::npos);
    EXPECT_EQ(foreign.find("host"), std::string::npos);

    msg_svc::protobuf::SessionVerdict verdict;
    verdict.set_refusal("no room on host");
    EXPECT_EQ(redacted("\x11\0\0\0"s + verdict.SerializeAsString(), RecordedUnit::Kind::Verdict),
              "\x11\0\0\0\x1a\x0fxxxxxxxxxxxxxxx"s);
    EXPECT_EQ(redacted("12345678", RecordedUnit::Kind::Token), std::string(8, '\0'));
    EXPECT_EQ(redacted("\x01", RecordedUnit::Kind::Answer), "\x01");
    EXPECT_EQ(redacted("Welcome to host\n", RecordedUnit::Kind::FirstMessage), std::string(16, 'x'));
}

}  // namespace
}  // namespace krutil_client
