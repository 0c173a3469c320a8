#include "foundation/msg_svc/transport/layers/session/WireWalk.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/mman.h>

#include <cstring>
#include <map>
#include <new>
#include <string>
#include <vector>

#include "foundation.korveldata.protobuf.KORVEL_Array.pb.h"
#include "foundation/msg_svc/transport/layers/session/SessionError.hpp"
#include "msg_svc.protobuf.SessionHandshake.pb.h"
#include "support/ParserOracle.hpp"

namespace {

namespace session = foundation::msg_svc::transport::layers::session;
namespace framing = foundation::vantor::carrier::framing;
using session::WireWalk;
namespace pb = google::protobuf;
using std::string_literals::operator""s;

framing::TaggedFrame walkedFrame(const std::string& tag, const std::string& content) {
    framing::FrameBuffer buffer(
        framing::FrameBuffer::first_type(new char[content.size() + 1], std::default_delete<char[]>()), content.size());
    std::memcpy(buffer.first.get(), content.data(), content.size());
    return {framing::FrameType::Object, 1, tag, std::move(buffer), 1};
}

std::string varint(std::uint64_t value) {
    std::string bytes;
    for (; value > 0x7F; value >>= 7U) {
        bytes += static_cast<char>(0x80U | (value & 0x7FU));
    }
    return bytes + static_cast<char>(value);
}

// A frame of so many bytes, of which only the first ones are not 0. It takes no memory for the others.
framing::TaggedFrame hugeFrame(const std::string& tag, const std::string& begin, std::size_t size) {
    void* const memory =
        ::mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE, -1, 0);
    if (memory == MAP_FAILED) {
        throw std::bad_alloc();
    }
    std::memcpy(memory, begin.data(), begin.size());
    framing::FrameBuffer buffer(
        framing::FrameBuffer::first_type(static_cast<char*>(memory), [size](char* all) { ::munmap(all, size); }), size);
    return {framing::FrameType::Object, 1, tag, std::move(buffer), 1};
}

// A field of wire type 2.
std::string block(std::uint64_t number, const std::string& content) {
    return varint(number << 3U | 2U) + varint(content.size()) + content;
}

std::string repeated(const std::string& bytes, std::size_t times) {
    std::string all;
    for (std::size_t i = 0; i < times; ++i) {
        all += bytes;
    }
    return all;
}

// So many messages inside one another.
std::string nested(std::size_t depth) {
    std::string bytes;
    for (std::size_t i = 0; i < depth; ++i) {
        bytes = block(i % 2 == 0 ? 3 : 10, bytes);
    }
    return bytes;
}

class WireWalkTest : public testing::Test {
  protected:
    // What the walk says without the name of the frame; "whole" when it accepts.
    std::string verdict(const std::string& content, std::uint64_t mostParts = WireWalk::anyParts) const {
        return verdictOf(walkedFrame("test:every", content), mostParts);
    }

    std::string verdictOf(const framing::TaggedFrame& frame, std::uint64_t mostParts = WireWalk::anyParts) const {
        try {
            walk_.check(frame, mostParts);
            return "whole";
        } catch (const session::ProtocolViolation& violation) {
            const std::string text = violation.what();
            const std::string name = "frame \"test:every\"";
            EXPECT_EQ(text.substr(0, name.size()), name);
            return text.substr(name.size());
        }
    }

    // The same, after the parser was asked as well.
    std::string agreed(const std::string& content) {
        const std::string text = verdict(content);
        EXPECT_EQ(text == "whole", oracle_.readsWhole(oracle_.everyKind(), content)) << testing::PrintToString(content);
        return text;
    }

    test_support::ParserOracle oracle_;
    const WireWalk walk_{{{"test:every", &oracle_.everyKind()}},
                         {{oracle_.everyKind().FindFieldByName("enumeration"), "a kind", 0, 5}}};
};

TEST_F(WireWalkTest, WholeMessages) {
    for (const std::string& content :
         {""s, "\x08\x01"s, "\x0A\x00"s, "\x88\x80\x80\x80\x00\x01"s, "\x08\xFF\xFF\xFF\xFF\xFF\xFF\xFF\xFF\xFF\x7F"s,
          "\x1A\x02\x08\x01"s, "\x2B\x08\x01\x2C"s, "\x32\x03\x01\x80\x01"s, "\x30\x01"s,
          "\x3A\x08"s + std::string(8, 'x'), "\x42\x04"s + std::string(4, 'x'), "\x45"s + std::string(4, 'x'),
          "\x22\x85\x80\x80\x80\x00"s + "bytes", "\xF8\xFF\xFF\xFF\x0F\x01"s, "\xA3\x06\xAB\x06\xAC\x06\xA4\x06"s}) {
        EXPECT_EQ(agreed(content), "whole") << testing::PrintToString(content);
    }
}

TEST_F(WireWalkTest, FramesAndFieldsAreNoLargerThanTheParserTakes) {
    constexpr std::size_t largestFrame = 2'147'483'647;
    const std::string name = "test:every";
    EXPECT_EQ(verdictOf(hugeFrame(name, "\x08\x01", largestFrame)),
              ", byte 2: expected a field number from 1 on, got 0");
    EXPECT_EQ(verdictOf(hugeFrame(name, "\x08\x01", largestFrame + 1)),
              ", byte 0: expected at most 2147483647 bytes, got 2147483648");
    constexpr std::size_t largestField = largestFrame - 16;
    EXPECT_EQ(verdictOf(hugeFrame(name, "\x22" + varint(largestField), 6 + largestField)), "whole");
    EXPECT_EQ(verdictOf(hugeFrame(name, "\x22" + varint(largestField + 1), 6 + largestField + 1)),
              ", byte 0, field bytes: expected a length of at most 2147483631, got 2147483632");
}

TEST_F(WireWalkTest, FieldsOfAnotherWireTypeAreSkipped) {
    for (const std::string& content :
         {block(1, "\xFF\xFF"), block(13, "\xFF"), "\x18\x01"s, "\x2A\x01\xFF"s, "\x1B\x08\x01\x1C"s, "\x33\x34"s,
          "\x0D"s + std::string(4, '\xFF'), "\x21"s + std::string(8, '\xFF')}) {
        EXPECT_EQ(agreed(content), "whole") << testing::PrintToString(content);
    }
}

TEST_F(WireWalkTest, WhatIsNotWholeIsRefusedWithItsPlaceAndReason) {
    const std::map<std::string, std::string> refusals{
        {"\x08", ", byte 0, field one: expected 1 more byte, got none"},
        {"\x08\x01\x08\x80", ", byte 2, field one: expected 1 more byte, got none"},
        {"\x80", ", byte 0: expected 1 more byte, got none"},
        {"\x88\x80\x80\x80\x80\x01", ", byte 0: expected a tag of at most 5 bytes, got more"},
        {"\x08" + std::string(10, '\xFF') + "\x01",
         ", byte 0, field one: expected a number of at most 10 bytes, got more"},
        {"\x22\x80\x80\x80\x80\x80\x01", ", byte 0, field bytes: expected a length of at most 5 bytes, got more"},
        {"\x22\x80\x80\x80\x80\x08", ", byte 0, field bytes: expected 2147483648 more bytes, got none"},
        {"\x22\xFF\xFF\xFF\xFF\x07", ", byte 0, field bytes: expected 2147483647 more bytes, got none"},
        {"\x22\x80\x80\x80\x40x", ", byte 0, field bytes: expected 134217728 more bytes, got 1"},
        {"\x1A\x02\x08\x01"s.substr(0, 3), ", byte 0, field self: expected 2 more bytes, got 1"},
        {block(3, "\x22\x02x") + "\x08\x01", ", byte 2, field self.bytes: expected 2 more bytes, got 1"},
        {block(3, block(10, "\x08")), ", byte 4, field self.selves.one: expected 1 more byte, got none"},
        {"\x0D\x01\x01\x01", ", byte 0, field one: expected 4 more bytes, got 3"},
        {"\x09\x01\x01\x01\x01\x01\x01\x01", ", byte 0, field one: expected 8 more bytes, got 7"},
        {std::string(1, '\0'), ", byte 0: expected a field number from 1 on, got 0"},
        {"\x08\x01\x02\x01x", ", byte 2: expected a field number from 1 on, got 0"},
        {"\x0E", ", byte 0, field one: expected a wire type from 0 to 5, got 6"},
        {"\xA7\x06", ", byte 0, field 100: expected a wire type from 0 to 5, got 7"},
        {"\x0C", ", byte 0, field one: expected no end of a group outside of one, got that of group 1"},
        {block(3, "\x1C"),
         ", byte 2, field self (2 times): expected no end of a group outside of one, got that of group 3"},
        {"\x2B\x08\x01", ", byte 3, field group: expected the end of group 5, got the end of what it is in"},
        {"\x2B\x34", ", byte 1, field group.packed: expected the end of group 5, got that of group 6"},
        {block(3, "\x2B") + "\x2C",
         ", byte 3, field self.group: expected the end of group 5, got the end of what it is in"},
        {block(6, "\x01\x80"), ", byte 0, field packed: expected whole elements, got a cut one"},
        {block(6, std::string(10, '\x80') + "\x01"),
         ", byte 0, field packed: expected a number of at most 10 bytes, got more"},
        {block(7, std::string(12, 'x')), ", byte 0, field fixed64s: expected whole elements of 8 bytes, got 12 bytes"},
        {block(8, std::string(5, 'x')), ", byte 0, field floats: expected whole elements of 4 bytes, got 5 bytes"},
        {"\xC2\x3E\x01", ", byte 0, field far: expected 1 more byte, got none"},
        {"\x10\x06", ", byte 0, field enumeration: expected a kind from 0 to 5, got 6"},
    };
    for (const auto& [content, expected] : refusals) {
        EXPECT_EQ(verdict(content), expected) << testing::PrintToString(content);
        // The parser minds all but the rule of the last one.
        if (content != "\x10\x06") {
            EXPECT_FALSE(oracle_.readsWhole(oracle_.everyKind(), content)) << testing::PrintToString(content);
        }
    }
}

TEST_F(WireWalkTest, MessagesAndGroupsInsideOneAnotherAreCountedTogether) {
    EXPECT_EQ(agreed(nested(100)), "whole");
    const std::string tooDeep = agreed(nested(101));
    EXPECT_THAT(tooDeep, testing::StartsWith(", byte "));
    EXPECT_THAT(tooDeep, testing::EndsWith(".selves.self: expected at most 100 messages inside one another, got more"));
    EXPECT_EQ(agreed(repeated("\x2B", 100) + repeated("\x2C", 100)), "whole");
    EXPECT_NE(agreed(repeated("\x2B", 101) + repeated("\x2C", 101)), "whole");
    // Groups that nobody knows.
    EXPECT_EQ(agreed(repeated("\xA3\x06", 100) + repeated("\xA4\x06", 100)), "whole");
    EXPECT_NE(agreed(repeated("\xA3\x06", 101) + repeated("\xA4\x06", 101)), "whole");
    EXPECT_EQ(agreed(repeated("\x2B", 60) + block(3, nested(39)) + repeated("\x2C", 60)), "whole");
    EXPECT_NE(agreed(repeated("\x2B", 60) + block(3, nested(40)) + repeated("\x2C", 60)), "whole");
}

TEST_F(WireWalkTest, EachOccurrenceOfANumberWithARuleIsLookedAt) {
    EXPECT_EQ(verdict("\x10\x05\x10\x00"s), "whole");
    EXPECT_EQ(verdict("\x10\x06\x10\x05"), ", byte 0, field enumeration: expected a kind from 0 to 5, got 6");
    EXPECT_EQ(verdict(block(10, "") + block(10, "\x10\x05\x10\x07")),
              ", byte 6, field selves.enumeration: expected a kind from 0 to 5, got 7");
    // 32 bits count, as for the parser.
    EXPECT_EQ(verdict("\x10\x80\x80\x80\x80\x10"), "whole");
    EXPECT_EQ(verdict("\x10" + varint(~0ULL)), ", byte 0, field enumeration: expected a kind from 0 to 5, got -1");
    // These are not its wire type, and not its field.
    EXPECT_EQ(verdict(block(2, "\x07")), "whole");
    EXPECT_EQ(verdict("\x58\x07"), "whole");
}

TEST_F(WireWalkTest, PartsAreAllFieldsButPackedElements) {
    const auto parts = [&](const std::string& content) { return walk_.parts(walkedFrame("test:every", content)); };
    EXPECT_EQ(parts(""), 0U);
    EXPECT_EQ(parts("\x08\x01\x08\x01"), 2U);
    EXPECT_EQ(parts(block(3, "\x08\x01") + block(4, "\x08\x01")), 3U);
    EXPECT_EQ(parts(block(6, "\x01\x02\x03")), 1U);
    EXPECT_EQ(parts("\x30\x01\x30\x02\x30\x03"), 3U);
    EXPECT_EQ(parts("\x2B\x08\x01\x2C"), 2U);
    EXPECT_EQ(parts("\xA3\x06\xA8\x06\x01\xA4\x06"), 2U);
    EXPECT_EQ(parts("\x08\x01\x08"), 2U) << "in front of the fault, with it";
    EXPECT_EQ(walk_.parts(walkedFrame("test:other", "\x08\x01")), 0U);
}

TEST_F(WireWalkTest, MorePartsThanAllowed) {
    const std::string three = block(3, "\x08\x01\x08\x02");
    EXPECT_EQ(verdict(three, 3), "whole");
    EXPECT_EQ(verdict(three, 2), ", byte 4, field self.one: expected at most 2 fields (limit \"parts\"), got more");
    EXPECT_EQ(verdict("\xA3\x06\xA8\x06\x01\xA4\x06", 1),
              ", byte 2, field 100.101: expected at most 1 fields (limit \"parts\"), got more");
    EXPECT_EQ(verdict("", 0), "whole");
}

TEST_F(WireWalkTest, ContentsOfOtherTagsAreNotLookedAt) {
    EXPECT_NO_THROW(walk_.check(walkedFrame("test:other", "\xFF"), 0));
}

TEST_F(WireWalkTest, GeneratedMessages) {
    msg_svc::protobuf::SessionHello hello;
    hello.set_protocol("krutil");
    hello.add_features()->set_name("name");
    hello.add_capabilities(3);
    hello.mutable_limits()->set_parts(7);
    foundation::korveldata::protobuf::KORVEL_Array array;
    array.add_dimensions(300);
    array.set_inlineelements("\xFF\xFF");
    const WireWalk walk({{"hello", hello.descriptor()}, {"array", array.descriptor()}});
    EXPECT_NO_THROW(walk.check(walkedFrame("hello", hello.SerializeAsString())));
    EXPECT_NO_THROW(walk.check(walkedFrame("array", array.SerializeAsString())));
    EXPECT_EQ(walk.parts(walkedFrame("hello", hello.SerializeAsString())), 6U);
}

// All contents of up to three bytes out of those that mean something, and all cuts of longer ones.
TEST_F(WireWalkTest, AgreesWithTheParserOnEveryShortContent) {
    const std::string alphabet =
        "\x00\x01\x02\x04\x06\x07\x08\x0A\x0B\x0C\x0D\x18\x1A\x22\x2B\x2C\x32\x3A\x42\x7F\x80\x81\xFF"s;
    const pb::Descriptor& message = oracle_.everyKind();
    std::vector<std::string> contents{""};
    for (std::size_t i = 0; i < contents.size(); ++i) {
        const std::string content = contents[i];
        ASSERT_EQ(verdict(content) == "whole", oracle_.readsWhole(message, content)) << testing::PrintToString(content);
        if (content.size() < 3) {
            for (const char byte : alphabet) {
                contents.push_back(content + byte);
            }
        }
    }
    const std::string long_ = nested(3) + block(3, "\x2B" + block(6, "\x01\x02\x80\x01") + "\x2C") + block(4, "text") +
                              "\x3A\x08" + std::string(8, 'x') + "\xC2\x3E\x02xy" + "\xA3\x06\xA8\x06\x01\xA4\x06";
    for (std::size_t size = 0; size <= long_.size(); ++size) {
        const std::string cut = long_.substr(0, size);
        EXPECT_EQ(verdict(cut) == "whole", oracle_.readsWhole(message, cut)) << size;
        for (const char byte : alphabet) {
            std::string changed = long_;
            changed[std::min(size, long_.size() - 1)] = byte;
            EXPECT_EQ(verdict(changed) == "whole" || verdict(changed).find("a kind") != std::string::npos,
                      oracle_.readsWhole(message, changed))
                << size;
        }
    }
}

}  // namespace
