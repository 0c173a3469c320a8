// Recordings that are read again: whole ones, growing ones and damaged ones.
#include "common/RecordingReader.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <malloc.h>
#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <string>
#include <string_view>
#include <system_error>
#include <utility>
#include <vector>

#include "apps/common/RecordingFixture.hpp"

namespace apps {
namespace {

using namespace std::string_literals;
using ::testing::HasSubstr;
using Unit = RecordedUnit;

const std::string firstMessage = "\x89KRUTIL\nbody";

// Blocks by hand, in either byte order.
class Blocks {
  public:
    explicit Blocks(bool bigEndian = false) : bigEndian_(bigEndian) {}

    std::string number(std::uint64_t value, std::size_t size = 4) const {
        std::string bytes;
        for (std::size_t i = 0; i < size; ++i) {
            bytes += static_cast<char>(static_cast<unsigned char>(value >> (8 * i)));
        }
        if (bigEndian_) {
            std::reverse(bytes.begin(), bytes.end());
        }
        return bytes;
    }

    static std::string padded(std::string bytes) {
        bytes.append((4 - bytes.size() % 4) % 4, '\0');
        return bytes;
    }

    std::string option(std::uint16_t code, const std::string& value) const {
        return padded(number(code, 2) + number(value.size(), 2) + value);
    }

    std::string block(std::uint32_t type, const std::string& body) const {
        const std::string length = number(body.size() + 12);
        return number(type) + length + body + length;
    }

    std::string section() const {
        return block(0x0A0D0D0A, number(0x1A2B3C4D) + number(1, 2) + number(0, 2) + std::string(8, '\xff') +
                                     option(4, "program 1") + number(0));
    }

    std::string interface(const std::string& name, unsigned linkType = 252, int resolution = 9) const {
        return block(1, number(linkType, 2) + number(0, 2) + number(262'144) + option(2, name) +
                            (resolution < 0 ? "" : option(9, std::string(1, static_cast<char>(resolution)))) +
                            number(0));
    }

    std::string rawPacket(const std::string& data, std::uint32_t flags, std::uint64_t time = 0,
                          const std::string& comment = {}, std::uint64_t missing = 0,
                          std::uint32_t interface = 0) const {
        return block(6, number(interface) + number(time >> 32U) + number(time & 0xFFFFFFFFU) + number(data.size()) +
                            number(data.size() + missing) + padded(data) + option(2, number(flags)) +
                            (comment.empty() ? "" : option(1, comment)) + number(0));
    }

    std::string packet(const std::string& data, std::uint32_t flags, std::uint64_t time = 0,
                       const std::string& comment = {}, std::uint64_t missing = 0) const {
        return rawPacket("\0\x0c\0\x08krutil\0\0\0\0\0\0"s + data, flags, time, comment, missing);
    }

  private:
    bool bigEndian_;
};

constexpr std::uint32_t inbound = 1;
constexpr std::uint32_t outbound = 2;

class RecordingReaderTest : public RecordingFixture {
  protected:
    void write(const std::string& bytes) const { std::ofstream(file_, std::ios::binary) << bytes; }

    std::string written() const { return test_support::contentOf(file_); }

    static std::vector<Unit> allOf(RecordingReader& reader) {
        std::vector<Unit> units;
        while (auto unit = reader.next()) {
            units.push_back(std::move(*unit));
        }
        return units;
    }

    std::vector<Unit> unitsOf(const std::string& bytes) const {
        write(bytes);
        RecordingReader reader(file_);
        return allOf(reader);
    }

    // What reading these bytes fails with, without the name of the file.
    std::string errorOf(const std::string& bytes) const {
        try {
            unitsOf(bytes);
        } catch (const RecordingError& error) {
            const std::string text = error.what();
            const std::string name = "'" + file_ + "', ";
            return text.starts_with(name) ? text.substr(name.size()) : "without its file: " + text;
        }
        return "none";
    }

    const Blocks blocks_{};
    const std::string begin_ = blocks_.section() + blocks_.interface("client 7");
};

TEST_F(RecordingReaderTest, ReadsWhatARecordingWrites) {
    Recording made = recording();
    made.setClock([] { return timespec{5, 6}; });
    made.beginSession(Recording::Role::Engine, "krutil-qvm 1");
    record(made, Direction::Sent, Part::Handshake, firstMessage);
    record(made, Direction::Received, Part::Handshake, firstMessage);
    record(made, Direction::Sent, Part::Handshake, "verdict");
    record(made, Direction::Sent, Part::Handshake, "8 bytes.");
    record(made, Direction::Sent, Part::Handshake, "1");
    const std::string large = std::string(300'000, 'a') + std::string(300'000, 'b');
    record(made, Direction::Sent, Part::Frame, large);
    made.beginSession(Recording::Role::Client, "krutil 1");
    record(made, Direction::Sent, Part::Handshake, firstMessage);

    RecordingReader reader(file_);
    const std::vector<Unit> units = allOf(reader);
    EXPECT_EQ(reader.unfinished(), std::nullopt);
    ASSERT_EQ(units.size(), 7U);
    const std::string pid = std::to_string(::getpid());
    ASSERT_EQ(reader.sessions().size(), 2U);
    EXPECT_EQ(reader.sessions()[0].process, "engine " + pid);
    EXPECT_EQ(reader.sessions()[0].program, "krutil-qvm 1");
    EXPECT_EQ(reader.sessions()[0].recorder, Unit::Role::Engine);
    EXPECT_EQ(reader.sessions()[1].process, "client " + pid);
    EXPECT_EQ(reader.sessions()[1].recorder, Unit::Role::Client);

    const std::vector<Unit::Kind> kinds{Unit::Kind::FirstMessage, Unit::Kind::FirstMessage, Unit::Kind::Verdict,
                                        Unit::Kind::Token,        Unit::Kind::Answer,       Unit::Kind::Frame,
                                        Unit::Kind::FirstMessage};
    for (std::size_t i = 0; i < units.size(); ++i) {
        EXPECT_EQ(units[i].kind, kinds[i]) << i;
        EXPECT_TRUE(units[i].whole()) << i;
        EXPECT_EQ(units[i].missing, 0U) << i;
        EXPECT_EQ(units[i].nanoseconds, 5'000'000'006U) << i;
        EXPECT_EQ(written().substr(units[i].offset, 4), "\x06\0\0\0"s) << i;
    }
    EXPECT_EQ(units[0].direction, Direction::Sent);
    EXPECT_EQ(units[0].sender, Unit::Role::Engine);
    EXPECT_EQ(units[1].direction, Direction::Received);
    EXPECT_EQ(units[1].sender, Unit::Role::Client);
    EXPECT_TRUE(units[5].bytes == large);
    EXPECT_EQ(units[5].session, 0U);
    EXPECT_EQ(units[6].session, 1U);
    EXPECT_EQ(units[6].sender, Unit::Role::Client);
}

TEST_F(RecordingReaderTest, CutFramesSayWhatIsMissing) {
    Recording made({file_, 300'000}, [](const std::string&) {});
    made.beginSession(Recording::Role::Client, "krutil");
    record(made, Direction::Sent, Part::Frame, std::string(400'000, 'a'));
    record(made, Direction::Sent, Part::Frame, "whole");
    RecordingReader reader(file_);
    const std::vector<Unit> units = allOf(reader);
    ASSERT_EQ(units.size(), 2U);
    EXPECT_TRUE(units[0].bytes == std::string(300'000, 'a'));
    EXPECT_EQ(units[0].size, 400'000U);
    EXPECT_EQ(units[0].missing, 100'000U);
    EXPECT_FALSE(units[0].whole());
    EXPECT_EQ(units[1].bytes, "whole");
}

TEST_F(RecordingReaderTest, KeepsAsMuchOfAUnitAsIsAskedFor) {
    Recording made = recording();
    made.beginSession(Recording::Role::Client, "krutil");
    record(made, Direction::Sent, Part::Frame, std::string(600'000, 'a'));
    RecordingReader reader(file_, nullptr, 262'130);
    const auto unit = reader.next();
    ASSERT_TRUE(unit.has_value());
    EXPECT_EQ(unit->bytes.size(), 262'130U);
    EXPECT_EQ(unit->size, 600'000U);
    EXPECT_EQ(unit->missing, 0U);
    EXPECT_FALSE(unit->whole());
}

TEST_F(RecordingReaderTest, DirectionsOfAUnitInPacketsMayMix) {
    const auto units = unitsOf(begin_ + blocks_.packet("abc", outbound, 1, "bytes 0-2 of 5") +
                               blocks_.packet("xy", inbound, 2, "a comment of somebody's") +
                               blocks_.packet("de", outbound, 3, "bytes 3-4 of 5"));
    ASSERT_EQ(units.size(), 2U);
    EXPECT_EQ(units[0].bytes, "xy");
    EXPECT_EQ(units[1].bytes, "abcde");
    EXPECT_EQ(units[1].nanoseconds, 1U);
    EXPECT_EQ(units[1].offset, begin_.size());
}

TEST_F(RecordingReaderTest, BothByteOrders) {
    const Blocks big(true);
    const auto units = unitsOf(big.section() + big.interface("engine 8", 252, 6) + big.packet("abc", inbound, 7) +
                               begin_ + blocks_.packet("de", outbound, 7'000'000'000));
    ASSERT_EQ(units.size(), 2U);
    EXPECT_EQ(units[0].bytes, "abc");
    EXPECT_EQ(units[0].nanoseconds, 7'000U);
    EXPECT_EQ(units[0].sender, Unit::Role::Client);
    EXPECT_EQ(units[1].nanoseconds, 7'000'000'000U);
    EXPECT_EQ(units[1].session, 1U);
}

TEST_F(RecordingReaderTest, TimesAreMicrosecondsUnlessTheInterfaceSays) {
    const auto units =
        unitsOf(blocks_.section() + blocks_.interface("client 7", 252, -1) + blocks_.packet("abc", outbound, 5));
    ASSERT_EQ(units.size(), 1U);
    EXPECT_EQ(units[0].nanoseconds, 5'000U);
}

TEST_F(RecordingReaderTest, SkipsWhatIsForeign) {
    const std::string foreign = blocks_.block(4, std::string(40, 'n')) + blocks_.block(5, std::string(8, 's')) +
                                blocks_.block(0x80000001, std::string(300'000, 'x')) + blocks_.block(77, "");
    const auto units = unitsOf(
        begin_ + foreign + blocks_.interface("eth0", 1) + blocks_.rawPacket(std::string(60, 'e'), 0, 0, {}, 0, 1) +
        blocks_.rawPacket("\0\x0c\0\x04http\0\0\0\0body"s, outbound) + blocks_.packet("ours", outbound) + foreign);
    ASSERT_EQ(units.size(), 1U);
    EXPECT_EQ(units[0].bytes, "ours");
}

TEST_F(RecordingReaderTest, EveryBeginningOfAFileIsReadAsFarAsItGoes) {
    const std::string first = begin_ + blocks_.packet("one", outbound);
    const std::string part = first + blocks_.packet("tw", inbound, 0, "bytes 0-1 of 3");
    const std::string whole = part + blocks_.packet("o", inbound, 0, "bytes 2-2 of 3");
    for (std::size_t size = 0; size <= whole.size(); ++size) {
        write(whole.substr(0, size));
        RecordingReader reader(file_);
        const std::size_t units = allOf(reader).size();
        EXPECT_EQ(units, size < first.size() ? 0U : size < whole.size() ? 1U : 2U) << size;
        const std::string said = reader.unfinished().value_or("nothing");
        const bool boundary = size == 0 || size == blocks_.section().size() || size == begin_.size() ||
                              size == first.size() || size == whole.size();
        if (boundary) {
            EXPECT_EQ(said, "nothing") << size;
        } else if (size == part.size()) {
            EXPECT_EQ(said, "the recording ends within a unit, at byte " + std::to_string(size) + ": the one at byte " +
                                std::to_string(first.size()) + " has 2 of 3 bytes");
        } else {
            EXPECT_EQ(said, "the recording ends within a block, at byte " + std::to_string(size));
        }
    }
}

TEST_F(RecordingReaderTest, GoesOnWhenTheFileGrows) {
    const std::string whole = begin_ + blocks_.packet("one", outbound) + blocks_.block(77, std::string(100, 'f')) +
                              blocks_.packet("two", inbound);
    write("");
    RecordingReader reader(file_);
    std::vector<std::string> found;
    for (const char byte : whole) {
        EXPECT_FALSE(reader.next().has_value());
        std::ofstream(file_, std::ios::binary | std::ios::app) << byte;
        if (auto unit = reader.next()) {
            found.push_back(unit->bytes);
        }
    }
    EXPECT_THAT(found, ::testing::ElementsAre("one", "two"));
    EXPECT_EQ(reader.unfinished(), std::nullopt);
}

TEST_F(RecordingReaderTest, ClaimsTakeNoMemory) {
    // A foreign block of 4 GiB, and a unit of 1 EiB; neither is there.
    const std::string foreign = blocks_.number(77) + blocks_.number(0xFFFFFFFC) + "the beginning";
    const std::string unit = blocks_.packet("beginning", outbound, 0, "bytes 0-8 of 1152921504606846976");
    write(begin_ + unit + foreign);
    RecordingReader reader(file_);
    EXPECT_FALSE(reader.next().has_value());
    // What either claims would be a mapping of its own.
    EXPECT_LT(::mallinfo2().hblkhd, std::size_t{64} << 20U);
    EXPECT_THAT(reader.unfinished().value_or(""), HasSubstr("ends within a block"));
}

TEST_F(RecordingReaderTest, FileThatIsNotThereIsNamed) {
    try {
        RecordingReader reader(directory_.file("none"));
        ADD_FAILURE();
    } catch (const std::system_error& error) {
        EXPECT_EQ(std::string(error.what()),
                  "cannot read '" + directory_.file("none") + "': No such file or directory");
    }
}

// Damage.

TEST_F(RecordingReaderTest, OtherFilesAreRefused) {
    EXPECT_EQ(errorOf("GIF89a and so on"),
              "byte 0: first bytes: expected 0a 0d 0d 0a, with which a file of the format pcapng begins, got 47 49 46 "
              "38");
    std::string order = blocks_.section();
    order[8] = 'x';
    EXPECT_EQ(errorOf(order), "byte 8: byte order of a section: expected 1a 2b 3c 4d or 4d 3c 2b 1a, got 78 3c 2b 1a");
    std::string version = blocks_.section();
    version[12] = 2;
    EXPECT_EQ(errorOf(version), "byte 12: version of the format: expected 1, got 2");
}

TEST_F(RecordingReaderTest, LengthsOfBlocksAreChecked) {
    const auto at = [this](std::size_t offset) { return "byte " + std::to_string(begin_.size() + offset) + ": "; };
    EXPECT_EQ(errorOf(begin_ + blocks_.number(6) + blocks_.number(8) + "12345678"),
              at(4) + "length of a block: expected a multiple of 4 from 12 on, got 8");
    EXPECT_EQ(errorOf(begin_ + blocks_.number(6) + blocks_.number(33) + "12345678"),
              at(4) + "length of a block: expected a multiple of 4 from 12 on, got 33");
    EXPECT_EQ(errorOf(begin_ + blocks_.number(6) + blocks_.number(0x10000000) + "12345678"),
              at(4) + "length of a block: expected at most 16777216, got 268435456");
    EXPECT_EQ(errorOf(begin_ + blocks_.number(6) + blocks_.number(16) + blocks_.number(0) + blocks_.number(16)),
              at(4) + "length of a packet: expected at least 32, got 16");
    for (const std::uint32_t type : {6U, 77U}) {
        EXPECT_EQ(errorOf(begin_ + blocks_.number(type) + blocks_.number(16) + blocks_.number(0) + blocks_.number(20)),
                  at(12) + "length at the end of a block: expected 16, got 20");
    }
}

TEST_F(RecordingReaderTest, FieldsOfPacketsAreChecked) {
    const std::string at = "byte " + std::to_string(begin_.size()) + ": ";
    const auto later = [this](std::size_t offset) { return "byte " + std::to_string(begin_.size() + offset) + ": "; };
    EXPECT_EQ(
        errorOf(begin_ + blocks_.rawPacket("data", outbound, 0, {}, 0, 3)),
        later(8) + "interface of a packet: expected one of the 1 that are described before it in its section, got 3");
    std::string captured = blocks_.packet("data", outbound);
    captured.replace(20, 4, blocks_.number(200));
    EXPECT_EQ(errorOf(begin_ + captured),
              later(20) + "captured length of a packet: expected at most the 32 bytes of its block, got 200");
    std::string option = blocks_.packet("data", outbound);
    option[28 + 20 + 2] = 100;
    EXPECT_EQ(errorOf(begin_ + option), later(28 + 20) +
                                            "length of an option: expected at most the 8 bytes that are "
                                            "left of its block, got 100");
    EXPECT_EQ(errorOf(begin_ + blocks_.packet("data", 0)),
              at + "direction in the flags of a packet: expected 1 (inbound) or 2 (outbound), got 0");
    EXPECT_EQ(errorOf(begin_ + blocks_.packet("data", outbound, 0, "bytes 0-9 of 5")),
              at + "comment of a packet with 4 bytes of a unit: expected its first and last byte, below the size, got "
                   "\"bytes 0-9 of 5\"");
    EXPECT_EQ(errorOf(blocks_.section() + blocks_.interface("eth0") + blocks_.packet("data", outbound)),
              "byte " + std::to_string((blocks_.section() + blocks_.interface("eth0")).size()) +
                  ": name of the packet's interface: expected \"client PID\" or \"engine PID\", got \"eth0\"");
    EXPECT_EQ(errorOf(blocks_.section() + blocks_.interface("client 7", 252, 0x8A)),
              "byte " + std::to_string(blocks_.section().size()) +
                  ": time resolution of an interface: expected from 0 to 9, the negative power of ten of a second, got "
                  "138");
}

TEST_F(RecordingReaderTest, PartsThatAreNotThereAreFound) {
    const std::string first = blocks_.packet("abc", outbound, 0, "bytes 0-2 of 9");
    const std::string last = blocks_.packet("ghi", outbound, 0, "bytes 6-8 of 9");
    const std::string at = "byte " + std::to_string(begin_.size()) + ": ";
    const std::string second = "byte " + std::to_string(begin_.size() + first.size()) +
                               ": packet behind a part of the unit at byte " + std::to_string(begin_.size()) +
                               ": expected bytes from 3 on of 9, got ";
    EXPECT_EQ(errorOf(begin_ + first + last), second + "bytes from 6 on of 9");
    EXPECT_EQ(errorOf(begin_ + first + first), second + "bytes from 0 on of 9");
    EXPECT_EQ(errorOf(begin_ + first + blocks_.packet("def", outbound, 0, "bytes 3-5 of 8")),
              second + "bytes from 3 on of 8");
    EXPECT_EQ(errorOf(begin_ + last),
              at + "first packet of a unit: expected bytes from 0 on, got bytes from 6 on of 9");
}

// A byte changed anywhere is an error, or something else that is read; never a crash.
TEST_F(RecordingReaderTest, AnyDamageIsSurvived) {
    const std::string whole = begin_ + blocks_.packet("abc", outbound, 0, "bytes 0-2 of 5") +
                              blocks_.packet("de", outbound, 0, "bytes 3-4 of 5") + blocks_.block(4, "12345678") +
                              blocks_.packet("xyz", inbound);
    std::size_t refused = 0;
    for (std::size_t i = 0; i < whole.size(); ++i) {
        for (const char value : {'\0', '\xff'}) {
            std::string damaged = whole;
            damaged[i] = value;
            refused += errorOf(damaged) == "none" ? 0 : 1;
        }
    }
    EXPECT_GT(refused, whole.size() / 2);
}

}  // namespace
}  // namespace apps
