// What tests of recordings have in common: a file, and sessions that are recorded to it.
#pragma once

#include <gtest/gtest.h>
#include <sys/uio.h>

#include <string>
#include <utility>
#include <vector>

#include "common/Recording.hpp"
#include "support/FileContent.hpp"
#include "support/Pcapng.hpp"
#include "support/TemporaryDirectory.hpp"

namespace apps {

class RecordingFixture : public ::testing::Test {
  protected:
    using Direction = Recording::Direction;
    using Part = Recording::Part;
    using RecordedPacket = test_support::RecordedPacket;

    /// A recording to `file_` if the options name none.
    Recording recording(RecordOptions options = {}) {
        if (options.file.empty()) {
            options.file = file_;
        }
        return Recording(options, [this](const std::string& sentence) { complaints_.push_back(sentence); });
    }

    static void record(Recording& recording, Direction direction, Part part, std::string unit) {
        recordPieces(recording, direction, part, {std::move(unit)});
    }

    /// Records a unit that a session hands over in several pieces.
    static void recordPieces(Recording& recording, Direction direction, Part part, std::vector<std::string> pieces) {
        std::vector<iovec> unit;
        for (std::string& piece : pieces) {
            unit.push_back({piece.data(), piece.size()});
        }
        recording.record(direction, part, unit);
    }

    /// The packets in a file. Throws std::runtime_error for what is no recording.
    static std::vector<RecordedPacket> recorded(const std::string& file) {
        return test_support::packetsOf(test_support::contentOf(file));
    }

    const test_support::TemporaryDirectory directory_{};
    const std::string file_ = directory_.file("session.pcapng");
    std::vector<std::string> complaints_{};  ///< of recordings
};

}  // namespace apps
