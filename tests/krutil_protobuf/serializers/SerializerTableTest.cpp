// The table of serializers as a peer and a host see it: which there are, and what every one of them does with its
// samples and with frames that are not as they should be. A new row of the product's table needs a row of `table` here
// and a list of samples.

#include <google/protobuf/descriptor.h>
#include <google/protobuf/stubs/logging.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <cctype>
#include <stdexcept>
#include <typeindex>

#include "cmddistributor/DebugLoopEvent.hpp"
#include "cmddistributor/EvalIIP.hpp"
#include "cmddistributor/FEvalIIP.hpp"
#include "cmddistributor/FEvalResult.hpp"
#include "cmddistributor/IIPCancelMessage.hpp"
#include "cmddistributor/IIPCancelReply.hpp"
#include "cmddistributor/IIPEnqueueMessage.hpp"
#include "cmddistributor/IIPStateEvent.hpp"
#include "foundation/korveldata/Array.hpp"
#include "korvel/lang/diagnostic/IssuedEnabledWarningEvent.hpp"
#include "korvel/lang/diagnostic/IssuedWarningEvent.hpp"
#include "krutil/capabilities_api/CapabilitiesChanged.hpp"
#include "krutil/cmddistributor/IIPReply.hpp"
#include "krutil/eventmgr/QVMShutdownEvent.hpp"
#include "krutil/io/PrintableErrorEvent.hpp"
#include "krutil/io/SinkTextEvent.hpp"
#include "krutil/io/TextBaseEvent.hpp"
#include "krutil_protobuf/serializers/AllocationRecorder.hpp"
#include "krutil_protobuf/support/TestTransport.hpp"
#include "samples/Samples.hpp"

namespace {

using samples::Object;
using samples::SampleSet;
using samples::View;
using transport::FrameContent;
using transport::FrameIndex;
using transport::FrameType;
using transport::Message;
using transport::Registry;
using transport::SerializationContext;
using transport::SerializerBase;

struct Row {
    const char* name;
    const std::type_info& type;
    int frameType;
    /// Texts with which a frame that lacks bytes may be refused, those with a blank at the end as beginnings; the first
    /// is that of a frame without any bytes, or "" when that reads as an object.
    std::vector<std::string> refusals;
};

const std::string missingFrame = "std::bad_cast";

const std::vector<Row>& table() {
    using namespace cmddistributor;
    using foundation::korveldata::Array;
    using korvel::lang::diagnostic::IssuedEnabledWarningEvent;
    using korvel::lang::diagnostic::IssuedWarningEvent;
    using krutil::capabilities_api::CapabilitiesChanged;
    using krutil::cmddistributor::IIPReply;
    using krutil::eventmgr::QVMShutdownEvent;
    using krutil::io::PrintableErrorEvent;
    using krutil::io::SinkTextEvent;
    using krutil::io::TextBaseEvent;
    static const std::vector<Row> rows{
        {"krutil:QVMShutdownEvent", typeid(QVMShutdownEvent), 29, {""}},
        {"krutil:DebugLoopEvent",
         typeid(DebugLoopEvent),
         29,
         {"Invalid enum krutil::protobuf::DebugLoopEvent_State field value = 0",
          "Invalid enum krutil::protobuf::InputRequester field value = "}},
        {"krutil:IIPStartedEvent", typeid(IIPStartedEvent), 29, {""}},
        {"krutil:IIPSuspendedEvent", typeid(IIPSuspendedEvent), 29, {""}},
        {"krutil:IIPResumedEvent", typeid(IIPResumedEvent), 29, {""}},
        {"krutil:IIPDiscardedEvent", typeid(IIPDiscardedEvent), 29, {""}},
        {"krutil:IIPRequeuedEvent", typeid(IIPRequeuedEvent), 29, {""}},
        {"krutil:IIPReactivatedEvent", typeid(IIPReactivatedEvent), 29, {""}},
        {"krutil:IIPCompletedEvent", typeid(IIPCompletedEvent), 29, {""}},
        {"krutil:detail::LastIIPEvent", typeid(LastIIPEvent), 29, {""}},
        {"krutil:TextBaseEvent", typeid(TextBaseEvent), 29, {""}},
        {"krutil:SinkTextEvent", typeid(SinkTextEvent), 29, {""}},
        {"krutil:IIPCancelMessage",
         typeid(IIPCancelMessage),
         27,
         {"Requied field is missing: protobuf::IIPCancelMessage.iipId"}},
        {"krutil:IIPCancelReply", typeid(IIPCancelReply), 29, {""}},
        {"krutil:IIPEnqueueMessage", typeid(IIPEnqueueMessage), 27, {missingFrame}},
        {"krutil:EvalIIP",
         typeid(EvalIIP),
         29,
         {"Required field missing: protobuf::EvalIIP.iip", "Required string field protobuf::IIP.pluginType is empty.",
          "Required field protobuf::IIP.outTraits is missing.", "Required field protobuf::IIP.errTraits is missing."}},
        {"krutil:IIPResult", typeid(IIPResult), 29, {"Required field is missing: protobuf::IIPResult.id"}},
        {"krutil:IIPReply", typeid(IIPReply), 29, {"Required field is missing: protobuf::IIPReply.id"}},
        {"krutil:FEvalIIP",
         typeid(FEvalIIP),
         29,
         {"Required field missing: protobuf::FEvalIIP.iip", "Required string field protobuf::IIP.pluginType is empty.",
          "Required field protobuf::IIP.outTraits is missing.", "Required field protobuf::IIP.errTraits is missing.",
          "Invalid krutil::protobuf::FEvalIIP.clientQvmID field value of 0",
          "Invalid krutil::protobuf::FEvalIIP.serverQvmID field value of 0", missingFrame}},
        {"krutil:FEvalResult",
         typeid(FEvalResult),
         29,
         {"Required field is missing: protobuf::FEvalResult.iipResult",
          "Required field is missing: protobuf::IIPResult.id", missingFrame}},
        {"krutil:QDA",
         typeid(Array),
         29,
         {"Array: elements of type unknown (code 0) are not supported", "Array: ", "KORVEL_Array: ", missingFrame}},
        {"korvel:lang:diagnostic:IssuedWarningEvent", typeid(IssuedWarningEvent), 29, {""}},
        {"korvel:lang:diagnostic:IssuedEnabledWarningEvent", typeid(IssuedEnabledWarningEvent), 27, {""}},
        {"krutil:PrintableErrorEvent", typeid(PrintableErrorEvent), 29, {""}},
        {"krutil:capabilities_api:CapabilitiesChanged", typeid(CapabilitiesChanged), 29, {""}},
    };
    return rows;
}

const Row& rowOf(const std::string& name) {
    const auto found = std::find_if(table().begin(), table().end(), [&](const Row& row) { return row.name == name; });
    if (found == table().end()) {
        throw std::out_of_range("no row for " + name);
    }
    return *found;
}

bool isListed(const Row& row, const std::string& text) {
    return std::any_of(row.refusals.begin(), row.refusals.end(), [&](const std::string& refusal) {
        return !refusal.empty() && (text == refusal || (refusal.back() == ' ' && text.rfind(refusal, 0) == 0));
    });
}

// Nothing else leaves a serializer because of what a frame holds.
bool isRefusalClass(const std::exception& error) {
    return typeid(error) == typeid(std::logic_error) || typeid(error) == typeid(std::bad_cast) ||
           typeid(error) == typeid(foundation::korveldata::ArrayFormatError);
}

const std::shared_ptr<Registry>& registry() {
    static const std::shared_ptr<Registry> registry = transport::sessionRegistry();
    return registry;
}

std::vector<std::string> registeredNames() {
    std::vector<std::string> names;
    for (const auto& serializer : registry()->serializers()) {
        names.push_back(serializer->name());
    }
    return names;
}

std::vector<std::string> namesOfTable() {
    std::vector<std::string> names;
    for (const Row& row : table()) {
        names.emplace_back(row.name);
    }
    return names;
}

TEST(SerializerTableTest, TheInitializerRegistersTheseRowsInThisOrderAndNoOthers) {
    EXPECT_EQ(registeredNames(), namesOfTable()) << "A row of the product's table needs a row of `table` in this file.";
}

TEST(SerializerTableTest, EveryRegisteredSerializerHasSamples) {
    for (const std::string& name : registeredNames()) {
        EXPECT_NO_THROW(samples::sampleSet(name)) << name;
    }
}

TEST(SerializerTableTest, EverySampleSetIsOfARegisteredSerializer) {
    const auto names = registeredNames();
    for (const SampleSet& set : samples::sampleSets()) {
        EXPECT_NE(std::find(names.begin(), names.end(), set.serializer), names.end()) << set.serializer;
    }
}

// Runs over the rows by name. The names come from `table`: tests are listed before they run, and listing them must not
// make serializers, or the first-use checks of other tests would come too late.
class SerializerTest : public testing::TestWithParam<std::string> {
  protected:
    const SerializerBase& serializer() const { return *registry()->find(GetParam()); }
    const SampleSet& set() const { return samples::sampleSet(GetParam()); }

    std::vector<FrameContent> write(const Object& object, FrameIndex firstIndex = 1) const {
        return transport::writtenFrames(serializer(), object, registry(), firstIndex);
    }

    Object read(const std::unique_ptr<Message>& message, FrameIndex index) const {
        return samples::read(serializer(), index, message, registry(), SerializationContext());
    }

    Object read(const std::vector<FrameContent>& frames) const {
        return read(transport::makeMessage(frames), frames.back().index);
    }

    std::string describe(const Object& object) const { return set().describe(object, View::AsIs); }
    std::string expected(const Object& object) const { return set().describe(object, View::AfterTrip); }

    // What() of any exception, or the description of the object.
    std::string outcome(const std::vector<FrameContent>& frames) const {
        try {
            return describe(read(frames));
        } catch (const std::exception& error) {
            return error.what();
        }
    }

  private:
    // Frames that are cut short make the parser complain, once each.
    google::protobuf::LogSilencer silencer_;
};

INSTANTIATE_TEST_SUITE_P(Table, SerializerTest, testing::ValuesIn(namesOfTable()), [](const auto& row) {
    std::string name = row.param.substr(row.param.rfind(':') + 1);
    std::replace_if(
        name.begin(), name.end(), [](unsigned char c) { return std::isalnum(c) == 0; }, '_');
    return name;
});

TEST_P(SerializerTest, HasTypicalEmptyAndExtremeSamplesWithNamesOfTheirOwn) {
    std::vector<std::string> names;
    for (const samples::Sample& sample : set().samples) {
        EXPECT_EQ(std::count(names.begin(), names.end(), sample.name), 0) << sample.name;
        names.push_back(sample.name);
    }
    const auto* message = google::protobuf::DescriptorPool::generated_pool()->FindMessageTypeByName(set().message);
    ASSERT_NE(message, nullptr) << set().message;
    for (const char* name : {"default", "typical", "extreme"}) {
        if (message->field_count() > 0 || name == std::string("default")) {
            EXPECT_EQ(std::count(names.begin(), names.end(), name), 1) << "samples with the name " << name;
        }
    }
}

TEST_P(SerializerTest, HandlesItsTypeAtVersionOneZero) {
    EXPECT_EQ(std::type_index(serializer().type()), std::type_index(rowOf(GetParam()).type));
    EXPECT_EQ(serializer().version(), std::make_pair(1U, 0U));
    EXPECT_EQ(registry()->find(std::type_index(serializer().type())).get(), &serializer());
}

TEST_P(SerializerTest, SamplesComeBackEqual) {
    for (const samples::Sample& sample : set().samples) {
        EXPECT_EQ(describe(read(write(sample.object))), expected(sample.object)) << sample.name;
    }
}

// Where an object begins that is shared; null for one that is not.
struct SharedAddress {
    const void* operator()(const foundation::korveldata::Array& /*value*/) const { return nullptr; }
    const void* operator()(const std::unique_ptr<cmddistributor::IIPResult>& /*owned*/) const { return nullptr; }
    template <class T>
    const void* operator()(const boost::shared_ptr<T>& shared) const {
        return dynamic_cast<const void*>(shared.get());
    }
};

// An object that several share is made together with its reference count, in one allocation. One type is not: its
// memory goes with its last owner, even if a weak reference stays.
TEST_P(SerializerTest, SharedObjectsLieInOneAllocationWithTheirCount) {
    for (const samples::Sample& sample : set().samples) {
        const Object back = read(write(sample.object));
        if (const void* address = std::visit(SharedAddress(), back)) {
            EXPECT_EQ(AllocationRecorder::beginsAt(address), GetParam() == "krutil:IIPCancelReply") << sample.name;
        }
    }
}

TEST_P(SerializerTest, SamplesOfOneSerializerDiffer) {
    for (const samples::Sample& one : set().samples) {
        for (const samples::Sample& other : set().samples) {
            EXPECT_TRUE(&one == &other || describe(one.object) != describe(other.object))
                << one.name << " and " << other.name;
        }
    }
}

TEST_P(SerializerTest, WhatCameBackIsWrittenAsBefore) {
    for (const samples::Sample& sample : set().samples) {
        const auto frames = write(sample.object);
        EXPECT_EQ(write(read(frames)), frames) << sample.name;
    }
}

TEST_P(SerializerTest, FramesAreTaggedWithTheirSerializersNameAndType) {
    for (const samples::Sample& sample : set().samples) {
        const auto frames = write(sample.object);
        EXPECT_EQ(frames.back().tag, GetParam());
        for (const FrameContent& frame : frames) {
            EXPECT_EQ(frame.streamID, 7U);
            if (frame.tagged) {
                EXPECT_EQ(static_cast<int>(frame.type), rowOf(frame.tag).frameType);
            }
        }
    }
}

TEST_P(SerializerTest, IndexesRunOnFromTheGivenOneAndTheNextFreeOneIsReturned) {
    for (const FrameIndex first : {FrameIndex{1}, FrameIndex{4}, FrameIndex{1} << 40}) {
        for (const samples::Sample& sample : set().samples) {
            const auto stream = std::make_shared<transport::RecordingStream>();
            FrameIndex next =
                samples::write(serializer(), sample.object, 7, first, stream, registry(), SerializationContext());
            EXPECT_EQ(next, first + stream->frames.size());
            next = samples::write(serializer(), sample.object, 7, next, stream, registry(), SerializationContext());
            FrameIndex expectedIndex = first;
            for (const auto& frame : stream->frames) {
                EXPECT_EQ(frame->index(), expectedIndex++);
            }
            EXPECT_EQ(next, expectedIndex);
        }
    }
}

TEST_P(SerializerTest, ReadingTakesEveryFrameOfTheObjectOutOfTheMessage) {
    for (const samples::Sample& sample : set().samples) {
        const auto frames = write(sample.object);
        const auto message = transport::makeMessage(frames);
        read(message, frames.back().index);
        for (FrameIndex index = 0; index < message->size(); ++index) {
            EXPECT_EQ(message->frame(index), nullptr) << sample.name << " " << index;
        }
    }
}

TEST_P(SerializerTest, ReadingTwiceIsBadCast) {
    for (const samples::Sample& sample : set().samples) {
        const auto frames = write(sample.object);
        const auto message = transport::makeMessage(frames);
        read(message, frames.back().index);
        EXPECT_THROW(read(message, frames.back().index), std::bad_cast) << sample.name;
    }
}

TEST_P(SerializerTest, TheOtherFrameTypeIsBadCast) {
    for (const samples::Sample& sample : set().samples) {
        auto frames = write(sample.object);
        for (const int type : {27, 29, 0, 28, 255}) {
            frames.back().type = static_cast<FrameType>(type);
            if (type != rowOf(GetParam()).frameType) {
                const auto message = transport::makeMessage(frames);
                EXPECT_THROW(read(message, frames.back().index), std::bad_cast) << sample.name << " " << type;
                EXPECT_EQ(message->frame(frames.back().index), nullptr);
            }
        }
    }
}

TEST_P(SerializerTest, ADataFrameIsBadCastAndStays) {
    for (const samples::Sample& sample : set().samples) {
        auto frames = write(sample.object);
        frames.back().tagged = false;
        const auto message = transport::makeMessage(frames);
        EXPECT_THROW(read(message, frames.back().index), std::bad_cast) << sample.name;
        EXPECT_NE(message->frame(frames.back().index), nullptr);
    }
}

TEST_P(SerializerTest, AMissingIndexIsBadCast) {
    const auto frames = write(set().samples.front().object);
    const auto message = transport::makeMessage(frames);
    for (const FrameIndex index : {FrameIndex{0}, frames.back().index + 1, ~FrameIndex{0}}) {
        EXPECT_THROW(read(message, index), std::bad_cast) << index;
    }
    EXPECT_EQ(message->size(), frames.back().index + 1);
}

TEST_P(SerializerTest, AFrameWithoutBytesIsTheDefaultOrLacksARequiredField) {
    auto frames = write(set().samples.front().object);
    frames.back().bytes.clear();
    const std::string& refusal = rowOf(GetParam()).refusals.front();
    if (!refusal.empty()) {
        EXPECT_EQ(outcome(frames), refusal);
        return;
    }
    const auto& all = set().samples;
    const auto least =
        std::find_if(all.begin(), all.end(), [](const auto& sample) { return sample.name == "default"; });
    ASSERT_TRUE(least != all.end()) << "no sample with the name default";
    EXPECT_EQ(outcome(frames), expected(least->object));
}

TEST_P(SerializerTest, ANullBufferCountsAsEmptyWhateverItsLength) {
    auto frames = write(set().samples.front().object);
    frames.back().bytes.clear();
    const std::string empty = outcome(frames);
    for (const unsigned long claimed : {0UL, 5UL, 1UL << 31, ~0UL}) {
        transport::Frames placed;
        for (const FrameContent& frame : frames) {
            placed.resize(frame.index + 1);
            placed.back() = transport::makeFrame(frame);
        }
        placed.back() = std::make_unique<transport::TaggedFrame>(
            frames.back().type, 7U, GetParam(), transport::FrameBuffer(nullptr, claimed), frames.back().index);
        const auto message = std::make_unique<Message>(std::move(placed));
        std::string found;
        try {
            found = describe(read(message, frames.back().index));
        } catch (const std::exception& error) {
            found = error.what();
        }
        EXPECT_EQ(found, empty) << claimed;
    }
}

TEST_P(SerializerTest, AFrameCutAnywhereGivesAnObjectOrLacksARequiredField) {
    const Row& row = rowOf(GetParam());
    for (const samples::Sample& sample : set().samples) {
        const auto whole = write(sample.object);
        for (std::size_t size = 0; size < whole.back().bytes.size(); ++size) {
            auto frames = whole;
            frames.back().bytes.resize(size);
            try {
                read(frames);
            } catch (const std::exception& error) {
                EXPECT_TRUE(isRefusalClass(error) && isListed(row, error.what()))
                    << sample.name << " cut to " << size << " bytes: " << typeid(error).name() << ": " << error.what();
            }
        }
    }
}

TEST_P(SerializerTest, UnknownFieldsAreIgnored) {
    // Field 1000 as a varint, as 8 and as 4 fixed bytes, length-delimited, and as a group with a field inside.
    const std::string unknown = std::string("\xC0\x3E\x05") + std::string("\xC1\x3E") + "12345678" +
                                "\xC5\x3E"
                                "1234" +
                                "\xC2\x3E\x03"
                                "abc" +
                                "\xC3\x3E\x08\x01\xC4\x3E";
    for (const samples::Sample& sample : set().samples) {
        for (const bool inFront : {true, false}) {
            auto frames = write(sample.object);
            std::string& bytes = frames.back().bytes;
            bytes = inFront ? unknown + bytes : bytes + unknown;
            EXPECT_EQ(outcome(frames), expected(sample.object)) << sample.name << " " << inFront;
        }
    }
}

}  // namespace
