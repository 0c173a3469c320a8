// The conformance vectors are what the samples give, and the library reads them as the manifest says.

#include <gtest/gtest.h>

#include <set>

#include "conformance/vectors/Layout.hpp"
#include "conformance/vectors/Manifest.hpp"
#include "conformance/vectors/Vectors.hpp"

namespace {

using conformance::Reading;
using conformance::Vector;

std::vector<Reading> readingsOf(const std::string& bytes) {
    std::vector<Reading> readings;
    conformance::StreamOfMessages messages;
    messages.feed(bytes, [&](Reading reading) { readings.push_back(std::move(reading)); });
    EXPECT_TRUE(messages.atBoundary());
    return readings;
}

TEST(ConformanceTest, FilesAreWhatTheSamplesGive) {
    const auto wanted = conformance::renderedFiles();
    const auto found = conformance::filesOnDisk();
    for (const auto& [path, content] : wanted) {
        const auto file = found.find(path);
        EXPECT_TRUE(file != found.end() && file->second == content)
            << path << " in " << conformance::directory()
            << " is not what the samples give. If the change is meant, run the program krutil_regenerate_conformance "
               "from the build tree and review the difference.";
    }
    for (const auto& [path, content] : found) {
        EXPECT_TRUE(wanted.contains(path)) << path << " is of no vector";
    }
}

TEST(ConformanceTest, TheLibraryReadsEachVectorAsTheManifestSays) {
    for (const Vector& vector : conformance::vectors()) {
        SCOPED_TRACE(vector.type + " " + vector.name);
        const auto readings = readingsOf(conformance::bytesOf(vector.frames));
        ASSERT_EQ(readings.size(), 1U);
        EXPECT_EQ(readings[0].type, vector.type);
        EXPECT_EQ(readings[0].refusal, vector.refusal);
        EXPECT_EQ(readings[0].description, vector.reading);
        EXPECT_EQ(readings[0].accepted, vector.accepted);
    }
}

TEST(ConformanceTest, EveryTypeHasWellFormedAndMalformedVectors) {
    std::set<std::pair<std::string, bool>> found;
    for (const Vector& vector : conformance::vectors()) {
        found.emplace(vector.type, vector.wellFormed);
    }
    std::set<std::pair<std::string, bool>> expected;
    const auto registry = transport::sessionRegistry();
    for (const auto& serializer : registry->serializers()) {
        expected.emplace(serializer->name(), true);
        expected.emplace(serializer->name(), false);
    }
    EXPECT_EQ(found, expected);
}

}  // namespace
