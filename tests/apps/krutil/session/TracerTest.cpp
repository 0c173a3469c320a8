#include "krutil/session/Tracer.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <stdexcept>
#include <thread>
#include <vector>

#include "KrutilProtocol.hpp"
#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"
#include "foundation/vantor/carrier/framing/DataFrame.hpp"
#include "krutil.protobuf.EvalIIP.pb.h"
#include "krutil.protobuf.TextBaseEvent.pb.h"
#include "krutil/base/ExitCode.hpp"
#include "support/TemporaryDirectory.hpp"

namespace krutil_client {
namespace {

namespace framing = foundation::vantor::carrier::framing;
using ::testing::EndsWith;
using ::testing::StartsWith;

framing::FrameBuffer buffer(const std::string& bytes) {
    auto result = framing::BufferAllocator::makeFrameBuffer(bytes.size());
    std::memcpy(result.first.get(), bytes.data(), bytes.size());
    return result;
}

framing::TaggedFrame tagged(const std::string& tag, const std::string& bytes, unsigned long index = 1) {
    return {framing::FrameType::Object, 7, tag, buffer(bytes), index};
}

TEST(TracerTest, ATaggedFrameIsDecoded) {
    krutil::protobuf::TextBaseEvent event;
    event.set_stream(krutil::protobuf::ERROR_STREAM);
    event.set_text("caf\u00e9\n");
    const auto frame = tagged("krutil:TextBaseEvent", event.SerializeAsString());
    EXPECT_EQ(traceLine({false, true, frame}),
              "<-- stream 7 frame 1 last type 29 krutil:TextBaseEvent 10 bytes: stream: ERROR_STREAM text: "
              "\"caf\\303\\251\\n\"");
}

TEST(TracerTest, AFrameWithinAMessageOnItsWayOut) {
    krutil::protobuf::EvalIIP request;
    request.set_cmd("1");
    const auto frame = tagged("krutil:EvalIIP", request.SerializeAsString(), 3);
    EXPECT_EQ(traceLine({true, false, frame}), "--> stream 7 frame 3 type 29 krutil:EvalIIP 3 bytes: cmd: \"1\"");
}

TEST(TracerTest, AnEmptyFrameHasNoContent) {
    EXPECT_EQ(traceLine({false, true, tagged("krutil:QVMShutdownEvent", "")}),
              "<-- stream 7 frame 1 last type 29 krutil:QVMShutdownEvent 0 bytes");
}

TEST(TracerTest, ADataFrameShowsItsFirstBytes) {
    const framing::DataFrame small(framing::FrameType{4}, 7, buffer(std::string("\x00\x01\xfe\xff", 4)), true, 2);
    EXPECT_EQ(traceLine({true, false, small}), "--> stream 7 frame 2 type 4 data 4 bytes: 0001feff");
    const framing::DataFrame large(framing::FrameType{4}, 7, buffer(std::string(1000, 'A')), true, 2);
    std::string hex;
    for (int i = 0; i < 32; ++i) {
        hex += "41";
    }
    EXPECT_EQ(traceLine({true, false, large}), "--> stream 7 frame 2 type 4 data 1000 bytes: " + hex + "...");
}

TEST(TracerTest, AnUnknownTagIsPrintableAndItsBytesAreHexadecimal) {
    EXPECT_EQ(traceLine({false, true, tagged("a\n\x1b[2J\xff", "xyz")}),
              "<-- stream 7 frame 1 last type 29 a??[2J? 3 bytes: 78797a");
}

TEST(TracerTest, WhatCannotBeDecodedSaysSo) {
    EXPECT_THAT(traceLine({false, true, tagged("krutil:TextBaseEvent", "\x1a\x7fxx")}), EndsWith("(malformed)"));
}

TEST(TracerTest, LongContentIsCutAndHugeContentIsNotDecoded) {
    krutil::protobuf::TextBaseEvent event;
    event.set_text(std::string(100'000, 'a'));
    const std::string line = traceLine({false, true, tagged("krutil:TextBaseEvent", event.SerializeAsString())});
    EXPECT_LT(line.size(), 2'200U);
    EXPECT_THAT(line, EndsWith("aaa..."));
    event.set_text(std::string(2U << 20, 'a'));
    const std::string huge = traceLine({false, true, tagged("krutil:TextBaseEvent", event.SerializeAsString())});
    EXPECT_THAT(huge,
                StartsWith("<-- stream 7 frame 1 last type 29 krutil:TextBaseEvent 2097157 bytes: 1a80808001616161"));
    EXPECT_LT(huge.size(), 300U);
}

class TracerFileTest : public ::testing::Test {
  protected:
    std::string file() const { return directory_.file("trace"); }

    std::string content() const {
        std::ifstream in(file());
        return {std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
    }

    static void traceOne(Tracer& tracer) { tracer({false, true, tagged("krutil:QVMShutdownEvent", "")}); }

    static constexpr const char* line = "<-- stream 7 frame 1 last type 29 krutil:QVMShutdownEvent 0 bytes\n";

  private:
    const test_support::TemporaryDirectory directory_;
};

TEST_F(TracerFileTest, LinesAreInTheFileAtOnceAndNotOnStandardError) {
    Tracer tracer(false, file());
    ::testing::internal::CaptureStderr();
    traceOne(tracer);
    EXPECT_EQ(content(), line);
    traceOne(tracer);
    EXPECT_EQ(content(), std::string(line) + line);
    EXPECT_EQ(::testing::internal::GetCapturedStderr(), "");
}

TEST_F(TracerFileTest, LinesAreOnStandardErrorAsWellIfThatIsWanted) {
    Tracer tracer(true, file());
    ::testing::internal::CaptureStderr();
    traceOne(tracer);
    EXPECT_EQ(::testing::internal::GetCapturedStderr(), line);
    EXPECT_EQ(content(), line);
}

TEST_F(TracerFileTest, AFileThatIsThereIsEmptiedAndANewOneIsForThisUserAlone) {
    std::ofstream(file()) << "older";
    std::filesystem::permissions(file(), std::filesystem::perms(0644));
    const Tracer emptied(false, file());
    EXPECT_EQ(content(), "");
    EXPECT_EQ(std::filesystem::status(file()).permissions(), std::filesystem::perms(0600));
    std::filesystem::remove(file());
    const Tracer created(false, file());
    EXPECT_EQ(std::filesystem::status(file()).permissions(), std::filesystem::perms(0600));
}

TEST_F(TracerFileTest, AFileThatMayBeAnotherUsersIsRefused) {
    std::ofstream(file() + ".other") << "precious";
    std::filesystem::create_hard_link(file() + ".other", file());
    try {
        const Tracer tracer(false, file());
        ADD_FAILURE() << "expected a failure";
    } catch (const Failure& failure) {
        EXPECT_EQ(failure.code(), ExitCode::Usage);
        EXPECT_EQ(failure.what(),
                  "cannot open '" + file() + "' for the trace: the file has 2 names; name a file of your own");
    }
    EXPECT_EQ(content(), "precious");
}

TEST_F(TracerFileTest, LinesOfSeveralThreadsAreWhole) {
    Tracer tracer(false, file());
    std::vector<std::thread> threads;
    for (int i = 0; i < 4; ++i) {
        threads.emplace_back([&tracer] {
            for (int j = 0; j < 250; ++j) {
                traceOne(tracer);
            }
        });
    }
    std::string expected;
    for (std::thread& thread : threads) {
        thread.join();
        for (int j = 0; j < 250; ++j) {
            expected += line;
        }
    }
    EXPECT_EQ(content(), expected);
}

TEST_F(TracerFileTest, AFileThatCannotBeOpenedIsAUsageError) {
    for (const std::string& name : {file() + "-nowhere/trace", std::string()}) {
        try {
            const Tracer tracer(false, name);
            ADD_FAILURE() << name;
        } catch (const Failure& failure) {
            EXPECT_EQ(failure.code(), ExitCode::Usage);
            EXPECT_EQ(failure.what(), "cannot open '" + name + "' for the trace: No such file or directory");
        }
    }
}

TEST_F(TracerFileTest, AFileWithoutRoomEndsTheTraceWithOneSentence) {
    Tracer tracer(false, "/dev/full");
    EXPECT_TRUE(tracer.isComplete());
    ::testing::internal::CaptureStderr();
    traceOne(tracer);
    traceOne(tracer);
    EXPECT_FALSE(tracer.isComplete());
    EXPECT_EQ(::testing::internal::GetCapturedStderr(),
              "krutil: cannot write to '/dev/full': No space left on device; the trace ends here\n");
}

TEST(TracerTest, EveryByteOfALineIsPrintable) {
    krutil::protobuf::TextBaseEvent event;
    event.set_text(std::string("\x01\x1b\x7f\u00e4\0", 6));
    const std::string line = traceLine({false, true, tagged("krutil:TextBaseEvent", event.SerializeAsString())});
    for (const char c : line) {
        EXPECT_TRUE(c >= ' ' && c <= '~') << line;
    }
}

}  // namespace
}  // namespace krutil_client
