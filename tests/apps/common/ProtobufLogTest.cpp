#include "common/ProtobufLog.hpp"

#include <gmock/gmock.h>
#include <google/protobuf/stubs/logging.h>
#include <gtest/gtest.h>

#include <algorithm>

namespace apps {
namespace {

// One test: the handler and its count belong to the whole process.
TEST(ProtobufLogTest, TenLinesAMinuteGoToStandardError) {
    installProtobufLog();
    ::testing::internal::CaptureStderr();
    for (int i = 0; i < 1000; ++i) {
        GOOGLE_LOG(ERROR) << "bad text " << i;
    }
    const std::string text = ::testing::internal::GetCapturedStderr();
    google::protobuf::SetLogHandler(nullptr);
    EXPECT_EQ(std::count(text.begin(), text.end(), '\n'), 10);
    EXPECT_THAT(text, ::testing::StartsWith("protobuf: bad text 0 (ProtobufLogTest.cpp:"));
    EXPECT_THAT(text, ::testing::HasSubstr("protobuf: bad text 9 ("));
    EXPECT_THAT(text, ::testing::Not(::testing::HasSubstr("bad text 10")));
}

}  // namespace
}  // namespace apps
