// Recordings whose files are bounded.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <limits>
#include <stdexcept>
#include <string>
#include <vector>

#include "apps/common/RecordingFixture.hpp"

namespace apps {
namespace {

using ::testing::ElementsAre;

constexpr std::uint64_t bound = RecordOptions::smallestSize;

class RecordingSizeTest : public RecordingFixture {
  protected:
    Recording recording(const std::string& file, std::uint64_t snap = std::numeric_limits<std::uint64_t>::max()) {
        RecordOptions options;
        options.snap = snap;
        options.file = file;
        options.size = bound;
        return RecordingFixture::recording(options);
    }

    // A tagged frame that is a message.
    static std::string message(unsigned stream, const std::string& tag, std::size_t content) {
        std::string bytes(24, '\0');
        bytes[0] = '\x81';
        bytes[2] = static_cast<char>(tag.size());
        bytes[4] = static_cast<char>(stream);
        return bytes + tag + std::string(content, 'c');
    }
};

TEST_F(RecordingSizeTest, LaterFileBeginsWithWhatIsOpen) {
    Recording made = recording(file_);
    made.beginSession(Recording::Role::Client, "krutil");
    made.setClock([] { return timespec{1, 0}; });
    record(made, Direction::Sent, Part::Handshake, "first message");
    const std::string request = message(1, "krutil:IIPEnqueueMessage", 10);
    record(made, Direction::Sent, Part::Frame, request);
    made.setClock([] { return timespec{2, 0}; });
    const std::string text = message(1, "krutil:TextBaseEvent", 300'000);
    for (int i = 0; i < 3; ++i) {
        record(made, Direction::Received, Part::Frame, text);
    }
    EXPECT_FALSE(std::filesystem::exists(file_ + ".1"));
    record(made, Direction::Received, Part::Frame, text);

    EXPECT_EQ(recorded(file_ + ".1").size(), 2U + 3U * 2U);
    const auto packets = recorded(file_);
    ASSERT_EQ(packets.size(), 4U);
    EXPECT_EQ(packets[0].section, "continued: repeats 2 packets of an earlier file");
    EXPECT_EQ(packets[0].interface, "client " + std::to_string(::getpid()));
    EXPECT_EQ(packets[0].data, "first message");
    EXPECT_EQ(packets[0].nanoseconds, 1'000'000'000U);
    EXPECT_EQ(packets[1].data, request);
    EXPECT_EQ(packets[1].flags, 2U);
    EXPECT_EQ(packets[1].nanoseconds, 1'000'000'000U);
    EXPECT_EQ(packets[2].nanoseconds, 2'000'000'000U);
    EXPECT_TRUE(packets[2].data + packets[3].data == text);

    // Each file begins alike, and takes the place of the one before.
    for (int i = 0; i < 5; ++i) {
        record(made, Direction::Received, Part::Frame, text);
    }
    for (const std::string& file : {file_, file_ + ".1"}) {
        EXPECT_EQ(recorded(file).at(1).data, request);
        EXPECT_LE(std::filesystem::file_size(file), bound);
        struct stat status {};
        ASSERT_EQ(::stat(file.c_str(), &status), 0);
        EXPECT_EQ(status.st_mode & 07777U, 0600U);
    }
    EXPECT_FALSE(std::filesystem::exists(file_ + ".1.1"));
    EXPECT_FALSE(std::filesystem::exists(file_ + ".2"));
    EXPECT_TRUE(made.isComplete());
}

TEST_F(RecordingSizeTest, FrameThatIsTooLargeForAFileIsCut) {
    Recording made = recording(file_);
    made.beginSession(Recording::Role::Client, "krutil");
    const std::string small = message(1, "krutil:TextBaseEvent", 1);
    record(made, Direction::Received, Part::Frame, small);
    const std::string large = message(1, "krutil:TextBaseEvent", 3 * bound);
    record(made, Direction::Received, Part::Frame, large);
    const auto packets = recorded(file_);
    std::string kept;
    for (const RecordedPacket& packet : packets) {
        kept += packet.data;
    }
    EXPECT_LE(std::filesystem::file_size(file_), bound);
    EXPECT_GT(std::filesystem::file_size(file_), bound - 1'000);
    EXPECT_TRUE(kept == large.substr(0, kept.size()));
    EXPECT_EQ(packets.back().original, 16U + packets.back().data.size() + large.size() - kept.size());
    EXPECT_THAT(packets.back().comment, ::testing::EndsWith(" of " + std::to_string(large.size())));
    // Recording goes on in the next file.
    const std::string next = message(1, "krutil:TextBaseEvent", 2'000);
    record(made, Direction::Received, Part::Frame, next);
    ASSERT_EQ(recorded(file_).size(), 1U);
    EXPECT_EQ(recorded(file_)[0].data, next);
}

TEST_F(RecordingSizeTest, SnapHoldsForWhatIsRepeated) {
    Recording made = recording(file_, 30);
    made.beginSession(Recording::Role::Client, "krutil");
    record(made, Direction::Sent, Part::Frame, message(1, "krutil:IIPEnqueueMessage", 10));
    while (!std::filesystem::exists(file_ + ".1")) {
        record(made, Direction::Sent, Part::Frame, message(0, "krutil:TextBaseEvent", 10));
    }
    EXPECT_EQ(recorded(file_).at(0).data.size(), 30U);
    EXPECT_EQ(recorded(file_).at(0).comment, "bytes 0-29 of 58");
}

TEST_F(RecordingSizeTest, FilesNeverExceedTheirBound) {
    Recording made = recording(file_);
    made.beginSession(Recording::Role::Client, "krutil");
    for (int i = 0; i < 4; ++i) {
        record(made, i % 2 == 0 ? Direction::Sent : Direction::Received, Part::Handshake, std::string(65'552, 'h'));
    }
    // More open exchanges than there is room for, and all that ends at other places in the file.
    for (unsigned i = 1; i < 60; ++i) {
        record(made, Direction::Sent, Part::Frame, message(i, "krutil:IIPEnqueueMessage", 60'000 + i));
        record(made, Direction::Received, Part::Frame, message(i, "krutil:TextBaseEvent", i * 20'000));
        EXPECT_LE(std::filesystem::file_size(file_), bound);
    }
    EXPECT_TRUE(std::filesystem::exists(file_ + ".1"));
    EXPECT_LE(std::filesystem::file_size(file_ + ".1"), bound);
    EXPECT_TRUE(made.isComplete());
}

TEST_F(RecordingSizeTest, ProcessMayGoElsewhere) {
    const std::filesystem::path before = std::filesystem::current_path();
    std::filesystem::current_path(directory_.path());
    Recording made = recording("session.pcapng");
    std::filesystem::current_path(before);
    made.beginSession(Recording::Role::Client, "krutil");
    for (int i = 0; i < 2; ++i) {
        record(made, Direction::Received, Part::Frame, message(1, "krutil:TextBaseEvent", 600'000));
    }
    EXPECT_TRUE(std::filesystem::exists(file_));
    EXPECT_TRUE(std::filesystem::exists(file_ + ".1"));
}

TEST_F(RecordingSizeTest, SecondSessionRepeatsNothingOfTheFirst) {
    Recording made = recording(file_);
    made.beginSession(Recording::Role::Client, "krutil");
    record(made, Direction::Sent, Part::Handshake, "first message");
    record(made, Direction::Received, Part::Frame, message(1, "krutil:TextBaseEvent", 600'000));
    made.beginSession(Recording::Role::Client, "krutil");
    record(made, Direction::Received, Part::Frame, message(1, "krutil:TextBaseEvent", 600'000));
    ASSERT_EQ(recorded(file_).size(), 3U);
    EXPECT_EQ(recorded(file_)[0].section, "continued: repeats 0 packets of an earlier file");
}

TEST_F(RecordingSizeTest, FailureToRenameIsToldOnce) {
    Recording made = recording(file_);
    made.beginSession(Recording::Role::Client, "krutil");
    std::filesystem::create_directory(file_ + ".1");
    for (int i = 0; i < 3; ++i) {
        record(made, Direction::Received, Part::Frame, message(1, "krutil:TextBaseEvent", 600'000));
    }
    EXPECT_THAT(complaints_, ElementsAre("cannot rename '" + file_ + "' to '" + file_ +
                                         ".1': Is a directory; the recording ends here"));
    EXPECT_FALSE(made.isComplete());
    EXPECT_EQ(recorded(file_).size(), 3U);
}

TEST_F(RecordingSizeTest, DeviceHasNoSize) {
    try {
        const Recording made = recording("/dev/null");
        ADD_FAILURE() << "it was accepted";
    } catch (const std::runtime_error& error) {
        EXPECT_STREQ(error.what(),
                     "cannot record to '/dev/null': expected a regular file, because its size is bounded; leave out "
                     "--record-size");
    }
}

}  // namespace
}  // namespace apps
