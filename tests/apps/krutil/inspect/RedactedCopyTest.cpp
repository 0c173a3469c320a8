// Redacted copies of recordings.
#include "krutil/inspect/RedactedCopy.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <string>

#include "apps/common/RecordingFixture.hpp"
#include "krutil/base/ExitCode.hpp"
#include "krutil/base/Interrupt.hpp"

namespace krutil_client {
namespace {

using apps::Recording;
using test_support::contentOf;

class RedactedCopyTest : public apps::RecordingFixture {
  protected:
    void recordSession(std::uint64_t snap = std::numeric_limits<std::uint64_t>::max()) {
        apps::RecordOptions options;
        options.snap = snap;
        Recording made = recording(options);
        made.beginSession(Recording::Role::Client, "krutil 0.1.0");
        record(made, Direction::Sent, Part::Handshake, "\x89KRUTIL\n12345678secret greeting");
        record(made, Direction::Received, Part::Handshake, "\x89KRUTIL\n12345678secret greeting");
        record(made, Direction::Sent, Part::Handshake, "verdict");
        record(made, Direction::Received, Part::Handshake, "verdict");
        record(made, Direction::Sent, Part::Frame,
               std::string("\x82") + std::string(23, '\0') + std::string(600'000, 's'));
    }

    // The sentence with which a copy is refused.
    std::string refusal() {
        try {
            redactRecording(file_, out_, interrupt_);
        } catch (const Failure& failure) {
            EXPECT_EQ(failure.code(), ExitCode::Usage);
            return failure.what();
        }
        return "none";
    }

    const std::string out_ = directory_.file("redacted.pcapng");
    Interrupt interrupt_{};
};

TEST_F(RedactedCopyTest, HasTheSamePackets) {
    recordSession();
    EXPECT_EQ(redactRecording(file_, out_, interrupt_), std::nullopt);
    EXPECT_EQ(std::filesystem::file_size(out_), std::filesystem::file_size(file_));
    const auto before = recorded(file_);
    const auto now = recorded(out_);
    ASSERT_EQ(now.size(), before.size());
    for (std::size_t i = 0; i < now.size(); ++i) {
        EXPECT_EQ(now[i].interface, before[i].interface);
        EXPECT_EQ(now[i].flags, before[i].flags);
        EXPECT_EQ(now[i].nanoseconds, before[i].nanoseconds);
        EXPECT_EQ(now[i].original, before[i].original);
        EXPECT_EQ(now[i].comment, before[i].comment);
        EXPECT_EQ(now[i].data.size(), before[i].data.size());
    }
    EXPECT_EQ(contentOf(out_).find("secret"), std::string::npos);
    EXPECT_EQ(contentOf(out_).find("ssss"), std::string::npos);
    EXPECT_NE(contentOf(out_).find("krutil 0.1.0"), std::string::npos);
    struct stat status {};
    ASSERT_EQ(::stat(out_.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777U, 0600U);
}

TEST_F(RedactedCopyTest, CutFramesStayCut) {
    recordSession(100);
    EXPECT_EQ(redactRecording(file_, out_, interrupt_), std::nullopt);
    const auto packets = recorded(out_);
    EXPECT_EQ(packets.back().comment, "bytes 0-99 of 600024");
    EXPECT_EQ(packets.back().original, 16U + 600'024U);
}

TEST_F(RedactedCopyTest, TouchesNoFileThatIsThere) {
    recordSession();
    std::ofstream(out_) << "precious";
    EXPECT_EQ(refusal(), "cannot create '" + out_ + "': File exists");
    EXPECT_EQ(contentOf(out_), "precious");
}

TEST_F(RedactedCopyTest, WhatIsNoRecordingIsRefused) {
    EXPECT_EQ(refusal(), "cannot read '" + file_ + "': No such file or directory");
    std::ofstream(file_) << "precious text";
    EXPECT_THAT(refusal(), ::testing::StartsWith("'" + file_ + "', byte 0: first bytes: expected 0a 0d 0d 0a"));
}

TEST_F(RedactedCopyTest, BeginningOfAFrameIsLeftOut) {
    recordSession();
    std::filesystem::resize_file(file_, std::filesystem::file_size(file_) - 100);
    const auto note = redactRecording(file_, out_, interrupt_);
    ASSERT_TRUE(note);
    EXPECT_THAT(*note, ::testing::StartsWith("the recording ends within a block, at byte "));
    EXPECT_EQ(recorded(out_).size(), 4U);
}

}  // namespace
}  // namespace krutil_client
