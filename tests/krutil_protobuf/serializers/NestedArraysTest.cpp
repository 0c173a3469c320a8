// Arrays that another object refers to: the order of frames, and which serializer reads them.

#include "NestedArrays.hpp"

#include <gtest/gtest.h>

#include <stdexcept>

#include "krutil_protobuf/serializers/AllocationRecorder.hpp"
#include "krutil_protobuf/serializers/ArraysTest.hpp"

namespace {

using arrays::ArraysTest;
using arrays::indexes;
using arrays::large;
using arrays::small;
using foundation::korveldata::Array;
using foundation::vantor::carrier::framing::BufferAllocator;
using krutil::protobuf_serializer::DataID;
using krutil::protobuf_serializer::NestedReader;
using krutil::protobuf_serializer::readArrays;
using krutil::protobuf_serializer::ReplyFamily;
using transport::FrameIndex;
using transport::Message;
using transport::Registry;
using transport::SerializationContext;

constexpr std::size_t million = 1'000'000;

class NestedArraysTest : public ArraysTest {
  protected:
    static google::protobuf::RepeatedField<std::uint64_t> ids(std::vector<std::uint64_t> values) {
        return {values.begin(), values.end()};
    }

    std::vector<Array> read(const google::protobuf::RepeatedField<std::uint64_t>& dataIDs,
                            const std::unique_ptr<Message>& message) const {
        const SerializationContext context;
        return readArrays(dataIDs, NestedReader(message, registry_, context));
    }

    std::vector<DataID> writeWith(const std::shared_ptr<const Registry>& registry,
                                  const std::vector<Array>& arrays) const {
        return writeTo(stream_, registry, arrays);
    }
};

TEST_F(NestedArraysTest, DataIDsAreTheTaggedFramesBehindTheDataFrames) {
    EXPECT_EQ(writeWith(registry_, {large(), small(1), large()}), (std::vector<DataID>{2, 3, 5}));
    EXPECT_EQ(indexes(frames()), (std::vector<FrameIndex>{1, 2, 3, 4, 5}));
    const auto message = received();
    const std::vector<Array> back = read(ids({2, 3, 5}), message);
    EXPECT_EQ(back, (std::vector<Array>{large(), small(1), large()}));
}

TEST_F(NestedArraysTest, NoDataIDsAreNoArraysWhateverTheMessageHolds) {
    const auto message = std::make_unique<Message>(transport::Frames());
    EXPECT_TRUE(read(ids({}), message).empty());
}

TEST_F(NestedArraysTest, ArraysAreReadInTheOrderOfTheirIDs) {
    const auto message = transport::makeMessage(framesOf({small(1), small(2), small(3)}));
    EXPECT_EQ(read(ids({3, 1, 2}), message), (std::vector<Array>{small(3), small(1), small(2)}));
}

TEST_F(NestedArraysTest, ADataIDOf0IsAnIndexLikeAnyOther) {
    auto given = framesOf({small(1), small(2)});
    given[0].index = 0;
    EXPECT_EQ(read(ids({0, 2}), transport::makeMessage(given)), (std::vector<Array>{small(1), small(2)}));
    EXPECT_EQ(read(ids({2, 0}), transport::makeMessage(given)), (std::vector<Array>{small(2), small(1)}));
}

TEST_F(NestedArraysTest, WithoutASerializerOfArraysWritingIsOutOfRangeEvenWithoutArrays) {
    const auto empty = std::make_shared<Registry>();
    EXPECT_THROW(writeWith(empty, {}), std::out_of_range);
    EXPECT_THROW(writeWith(empty, {small(1)}), std::out_of_range);
}

TEST_F(NestedArraysTest, ASerializerOfAnotherFamilyUnderTheTypeOfArraysIsBadCastEvenWithoutArrays) {
    const auto misplaced = std::make_shared<Registry>();
    misplaced->insert(std::make_shared<transport::MisplacedSerializer<ReplyFamily>>(typeid(Array)));
    EXPECT_THROW(writeWith(misplaced, {}), std::bad_cast);
    EXPECT_THROW(writeWith(misplaced, {small(1)}), std::bad_cast);
}

TEST_F(NestedArraysTest, AFirstTagThatIsUnknownIsOutOfRangeAndOneOfAnotherFamilyIsBadCast) {
    auto given = framesOf({small(1), small(2)});
    given[0].tag = "unknown";
    auto message = transport::makeMessage(given);
    EXPECT_THROW(read(ids({1, 2}), message), std::out_of_range);
    for (const char* tag : {"krutil:EvalIIP", "krutil:IIPResult", "krutil:IIPReply", "krutil:TextBaseEvent"}) {
        given[0].tag = tag;
        message = transport::makeMessage(given);
        EXPECT_THROW(read(ids({1, 2}), message), std::bad_cast) << tag;
        EXPECT_NE(message->frame(1), nullptr) << tag;
    }
}

TEST_F(NestedArraysTest, OnlyTheFirstTagSelectsTheSerializer) {
    auto given = framesOf({small(1), small(2), small(3)});
    given[1].tag = "unknown";
    given[2].tag = "krutil:EvalIIP";
    const auto message = transport::makeMessage(given);
    EXPECT_EQ(read(ids({1, 2, 3}), message), (std::vector<Array>{small(1), small(2), small(3)}));
}

TEST_F(NestedArraysTest, ADataIDWithoutATaggedFrameIsBadCastAtAnyPosition) {
    const auto given = framesOf({large(), small(2)});  // Data frame 1, arrays 2 and 3.
    for (const FrameIndex bad : {FrameIndex{0}, FrameIndex{1}, FrameIndex{4}, FrameIndex{1} << 32, ~FrameIndex{0}}) {
        EXPECT_THROW(read(ids({bad}), transport::makeMessage(given)), std::bad_cast) << bad;
        EXPECT_THROW(read(ids({2, bad}), transport::makeMessage(given)), std::bad_cast) << bad;
        EXPECT_EQ(BufferAllocator::inUse(), before());
    }
    EXPECT_THROW(read(ids({3, 3}), transport::makeMessage(given)), std::bad_cast);
}

TEST_F(NestedArraysTest, AMillionDataIDsAreOneBadCastAndNoMemoryInProportion) {
    const auto given = framesOf({small(1)});
    for (const std::uint64_t id : {std::uint64_t{1}, std::uint64_t{99}}) {
        google::protobuf::RepeatedField<std::uint64_t> claimed;
        claimed.Resize(million, id);
        const auto message = transport::makeMessage(given);
        AllocationRecorder recorder;
        EXPECT_THROW(read(claimed, message), std::bad_cast);
        recorder.stop();
        EXPECT_LT(recorder.bytes(), 16384U);
        EXPECT_LT(recorder.allocations(), 100U);
    }
}

}  // namespace
