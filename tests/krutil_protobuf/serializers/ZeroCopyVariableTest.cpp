// The environment variable that keeps array elements out of data frames. It is looked at once for a process, so each
// value is tried in a process of its own.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <thread>

#include "QDASerializer.hpp"
#include "foundation.korveldata.protobuf.KORVEL_Array.pb.h"
#include "foundation/korveldata/ArrayFactory.hpp"
#include "krutil_protobuf/support/TestTransport.hpp"

namespace {

using foundation::korveldata::Array;
using foundation::korveldata::ArrayFactory;
using foundation::korveldata::ElementType;
using krutil::protobuf_serializer::QDASerializer;
using testing::ExitedWithCode;
using testing::HasSubstr;
using transport::FrameContent;
using transport::FrameIndex;
using transport::SerializationContext;

void setVariable(const char* value) {
    if (value == nullptr) {
        ::unsetenv("QX_DISABLE_ZEROCOPY");
    } else {
        ::setenv("QX_DISABLE_ZEROCOPY", value, 1);
    }
}

Array largeArray() {
    return ArrayFactory().createArray(ElementType::Double, {1000});
}

// Whether an array goes out, given index 5, in the frames that belong to the mode, and comes back equal.
bool transfersAs(const QDASerializer& serializer, bool zeroCopy) {
    const auto stream = std::make_shared<transport::RecordingStream>();
    const Array array = largeArray();
    const FrameIndex next = serializer.serialize(array, 7, 5, stream, nullptr, SerializationContext());
    const std::size_t frames = zeroCopy ? 2 : 1;
    return stream->frames.size() == frames && next == 5 + frames &&
           serializer.deserialize(next - 1, transport::makeMessage(transport::contentOf(stream->frames)), nullptr,
                                  SerializationContext()) == array;
}

// Whether every sample with arrays comes back with the content that it was sent with.
bool samplesSurvive() {
    const auto registry = transport::sessionRegistry();
    for (const char* name : {"krutil:QDA", "krutil:FEvalIIP", "krutil:FEvalResult", "krutil:IIPReply"}) {
        const samples::SampleSet& set = samples::sampleSet(name);
        const auto serializer = registry->find(name);
        for (const samples::Sample& sample : set.samples) {
            const auto frames = transport::writtenFrames(*serializer, sample.object, registry);
            const samples::Object back = samples::read(*serializer, frames.back().index, transport::makeMessage(frames),
                                                       registry, SerializationContext());
            if (set.describe(back, samples::View::AsIs) != set.describe(sample.object, samples::View::AfterTrip)) {
                std::fprintf(stderr, "%s: %s\n", name, sample.name.c_str());
                return false;
            }
        }
    }
    return true;
}

// Exit code 0, or the number of the check that failed. Runs in a process that has made no serializer yet. The variable
// holds `later` after the first serializer was built.
int check(const char* value, const char* later, bool zeroCopy) {
    setVariable(value);
    if (!QDASerializer::zeroCopy()) {
        return 1;
    }
    const std::unordered_map<std::string, std::string> features{{"ZEROCOPY", zeroCopy ? "disable" : "enable"}};
    const QDASerializer first(features);
    if (QDASerializer::zeroCopy() != zeroCopy) {
        return 2;
    }
    setVariable(later);
    if (!transfersAs(first, zeroCopy)) {
        return 3;
    }
    const QDASerializer second({});
    if (QDASerializer::zeroCopy() != zeroCopy || !transfersAs(second, zeroCopy)) {
        return 4;
    }
    return samplesSurvive() ? 0 : 5;
}

class ZeroCopyVariableTest : public testing::Test {
  protected:
    ZeroCopyVariableTest() { testing::FLAGS_gtest_death_test_style = "threadsafe"; }
};

using ZeroCopyVariableDeathTest = ZeroCopyVariableTest;

TEST_F(ZeroCopyVariableDeathTest, UnsetLeavesZeroCopyOn) {
    EXPECT_EXIT(std::_Exit(check(nullptr, nullptr, true)), ExitedWithCode(0), "");
}

TEST_F(ZeroCopyVariableDeathTest, TheEmptyStringLeavesZeroCopyOn) {
    EXPECT_EXIT(std::_Exit(check("", "", true)), ExitedWithCode(0), "");
}

TEST_F(ZeroCopyVariableDeathTest, AnyOtherValueTurnsZeroCopyOff) {
    for (const char* value : {"0", "false", "1", " "}) {
        EXPECT_EXIT(std::_Exit(check(value, value, false)), ExitedWithCode(0), "") << value;
    }
}

TEST_F(ZeroCopyVariableDeathTest, AChangeAfterTheFirstSerializerHasNoEffect) {
    EXPECT_EXIT(std::_Exit(check(nullptr, "1", true)), ExitedWithCode(0), "");
    EXPECT_EXIT(std::_Exit(check("", "1", true)), ExitedWithCode(0), "");
    EXPECT_EXIT(std::_Exit(check("1", nullptr, false)), ExitedWithCode(0), "");
    EXPECT_EXIT(std::_Exit(check("1", "", false)), ExitedWithCode(0), "");
}

int buildFirstSerializersAtOnce() {
    setVariable("1");
    std::vector<std::thread> threads;
    for (int i = 0; i < 8; ++i) {
        threads.emplace_back([] {
            const QDASerializer serializer({});
            if (!transfersAs(serializer, false)) {
                std::_Exit(1);
            }
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    return 0;
}

TEST_F(ZeroCopyVariableDeathTest, FirstSerializersOnSeveralThreadsAgree) {
    EXPECT_EXIT(std::_Exit(buildFirstSerializersAtOnce()), ExitedWithCode(0), "");
}

// Frames of a peer that has zero copy on, read by a process that has it off.
void readDataFramesWithoutZeroCopy() {
    setVariable("1");
    foundation::korveldata::protobuf::KORVEL_Array proto;
    proto.set_elementtype(5);
    proto.add_dimensions(1000);
    proto.set_order(foundation::korveldata::protobuf::KORVEL_Array::ROW_MAJOR);
    proto.set_dataid(1);
    const auto message = transport::makeMessage(
        {FrameContent{false, static_cast<transport::FrameType>(11), 7, 1, "", std::string(8000, '\0')},
         FrameContent{true, transport::FrameType::Object, 7, 2, "krutil:QDA", proto.SerializeAsString()}});
    const std::string text = transport::errorText<foundation::korveldata::ArrayFormatError>(
        [&] { QDASerializer({}).deserialize(2, message, nullptr, SerializationContext()); });
    std::fprintf(stderr, "<%s>\n", text.c_str());
    std::_Exit(message->frame(1) != nullptr ? 0 : 1);
}

TEST_F(ZeroCopyVariableDeathTest, DataIDsAreRefusedByTheArrayLibraryWhenZeroCopyIsOff) {
    EXPECT_EXIT(readDataFramesWithoutZeroCopy(), ExitedWithCode(0),
                HasSubstr("<KORVEL_Array: the elements are in data frame 1, but data frames are off (zero copy is "
                          "disabled in this process)>\n"));
}

}  // namespace
