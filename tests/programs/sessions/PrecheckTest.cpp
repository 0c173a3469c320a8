// An engine that sends numbers which the protocol's conversions end the process for: with the check the client closes
// the session, without it the process ends.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <csignal>
#include <cstdint>
#include <regex>

#include "programs/support/Program.hpp"

namespace programs_test {
namespace {

using ::testing::HasSubstr;

constexpr const char* fatalStream =
    "fatal: Unsupported krutil::protobuf::StreamType value (StreamTypeSerializer:44, static krutil::io::StreamTypeEnum "
    "krutil::protobuf_serializer::StreamTypeSerializer::fromProtobuf(krutil::protobuf::StreamType))\n";
constexpr const char* fatalStatus =
    "fatal: Unsupported protobuf::ExecutionStatus value (RuntimeExceptionSerialization:47, "
    "krutil::cmddistributor::inExecutionStatus "
    "krutil::protobuf_serializer::fromProtobuf(krutil::protobuf::ExecutionStatus))\n";

// Fields of a message as bytes.
std::string varint(std::uint64_t value) {
    std::string bytes;
    for (; value > 0x7F; value >>= 7U) {
        bytes += static_cast<char>(0x80U | (value & 0x7FU));
    }
    return bytes + static_cast<char>(value);
}

std::string number(unsigned field, std::int64_t value) {
    return varint(field << 3U) + varint(static_cast<std::uint64_t>(value));
}

std::string text(unsigned field, const std::string& content) {
    return varint(field << 3U | 2U) + varint(content.size()) + content;
}

// An error whose innermost cause, so many levels down, has the status; after another cause, which is in order.
std::string error(int depth, std::int64_t status) {
    if (depth == 0) {
        return number(1, status) + text(3, "innermost");
    }
    return number(1, 2) + text(3, "outer") + text(6, number(1, 1)) + text(6, error(depth - 1, status));
}

// What follows the identifier in each type of message.
std::string textEvent(std::int64_t stream) {
    return number(2, stream) + text(3, "shown");
}
std::string printableError(const std::string& exception) {
    return text(2, exception) + text(3, "printed\n");
}
std::string result(const std::string& exception) {
    return text(2, exception);
}
std::string callResult(const std::string& exception) {
    return text(1, text(2, exception));
}

std::string hex(const std::string& bytes) {
    constexpr const char* digits = "0123456789abcdef";
    std::string pairs;
    for (const char c : bytes) {
        pairs += digits[static_cast<unsigned char>(c) >> 4U];
        pairs += digits[static_cast<unsigned char>(c) & 0xFU];
    }
    return pairs;
}

// A message of an engine that does all else as it should.
struct Sent {
    const char* kind;  ///< "event" or "result"
    const char* tag;
    std::string content;
};

void PrintTo(const Sent& sent, std::ostream* out) {
    *out << sent.tag << ' ' << hex(sent.content);
}

Ran withCheck(const Sent& sent) {
    return runClient({"eval", "--engine",
                      "exec " + fakeEngine(std::string(sent.kind) + " " + sent.tag + " " + hex(sent.content)), "1"});
}

Ran withoutCheck(const Sent& sent) {
    return runClient({"eval", "--no-precheck", "--engine",
                      "exec " + fakeEngine(std::string(sent.kind) + " " + sent.tag + " " + hex(sent.content)), "1"});
}

// The place of a field depends on the identifier in front of it, which the client makes up.
std::string withoutPlaces(const std::string& text) {
    return std::regex_replace(text, std::regex(", byte [0-9]+"), ", byte N");
}

std::string refusal(const Sent& sent, const std::string& what) {
    return "krutil: frame \"" + std::string(sent.tag) + "\", byte N, field " + what + "\n";
}

void expectRefusal(const Ran& ran, const Sent& sent, const std::string& what) {
    EXPECT_EQ(withoutPlaces(ran.err), refusal(sent, what));
    EXPECT_EQ(ran.out, "");
    EXPECT_EQ(ran.exitCode, 4);
}

// The check refuses the message with a sentence of its own; without it the process ends with that of the conversion.
void expectRefused(const Sent& sent, const std::string& what, const char* fatal) {
    SCOPED_TRACE(::testing::PrintToString(sent));
    expectRefusal(withCheck(sent), sent, what);
    const Ran unchecked = withoutCheck(sent);
    EXPECT_EQ(unchecked.err, fatal);
    EXPECT_EQ(unchecked.out, "");
    EXPECT_EQ(unchecked.exitCode, 128 + SIGABRT);
}

// Both show the same; returned for more questions.
Ran expectSame(const Sent& sent) {
    SCOPED_TRACE(::testing::PrintToString(sent));
    const Ran checked = withCheck(sent);
    const Ran unchecked = withoutCheck(sent);
    EXPECT_EQ(checked.out, unchecked.out);
    EXPECT_EQ(withoutPlaces(checked.err), withoutPlaces(unchecked.err));
    EXPECT_EQ(checked.exitCode, unchecked.exitCode);
    return checked;
}

TEST(ClientPrecheckTest, StreamsOfTextsOutsideTheirRange) {
    for (const char* tag : {"krutil:TextBaseEvent", "krutil:SinkTextEvent"}) {
        for (const std::int64_t stream : {3, -1}) {
            expectRefused({"event", tag, textEvent(stream)},
                          "stream: expected a stream from 0 to 2, got " + std::to_string(stream), fatalStream);
        }
    }
}

// The parser stops at 100 levels.
constexpr int depths[]{0, 1, 90};

// The field of an error in which its innermost status stands.
std::string statusIn(const char* path, int depth) {
    return path + std::string(depth == 0 ? "" : depth == 1 ? ".causes" : ".causes (90 times)") + ".status";
}

TEST(ClientPrecheckTest, StatusesOfResultsOutsideTheirRange) {
    for (const int depth : depths) {
        for (const std::int64_t status : {6, -1}) {
            expectRefused(
                {"result", "krutil:IIPResult", result(error(depth, status))},
                statusIn("exception", depth) + ": expected a status from 0 to 5, got " + std::to_string(status),
                fatalStatus);
        }
    }
}

TEST(ClientPrecheckTest, StatusesOfErrorsThatAreDroppedLater) {
    for (const int depth : depths) {
        expectRefused({"result", "krutil:FEvalResult", callResult(error(depth, 6))},
                      statusIn("iipResult.exception", depth) + ": expected a status from 0 to 5, got 6", fatalStatus);
    }
}

TEST(ClientPrecheckTest, StatusesOfErrorsToPrintOutsideTheirRange) {
    for (const int depth : depths) {
        expectRefused({"event", "krutil:PrintableErrorEvent", printableError(error(depth, 6))},
                      statusIn("except", depth) + ": expected a status from 0 to 5, got 6", fatalStatus);
    }
}

TEST(ClientPrecheckTest, LegalMessagesAreShownAsTheyAreWithoutIt) {
    EXPECT_EQ(expectSame({"event", "krutil:TextBaseEvent", textEvent(0)}).out, "shown");
    EXPECT_EQ(expectSame({"event", "krutil:TextBaseEvent", textEvent(1)}).err, "shown");
    EXPECT_EQ(expectSame({"event", "krutil:SinkTextEvent", textEvent(2)}).out, "shown");
    for (const int depth : depths) {
        EXPECT_THAT(expectSame({"result", "krutil:IIPResult", result(error(depth, 5))}).err, HasSubstr("innermost"));
        EXPECT_EQ(expectSame({"result", "krutil:FEvalResult", callResult(error(depth, 5))}).exitCode, 0);
        EXPECT_EQ(expectSame({"event", "krutil:PrintableErrorEvent", printableError(error(depth, 5))}).err,
                  "printed\n");
    }
}

TEST(ClientPrecheckTest, WhatLiesBelowTheParsersDepthIsRefusedEitherWay) {
    const Sent sent{"event", "krutil:PrintableErrorEvent", printableError(error(150, 5))};
    expectRefusal(expectSame(sent), sent,
                  "except.causes (100 times): expected at most 100 messages inside one another, got more");
}

// Without the check of numbers only these pass: what is cut is refused all the same.
TEST(ClientPrecheckTest, CutTextsAreRefusedEitherWay) {
    const std::string whole = textEvent(300);
    const auto cut = [&](std::size_t length) { return Sent{"event", "krutil:TextBaseEvent", whole.substr(0, length)}; };
    EXPECT_EQ(expectSame(cut(0)).exitCode, 0);
    expectRefusal(expectSame(cut(1)), cut(1), "stream: expected 1 more byte, got none");
    expectRefusal(expectSame(cut(2)), cut(2), "stream: expected 1 more byte, got none");
    expectRefused(cut(3), "stream: expected a stream from 0 to 2, got 300", fatalStream);
    expectRefusal(withCheck(cut(4)), cut(4), "stream: expected a stream from 0 to 2, got 300");
    expectRefusal(withoutCheck(cut(4)), cut(4), "text: expected 1 more byte, got none");
    expectRefusal(withoutCheck(cut(9)), cut(9), "text: expected 5 more bytes, got 4");
}

TEST(ClientPrecheckTest, WhatASerializerRefusesIsRefusedInItsWordsEitherWay) {
    const Ran ran = expectSame({"event", "krutil:DebugLoopEvent", number(2, 7)});
    EXPECT_EQ(ran.err,
              "krutil: cannot read \"krutil:DebugLoopEvent\": Invalid enum krutil::protobuf::DebugLoopEvent_State "
              "field value = 7\n");
    EXPECT_EQ(ran.exitCode, 4);
}

}  // namespace
}  // namespace programs_test
