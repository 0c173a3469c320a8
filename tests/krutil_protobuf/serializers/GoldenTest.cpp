// The bytes that peers see do not change unnoticed.

#include <gtest/gtest.h>

#include <fstream>
#include <iterator>
#include <set>

#include "krutil_protobuf/support/Goldens.hpp"

namespace {

std::string contentOf(const std::filesystem::path& file) {
    std::ifstream in(file, std::ios::binary);
    return {std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
}

constexpr const char* advice =
    "\nIf the change is meant, run the program krutil_regenerate_goldens from the build tree and review the "
    "difference under tests/golden.";

TEST(GoldenTest, SamplesGiveTheGoldenBytes) {
    const auto registry = transport::sessionRegistry();
    for (const auto& serializer : registry->serializers()) {
        const auto file = goldens::fileOf(serializer->name());
        EXPECT_TRUE(contentOf(file) == goldens::render(samples::sampleSet(serializer->name()), registry))
            << file << " does not hold what " << serializer->name() << " writes." << advice;
    }
}

TEST(GoldenTest, GoldenBytesReadAsTheSamples) {
    const auto registry = transport::sessionRegistry();
    for (const auto& serializer : registry->serializers()) {
        const samples::SampleSet& set = samples::sampleSet(serializer->name());
        const auto file = goldens::fileOf(serializer->name());
        ASSERT_TRUE(std::filesystem::exists(file)) << file << advice;
        const auto parsed = goldens::parse(contentOf(file));
        EXPECT_EQ(parsed.size(), set.samples.size()) << serializer->name() << advice;
        for (const samples::Sample& sample : set.samples) {
            ASSERT_TRUE(parsed.contains(sample.name)) << serializer->name() << " " << sample.name << advice;
            const auto& frames = parsed.at(sample.name);
            const auto object = samples::read(*serializer, frames.back().index, transport::makeMessage(frames),
                                              registry, transport::SerializationContext());
            EXPECT_EQ(set.describe(object, samples::View::AsIs), set.describe(sample.object, samples::View::AfterTrip))
                << serializer->name() << " " << sample.name;
        }
    }
}

TEST(GoldenTest, EveryFileIsOfOneSerializer) {
    std::set<std::filesystem::path> expected;
    const auto registry = transport::sessionRegistry();
    for (const auto& serializer : registry->serializers()) {
        expected.insert(goldens::fileOf(serializer->name()));
    }
    std::set<std::filesystem::path> found;
    for (const auto& entry : std::filesystem::directory_iterator(goldens::directory())) {
        found.insert(entry.path());
    }
    EXPECT_EQ(found, expected) << advice;
}

// Written out once by hand, so that the frames' form does not rest on the regenerated files alone.
TEST(GoldenTest, OneSampleByHand) {
    const auto registry = transport::sessionRegistry();
    const samples::SampleSet& set = samples::sampleSet("krutil:TextBaseEvent");
    const auto frames = transport::writtenFrames(*registry->find(set.serializer), set.samples.front().object, registry);
    ASSERT_EQ(frames.size(), 1U);
    EXPECT_EQ(frames[0].bytes, std::string("\x0A\x15"                                      // id
                                           "\x08\xEF\x9B\xAF\xCD\xF8\xAC\xD1\x91\x01"      // id.hi
                                           "\x10\x90\xE4\xD0\xB2\x87\xD3\xAE\xEE\xFE\x01"  // id.lo
                                           "\x10\x01"                                      // stream: error
                                           "\x1A\x0D"
                                           "x =\n\n    42\n\n"));  // text
}

}  // namespace
