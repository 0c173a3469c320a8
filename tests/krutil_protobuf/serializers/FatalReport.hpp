// Values that end the process: how a test expects the report, and sees which frames were written before it.
#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <csignal>
#include <cstdio>
#include <string>

#include "krutil_protobuf/support/TestTransport.hpp"

namespace fatal {

/// Reports that several files of tests expect.
inline const std::string streamIDOut =
    "fatal: Unsupported cmddistributor::IqmStreamID value (IIPSerializer:38, static krutil::protobuf::IqmStreamID "
    "krutil::protobuf_serializer::IIPSerializer::toProtobuf(cmddistributor::IqmStreamID))\n";
inline const std::string statusOut =
    "fatal: Unsupported cmddistributor::inExecutionStatus value (RuntimeExceptionSerialization:28, "
    "krutil::protobuf::ExecutionStatus "
    "krutil::protobuf_serializer::toProtobuf(krutil::cmddistributor::inExecutionStatus))\n";
inline const std::string statusIn =
    "fatal: Unsupported protobuf::ExecutionStatus value (RuntimeExceptionSerialization:47, "
    "krutil::cmddistributor::inExecutionStatus "
    "krutil::protobuf_serializer::fromProtobuf(krutil::protobuf::ExecutionStatus))\n";

/// The report is written to a duplicate of stderr made at load time, so the child must be a process of its own.
class FatalTest : public testing::Test {
  protected:
    FatalTest() { testing::FLAGS_gtest_death_test_style = "threadsafe"; }
};

/// Says "appended INDEX" on stderr for each frame, where the parent of a death test sees it.
class TellingStream final : public transport::MessageStream {
  public:
    void append(std::unique_ptr<transport::Frame>& frame) override {
        std::fprintf(stderr, "appended %lu\n", static_cast<unsigned long>(frame->index()));
    }
};

/// Writes an object to a TellingStream, the first frame at index 1.
inline void writeAloud(const std::string& serializer, const samples::Object& object) {
    const auto registry = transport::sessionRegistry();
    samples::write(*registry->find(serializer), object, 7, 1, std::make_shared<TellingStream>(), registry,
                   transport::SerializationContext());
}

}  // namespace fatal

/// `statement` must end the process with `report`, to the letter.
#define EXPECT_FATAL(statement, report) \
    EXPECT_EXIT(static_cast<void>(statement), testing::KilledBySignal(SIGABRT), testing::HasSubstr(report))

/// The same, and no frame was appended to a TellingStream before.
#define EXPECT_FATAL_BEFORE_ANY_FRAME(statement, report)                        \
    EXPECT_EXIT(static_cast<void>(statement), testing::KilledBySignal(SIGABRT), \
                testing::AllOf(testing::HasSubstr(report), testing::Not(testing::HasSubstr("appended"))))
