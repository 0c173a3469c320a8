#include "common/Build.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace apps {
namespace {

TEST(BuildTest, NamesProgramVersionAndCompiler) {
    EXPECT_THAT(buildString("krutil"),
                ::testing::MatchesRegex("krutil [0-9]+\\.[0-9]+\\.[0-9]+ "
                                        "\\(krutil_protobuf, (GCC|Clang) [0-9]+\\.[0-9]+\\.[0-9]+\\)"));
}

}  // namespace
}  // namespace apps
