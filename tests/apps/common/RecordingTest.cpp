// The bytes of a recording. docs/recording.md describes them.
#include "common/Recording.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <string>
#include <system_error>
#include <vector>

#include "apps/common/RecordingFixture.hpp"

namespace apps {
namespace {

using test_support::contentOf;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

constexpr std::size_t largestPart = 262'128;

class RecordingTest : public RecordingFixture {
  protected:
    // The text of the exception with which a recording refuses its file.
    std::string refusal() {
        try {
            const Recording made = recording();
        } catch (const std::runtime_error& error) {
            return error.what();
        }
        return "none";
    }
};

TEST_F(RecordingTest, HasTheseBytes) {
    Recording made = recording();
    made.setClock([] { return timespec{0x12345678, 1}; });
    made.beginSession(Recording::Role::Client, "krutil 1");
    recordPieces(made, Direction::Sent, Part::Handshake, {"he", "", "llo"});
    const std::string pid = std::to_string(::getpid());
    const std::string name = "client " + pid + std::string((4 - (7 + pid.size()) % 4) % 4, '\0');
    const auto little = [](std::size_t value) { return std::string{static_cast<char>(value), 0, 0, 0}; };
    const std::string nameSize{static_cast<char>(7 + pid.size()), 0};
    const std::string interfaceSize = little(16 + 4 + name.size() + 8 + 4 + 4);
    using namespace std::string_literals;
    const std::string expected =
        // Section header: size, byte order, version, unknown length, program.
        "\x0a\x0d\x0d\x0a"s + little(44) + "\x4d\x3c\x2b\x1a\x01\0\0\0\xff\xff\xff\xff\xff\xff\xff\xff"s +
        "\x04\0\x08\0krutil 1\0\0\0\0"s + little(44) +
        // Interface: size, link type, snap length, name, nanoseconds.
        "\x01\0\0\0"s + interfaceSize + "\xfc\0\0\0\0\0\x04\0"s + "\x02\0"s + nameSize + name +
        "\x09\0\x01\0\x09\0\0\0\0\0\0\0"s + interfaceSize +
        // Packet: size, interface, time 305,419,896 s and 1 ns, captured and original length.
        "\x06\0\0\0"s + little(68) + "\0\0\0\0"s + "\xc6\x11\x3d\x04\x01\xb0\x6a\xf8"s + little(21) + little(21) +
        "\0\x0c\0\x08krutil\0\0\0\0\0\0"s + "hello\0\0\0"s + "\x02\0\x04\0\x02\0\0\0\0\0\0\0"s + little(68);
    EXPECT_EQ(contentOf(file_), expected);
}

TEST_F(RecordingTest, IsForItsUserAlone) {
    const Recording made = recording();
    struct stat status {};
    ASSERT_EQ(::stat(file_.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777U, 0600U);
}

TEST_F(RecordingTest, EmptiesAFileThatIsThereAndTakesItsReadersAway) {
    std::ofstream(file_) << "what was there";
    ::chmod(file_.c_str(), 0644);
    const Recording made = recording();
    EXPECT_EQ(contentOf(file_), "");
    struct stat status {};
    ASSERT_EQ(::stat(file_.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777U, 0600U);
}

TEST_F(RecordingTest, GoesWhereNobodyElseSays) {
    std::ofstream(directory_.file("other")) << "precious";
    std::filesystem::create_hard_link(directory_.file("other"), file_);
    EXPECT_EQ(refusal(), "cannot record to '" + file_ + "': the file has 2 names; name a file of your own");
    EXPECT_EQ(contentOf(directory_.file("other")), "precious");
}

TEST_F(RecordingTest, DirectionsAndTimesAreThoseOfTheUnits) {
    Recording made = recording();
    made.beginSession(Recording::Role::Engine, "krutil-qvm");
    made.setClock([] { return timespec{1, 2}; });
    record(made, Direction::Received, Part::Handshake, "one");
    made.setClock([] { return timespec{5'000'000'000, 999'999'999}; });
    record(made, Direction::Sent, Part::Frame, "two");
    const std::vector<RecordedPacket> packets = recorded(file_);
    ASSERT_EQ(packets.size(), 2U);
    EXPECT_EQ(packets[0].interface, "engine " + std::to_string(::getpid()));
    EXPECT_EQ(packets[0].flags, 1U);
    EXPECT_EQ(packets[0].nanoseconds, 1'000'000'002U);
    EXPECT_EQ(packets[0].data, "one");
    EXPECT_EQ(packets[0].comment, "");
    EXPECT_EQ(packets[1].flags, 2U);
    EXPECT_EQ(packets[1].nanoseconds, 5'000'000'000'999'999'999U);
    EXPECT_EQ(packets[1].data, "two");
}

TEST_F(RecordingTest, LargeUnitSpansPackets) {
    Recording made = recording();
    made.beginSession(Recording::Role::Client, "krutil");
    const std::string whole = std::string(largestPart - 1, 'a') + 'b';
    record(made, Direction::Sent, Part::Frame, whole);
    recordPieces(made, Direction::Sent, Part::Frame, {whole.substr(0, 100), whole.substr(100), "c"});
    recordPieces(made, Direction::Sent, Part::Handshake, {std::string(2 * largestPart, 'd'), "ee"});
    const std::vector<RecordedPacket> packets = recorded(file_);
    ASSERT_EQ(packets.size(), 6U);
    EXPECT_TRUE(packets[0].data == whole);
    EXPECT_EQ(packets[0].comment, "");
    EXPECT_EQ(packets[0].original, 262'144U);
    EXPECT_TRUE(packets[1].data == whole);
    EXPECT_EQ(packets[1].comment, "bytes 0-262127 of 262129");
    EXPECT_EQ(packets[1].original, 262'144U);
    EXPECT_EQ(packets[2].data, "c");
    EXPECT_EQ(packets[2].comment, "bytes 262128-262128 of 262129");
    EXPECT_EQ(packets[2].original, 17U);
    EXPECT_EQ(packets[3].comment, "bytes 0-262127 of 524258");
    EXPECT_EQ(packets[4].comment, "bytes 262128-524255 of 524258");
    EXPECT_EQ(packets[5].data, "ee");
    EXPECT_EQ(packets[5].comment, "bytes 524256-524257 of 524258");
}

TEST_F(RecordingTest, SnapKeepsTheBeginningsOfFramesOnly) {
    Recording made = recording({{}, 30});
    made.beginSession(Recording::Role::Client, "krutil");
    record(made, Direction::Sent, Part::Handshake, std::string(31, 'h'));
    record(made, Direction::Sent, Part::Frame, std::string(30, 'f'));
    recordPieces(made, Direction::Sent, Part::Frame, {std::string(25, 'g'), std::string(1'000'000, 'g')});
    const std::vector<RecordedPacket> packets = recorded(file_);
    ASSERT_EQ(packets.size(), 3U);
    EXPECT_EQ(packets[0].data, std::string(31, 'h'));
    EXPECT_EQ(packets[0].original, 47U);
    EXPECT_EQ(packets[1].data, std::string(30, 'f'));
    EXPECT_EQ(packets[1].original, 46U);
    EXPECT_EQ(packets[1].comment, "");
    EXPECT_EQ(packets[2].data, std::string(30, 'g'));
    EXPECT_EQ(packets[2].original, 16U + 1'000'025U);
    EXPECT_EQ(packets[2].comment, "bytes 0-29 of 1000025");
}

TEST_F(RecordingTest, SnapBeyondAPacketCutsTheLastOne) {
    Recording made = recording({{}, largestPart + 10});
    made.beginSession(Recording::Role::Client, "krutil");
    record(made, Direction::Sent, Part::Frame, std::string(600'000, 'f'));
    const std::vector<RecordedPacket> packets = recorded(file_);
    ASSERT_EQ(packets.size(), 2U);
    EXPECT_EQ(packets[0].original, 262'144U);
    EXPECT_EQ(packets[1].data, std::string(10, 'f'));
    EXPECT_EQ(packets[1].original, 16U + 600'000U - largestPart);
    EXPECT_EQ(packets[1].comment, "bytes 262128-262137 of 600000");
}

TEST_F(RecordingTest, SnapKeepsHeaders) {
    Recording made = recording({{}, 1});
    made.beginSession(Recording::Role::Client, "krutil");
    record(made, Direction::Sent, Part::Frame, std::string(25, 'f'));
    EXPECT_EQ(recorded(file_).at(0).comment, "bytes 0-23 of 25");
}

TEST_F(RecordingTest, OriginalLengthEndsWithItsField) {
    Recording made = recording({{}, 24});
    made.beginSession(Recording::Role::Client, "krutil");
    // The bytes behind the first ones are not looked at.
    std::string header(24, 'h');
    const std::array<iovec, 2> unit{iovec{header.data(), header.size()}, iovec{header.data(), std::size_t{5} << 30U}};
    made.record(Direction::Sent, Part::Frame, unit);
    EXPECT_EQ(recorded(file_).at(0).original, 4'294'967'295U);
    EXPECT_EQ(recorded(file_).at(0).comment, "bytes 0-23 of 5368709144");
}

TEST_F(RecordingTest, SecondSessionIsASectionOfItsOwn) {
    Recording made = recording();
    made.beginSession(Recording::Role::Client, "krutil");
    record(made, Direction::Sent, Part::Handshake, "first");
    const std::string before = contentOf(file_);
    made.beginSession(Recording::Role::Client, "krutil");
    EXPECT_EQ(contentOf(file_).substr(before.size(), 4), "\x0a\x0d\x0d\x0a");
    record(made, Direction::Sent, Part::Handshake, "second");
    EXPECT_EQ(recorded(file_).at(1).data, "second");
}

TEST_F(RecordingTest, FullDiskIsToldOnceAndLeavesWholePackets) {
    Recording made = recording();
    made.beginSession(Recording::Role::Client, "krutil");
    record(made, Direction::Sent, Part::Frame, "fits");
    EXPECT_TRUE(made.isComplete());
    const std::string before = contentOf(file_);
    struct rlimit limit {};
    ASSERT_EQ(::getrlimit(RLIMIT_FSIZE, &limit), 0);
    const auto handling = std::signal(SIGXFSZ, SIG_IGN);
    const struct rlimit small { before.size() + 50, limit.rlim_max };
    ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &small), 0);
    record(made, Direction::Sent, Part::Frame, std::string(100, 'x'));
    ::setrlimit(RLIMIT_FSIZE, &limit);
    std::signal(SIGXFSZ, handling);
    record(made, Direction::Sent, Part::Frame, "would fit again");
    EXPECT_FALSE(made.isComplete());
    EXPECT_THAT(complaints_, ElementsAre("cannot write to '" + file_ + "': File too large; the recording ends here"));
    EXPECT_EQ(contentOf(file_), before);
}

TEST_F(RecordingTest, DeviceIsWrittenToAsItIs) {
    Recording made({"/dev/full", 100}, [this](const std::string& sentence) { complaints_.push_back(sentence); });
    EXPECT_THAT(complaints_, IsEmpty());
    made.beginSession(Recording::Role::Client, "krutil");
    EXPECT_THAT(complaints_,
                ElementsAre("cannot write to '/dev/full': No space left on device; the recording ends here"));
}

}  // namespace
}  // namespace apps
