// Memory that runs out, at each allocation in turn, in both directions of every serializer: an exception, no frame of
// the object's own, nothing that stays behind, and the next attempt works.

#include <gtest/gtest.h>

#include <cctype>
#include <exception>
#include <memory>
#include <string>
#include <vector>

#include "krutil_protobuf/serializers/AllocationRecorder.hpp"
#include "krutil_protobuf/support/TestTransport.hpp"
#include "samples/Samples.hpp"

namespace {

using samples::Sample;
using samples::SampleSet;
using transport::FrameContent;
using transport::RecordingStream;
using transport::Registry;
using transport::SerializationContext;
using transport::SerializerBase;

class AllocationFailureTest : public testing::TestWithParam<std::string> {
  protected:
    // Runs `attempt` with each of its allocations failing in turn from number `first` on, and after each failure once
    // as it is. `attempt` returns whether it has done its work; false means that it has thrown. Returns how many
    // allocations are left.
    template <class Attempt>
    static long failInTurn(const Attempt& attempt, long first) {
        long outstanding = 0;
        for (long failing = first;; ++failing) {
            AllocationRecorder recorder(failing);
            const bool done = attempt();
            recorder.stop();
            outstanding += recorder.outstanding();
            EXPECT_EQ(done, !recorder.failed()) << "allocation " << failing;
            if (done || !recorder.failed()) {
                EXPECT_GT(failing, first) << "nothing was allocated";
                return outstanding;
            }
            AllocationRecorder second;
            EXPECT_TRUE(attempt()) << "behind a failure of allocation " << failing;
            second.stop();
            outstanding += second.outstanding();
        }
    }

    // What a thread keeps for its next messages stays behind, and so do the tables that find a buffer by its address:
    // each is made once. A leak stays behind every time.
    template <class Attempt>
    static void expectNothingLeft(const std::string& sample, const Attempt& attempt, long first = 0) {
        const testing::ScopedTrace trace(__FILE__, __LINE__, sample);
        constexpr int tables = 64;
        long left = failInTurn(attempt, first);
        for (int round = 0; round < tables && left != 0; ++round) {
            left = failInTurn(attempt, first);
        }
        EXPECT_EQ(left, 0);
    }

    const SampleSet& set_ = samples::sampleSet(GetParam());
    const std::shared_ptr<const Registry> registry_ = transport::sessionRegistry();
    const SerializerBase& serializer_ = *registry_->find(set_.serializer);
};

TEST_P(AllocationFailureTest, Writing) {
    for (const Sample& sample : set_.samples) {
        const std::size_t frames = transport::writtenFrames(serializer_, sample.object, registry_).size();
        const auto stream = std::make_shared<RecordingStream>();
        // The stream itself allocates nothing.
        stream->frames.reserve(frames);
        expectNothingLeft(sample.name, [&] {
            bool done = false;
            try {
                samples::write(serializer_, sample.object, 7, 1, stream, registry_, SerializationContext());
                done = true;
            } catch (const std::exception&) {
            }
            // Frames of what the object refers to may be there, its own is the last one.
            EXPECT_EQ(stream->frames.size() == frames, done);
            stream->frames.clear();
            return done;
        });
    }
}

TEST_P(AllocationFailureTest, Reading) {
    for (const Sample& sample : set_.samples) {
        const std::vector<FrameContent> frames = transport::writtenFrames(serializer_, sample.object, registry_);
        // A message can be read once, so each attempt makes one. That must not fail.
        AllocationRecorder making;
        transport::makeMessage(frames);
        making.stop();
        const auto read = [&] {
            const auto message = transport::makeMessage(frames);
            try {
                samples::read(serializer_, frames.size(), message, registry_, SerializationContext());
                return true;
            } catch (const std::exception&) {
                return false;
            }
        };
        expectNothingLeft(sample.name, read, static_cast<long>(making.allocations()));
    }
}

std::string nameOf(const testing::TestParamInfo<std::string>& info) {
    std::string name;
    for (const char c : info.param.substr(info.param.find(':') + 1)) {
        name += std::isalnum(static_cast<unsigned char>(c)) != 0 ? std::string(1, c) : "";
    }
    return name;
}

std::vector<std::string> allSerializers() {
    std::vector<std::string> names;
    for (const SampleSet& set : samples::sampleSets()) {
        names.push_back(set.serializer);
    }
    return names;
}

INSTANTIATE_TEST_SUITE_P(Serializers, AllocationFailureTest, testing::ValuesIn(allSerializers()), nameOf);

}  // namespace
