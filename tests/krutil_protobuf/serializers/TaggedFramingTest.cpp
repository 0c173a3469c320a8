// One message as one tagged frame, and back. Most tests use a message class of their own, which observes how it is
// asked, so that sizes are possible that no real message has here.

#include "TaggedFraming.hpp"

#include <gtest/gtest.h>

#include <boost/make_shared.hpp>

#include <limits>

#include "QVMShutdownEventSerializer.hpp"
#include "krutil/io/TextBaseEvent.hpp"
#include "krutil_protobuf/serializers/AllocationRecorder.hpp"
#include "krutil_protobuf/support/TestTransport.hpp"

namespace {

using krutil::protobuf_serializer::EventFamily;
using krutil::protobuf_serializer::readTaggedFrame;
using krutil::protobuf_serializer::writeTaggedFrame;
using transport::errorText;
using transport::Frame;
using transport::FrameBuffer;
using transport::FrameContent;
using transport::FrameIndex;
using transport::Frames;
using transport::FrameType;
using transport::makeMessage;
using transport::Message;
using transport::MessageStream;
using transport::RecordingStream;
using transport::TaggedFrame;

struct SerializationFault {};

// Writes `written` letters where it claims `size` bytes.
struct OutgoingMessage {
    std::size_t size = 0;
    std::size_t written = 0;
    bool throws = false;
    mutable int sizeCalls = 0;
    mutable int writeCalls = 0;
    mutable const void* target = nullptr;

    std::size_t ByteSizeLong() const {
        ++sizeCalls;
        return size;
    }

    void SerializeWithCachedSizes(google::protobuf::io::CodedOutputStream* out) const {
        ++writeCalls;
        if (throws) {
            throw SerializationFault();
        }
        if (std::uint8_t* memory = out->GetDirectBufferForNBytesAndAdvance(static_cast<int>(written))) {
            target = memory;
            std::fill_n(memory, written, std::uint8_t{'x'});
        } else {
            out->WriteString(std::string(written, 'x'));
        }
    }
};

// Looks at the bytes and tells whether they "parse".
struct IncomingMessage {
    bool parses = true;
    bool throws = false;
    int calls = 0;
    const void* source = nullptr;
    int size = 0;
    int recursionBudget = 0;

    bool ParseFromCodedStream(google::protobuf::io::CodedInputStream* in) {
        ++calls;
        recursionBudget = in->RecursionBudget();
        if (!in->GetDirectBufferPointer(&source, &size)) {
            size = 0;
        }
        if (throws) {
            throw SerializationFault();
        }
        return parses;
    }
};

class LeavingStream : public MessageStream {
  public:
    void append(std::unique_ptr<Frame>& /*frame*/) override {}
};

class ThrowingStream : public MessageStream {
  public:
    explicit ThrowingStream(bool takes) : takes_(takes) {}

    void append(std::unique_ptr<Frame>& frame) override {
        if (takes_) {
            frame.reset();
        }
        throw std::runtime_error("the stream is closed");
    }

  private:
    bool takes_;
};

int released = 0;

void countRelease(char* buffer) {
    ++released;
    delete[] buffer;
}

// A frame at index 1 that claims `length` bytes and has `allocated`.
std::unique_ptr<Message> messageClaiming(unsigned long length, std::size_t allocated,
                                         FrameType type = FrameType::Object) {
    Frames frames(2);
    frames[1] = std::make_unique<TaggedFrame>(
        type, 7U, "tag",
        FrameBuffer(std::unique_ptr<char[], std::function<void(char*)>>(new char[allocated](), &countRelease), length),
        1UL);
    return std::make_unique<Message>(std::move(frames));
}

FrameIndex write(const OutgoingMessage& proto, const std::shared_ptr<MessageStream>& stream) {
    return writeTaggedFrame(proto, "tag", 7, 3, stream, FrameType::Object);
}

// ---- Writing --------------------------------------------------------------------------------------------------------

TEST(TaggedFramingTest, WritesOneFrameWithTypeStreamTagAndIndexAndReturnsTheNextIndex) {
    const auto stream = std::make_shared<RecordingStream>();
    const OutgoingMessage proto{5, 5};
    EXPECT_EQ(writeTaggedFrame(proto, "krutil:tag", 0xFFFFFFFF, 41, stream, FrameType::Control), 42U);
    ASSERT_EQ(stream->frames.size(), 1U);
    EXPECT_EQ(transport::contentOf(*stream->frames[0]),
              (FrameContent{true, FrameType::Control, 0xFFFFFFFF, 41, "krutil:tag", "xxxxx"}));
}

TEST(TaggedFramingTest, AnEmptyMessageIsAFrameOfLengthZeroAndReadsBackEmpty) {
    const auto stream = std::make_shared<RecordingStream>();
    const krutil::protobuf::QVMShutdownEvent empty;
    EXPECT_EQ(writeTaggedFrame(empty, "t", 7, 1, stream, FrameType::Object), 2U);
    ASSERT_EQ(stream->frames.size(), 1U);
    EXPECT_EQ(stream->frames[0]->size(), 0U);

    Frames frames(2);
    frames[1] = std::move(stream->frames[0]);
    krutil::protobuf::QVMShutdownEvent parsed;
    readTaggedFrame(1, std::make_unique<Message>(std::move(frames)), parsed, FrameType::Object);
    EXPECT_EQ(parsed.ByteSizeLong(), 0U);
}

TEST(TaggedFramingTest, TheFrameOfAnEmptyMessageHasABufferOfLengthZero) {
    const auto stream = std::make_shared<RecordingStream>();
    AllocationRecorder recorder;
    writeTaggedFrame(krutil::protobuf::QVMShutdownEvent(), "t", 7, 1, stream, FrameType::Object);
    recorder.stop();
    EXPECT_EQ(recorder.arrays(), 1U);
    EXPECT_EQ(recorder.lastArray(), 0U);
    const FrameBuffer buffer = stream->frames.at(0)->releaseBuffer();
    EXPECT_NE(buffer.first, nullptr);
    EXPECT_EQ(buffer.second, 0U);
}

TEST(TaggedFramingTest, TwoSerializersInSequenceUseConsecutiveIndexes) {
    const auto registry = transport::sessionRegistry();
    const auto stream = std::make_shared<RecordingStream>();
    const transport::SerializationContext context;
    const auto& shutdown = transport::serializer<EventFamily>(*registry, "krutil:QVMShutdownEvent");
    const auto& text = transport::serializer<EventFamily>(*registry, "krutil:TextBaseEvent");
    const auto event = boost::make_shared<krutil::io::TextBaseEvent>(foundation::msg_svc::exchange::IDType(),
                                                                     krutil::io::StreamTypeEnum::OUTPUT_STREAM, u"");
    const FrameIndex next = text.serialize(event, 7, 10, stream, registry, context);
    EXPECT_EQ(next, 11U);
    EXPECT_EQ(shutdown.serialize(nullptr, 7, next, stream, registry, context), 12U);
    ASSERT_EQ(stream->frames.size(), 2U);
    EXPECT_EQ(stream->frames[0]->index(), 10U);
    EXPECT_EQ(stream->frames[1]->index(), 11U);
}

TEST(TaggedFramingTest, SizesWithTheSignBitOfTheLow32BitsAreLengthErrors) {
    for (const std::size_t size : {std::size_t{1} << 31, (std::size_t{1} << 31) + 5, (std::size_t{1} << 32) - 1,
                                   (std::size_t{3} << 31) + 1, ~std::size_t{0}}) {
        const auto stream = std::make_shared<RecordingStream>();
        const OutgoingMessage proto{size};
        AllocationRecorder recorder;
        const std::string text = errorText<std::length_error>([&] { write(proto, stream); });
        recorder.stop();
        EXPECT_EQ(text, "Unsupported Protobuf buffer size.") << size;
        EXPECT_EQ(recorder.arrays(), 0U);
        EXPECT_EQ(proto.writeCalls, 0);
        EXPECT_TRUE(stream->frames.empty());
    }
}

TEST(TaggedFramingTest, SizesAreTakenByTheirLow32Bits) {
    const auto stream = std::make_shared<RecordingStream>();
    const OutgoingMessage proto{(std::size_t{1} << 32) + 5, 5};
    EXPECT_EQ(write(proto, stream), 4U);
    ASSERT_EQ(stream->frames.size(), 1U);
    EXPECT_EQ(stream->frames[0]->size(), 5U);
}

TEST(TaggedFramingTest, TheLargestSizePasses) {
#ifdef KRUTIL_SANITIZED
    GTEST_SKIP() << "sanitizers touch what they allocate: 2 GiB";
#endif
    const auto stream = std::make_shared<RecordingStream>();
    const OutgoingMessage proto{0x7FFFFFFF, 0};
    EXPECT_EQ(write(proto, stream), 4U);
    EXPECT_EQ(stream->frames.at(0)->size(), 0x7FFFFFFFU);
}

TEST(TaggedFramingTest, AsksForTheSizeOnceAndSerializesOnce) {
    const auto stream = std::make_shared<RecordingStream>();
    const OutgoingMessage proto{100, 100};
    write(proto, stream);
    EXPECT_EQ(proto.sizeCalls, 1);
    EXPECT_EQ(proto.writeCalls, 1);
}

TEST(TaggedFramingTest, WhatWasWrittenIsNotCheckedAgain) {
    // More than there is room for: the stream over the buffer notes an error, which nobody asks for. And less.
    for (const std::size_t written : {8U, 2U}) {
        const auto stream = std::make_shared<RecordingStream>();
        const OutgoingMessage proto{5, written};
        EXPECT_EQ(write(proto, stream), 4U) << written;
        ASSERT_EQ(stream->frames.size(), 1U) << written;
        EXPECT_EQ(stream->frames[0]->size(), 5U) << written;
    }
}

TEST(TaggedFramingTest, AllocatesOneBufferOfExactlyTheSizeAndSerializesIntoIt) {
    const auto stream = std::make_shared<RecordingStream>();
    const OutgoingMessage proto{1000, 1000};
    AllocationRecorder recorder;
    write(proto, stream);
    recorder.stop();
    EXPECT_EQ(recorder.arrays(), 1U);
    EXPECT_EQ(recorder.lastArray(), 1000U);
    EXPECT_EQ(recorder.largest(), 1000U);
    EXPECT_EQ(proto.target, stream->frames.at(0)->data());
}

TEST(TaggedFramingTest, RealMessagesAllocateOneBufferOfExactlyTheirSize) {
    const auto registry = transport::sessionRegistry();
    const auto& text = transport::serializer<EventFamily>(*registry, "krutil:TextBaseEvent");
    const auto event = boost::make_shared<krutil::io::TextBaseEvent>(
        foundation::msg_svc::exchange::IDType(), krutil::io::StreamTypeEnum::OUTPUT_STREAM, std::u16string(4000, u'a'));
    const auto stream = std::make_shared<RecordingStream>();
    AllocationRecorder recorder;
    text.serialize(event, 7, 1, stream, registry, transport::SerializationContext());
    recorder.stop();
    EXPECT_EQ(recorder.arrays(), 1U);
    EXPECT_EQ(recorder.lastArray(), 2U + 3U + 4000U);
    EXPECT_EQ(stream->frames.at(0)->size(), 2U + 3U + 4000U);
}

TEST(TaggedFramingTest, TheDeleterIsDefaultDelete) {
    const auto stream = std::make_shared<RecordingStream>();
    write(OutgoingMessage{5, 5}, stream);
    const FrameBuffer buffer = stream->frames.at(0)->releaseBuffer();
    EXPECT_EQ(buffer.first.get_deleter().target_type(), typeid(std::default_delete<char[]>));
    EXPECT_EQ(buffer.second, 5U);
}

TEST(TaggedFramingTest, AStreamMayLeaveTheFrameWhichIsDestroyed) {
    const auto stream = std::make_shared<LeavingStream>();
    const OutgoingMessage proto{100, 100};
    AllocationRecorder recorder;
    const FrameIndex next = write(proto, stream);
    recorder.stop();
    EXPECT_EQ(next, 4U);
    EXPECT_EQ(recorder.outstanding(), 0);
}

TEST(TaggedFramingTest, AStreamMayThrowWithOrWithoutTheFrame) {
    for (const bool takes : {true, false}) {
        const auto stream = std::make_shared<ThrowingStream>(takes);
        const OutgoingMessage proto{100, 100};
        std::string text;
        text.reserve(100);
        AllocationRecorder recorder;
        try {
            write(proto, stream);
        } catch (const std::runtime_error& error) {
            text = error.what();
        }
        recorder.stop();
        EXPECT_EQ(text, "the stream is closed");
        EXPECT_EQ(recorder.outstanding(), 0);
    }
}

TEST(TaggedFramingTest, NothingIsAppendedWhenSerializingThrows) {
    const auto stream = std::make_shared<RecordingStream>();
    const OutgoingMessage proto{100, 100, true};
    EXPECT_THROW(write(proto, stream), SerializationFault);
    EXPECT_TRUE(stream->frames.empty());
}

TEST(TaggedFramingTest, AFailedAllocationReachesTheCallerAndLeavesNothing) {
    // The tag is too long to be kept inside a string, so that it is an allocation as well.
    const std::string tag(100, 't');
    for (long failing = 0;; ++failing) {
        const auto stream = std::make_shared<RecordingStream>();
        const OutgoingMessage proto{100, 100};
        bool thrown = false;
        AllocationRecorder recorder(failing);
        try {
            writeTaggedFrame(proto, tag, 7, 3, stream, FrameType::Object);
        } catch (const std::bad_alloc&) {
            thrown = true;
        }
        recorder.stop();
        if (!recorder.failed()) {
            // Buffer, frame and tag at least, besides what the recording stream itself needs.
            EXPECT_GE(failing, 3);
            break;
        }
        ASSERT_TRUE(thrown) << failing;
        ASSERT_TRUE(stream->frames.empty()) << failing;
        ASSERT_EQ(recorder.outstanding(), 0) << failing;
    }
}

// ---- Reading --------------------------------------------------------------------------------------------------------

TEST(TaggedFramingTest, ParsesStraightFromTheFramesBuffer) {
    const auto message = makeMessage("tag", std::string(1000, 'x'));
    const void* bytes = message->frame(1)->data();
    IncomingMessage proto;
    readTaggedFrame(1, message, proto, FrameType::Object);
    EXPECT_EQ(proto.calls, 1);
    EXPECT_EQ(proto.source, bytes);
    EXPECT_EQ(proto.size, 1000);
    EXPECT_EQ(proto.recursionBudget, 100);
    EXPECT_EQ(message->frame(1), nullptr);
}

TEST(TaggedFramingTest, AbsentFrameIsBadCast) {
    const auto message = makeMessage("tag", "x");
    IncomingMessage proto;
    for (const FrameIndex index : {FrameIndex{0}, FrameIndex{2}, FrameIndex{1} << 32, ~FrameIndex{0}}) {
        EXPECT_THROW(readTaggedFrame(index, message, proto, FrameType::Object), std::bad_cast) << index;
    }
    EXPECT_EQ(proto.calls, 0);
    EXPECT_NE(message->frame(1), nullptr);
    EXPECT_EQ(message->size(), 2U);
}

TEST(TaggedFramingTest, HostileIndexesNeitherGrowThrowNorDangle) {
    const auto message = makeMessage("tag", "x");
    const std::unique_ptr<Frame>& past = message->frame(~0UL);
    EXPECT_EQ(past, nullptr);
    for (const unsigned long index : {0UL, 2UL, 1UL << 63, ~0UL}) {
        EXPECT_EQ(message->frame(index), nullptr);
        EXPECT_EQ(message->release(index), nullptr);
    }
    EXPECT_EQ(past, nullptr);
    EXPECT_EQ(message->size(), 2U);
    EXPECT_EQ(Message({}).frame(0), nullptr);
}

TEST(TaggedFramingTest, ADataFrameIsBadCastAndStays) {
    const auto message = makeMessage({FrameContent{false, FrameType::Object, 7, 1, "", "x"}});
    IncomingMessage proto;
    EXPECT_THROW(readTaggedFrame(1, message, proto, FrameType::Object), std::bad_cast);
    EXPECT_NE(message->frame(1), nullptr);
}

TEST(TaggedFramingTest, WrongFrameTypeIsBadCastAndTheFrameIsGone) {
    for (const auto& [written, expected] :
         {std::pair(FrameType::Control, FrameType::Object), std::pair(FrameType::Object, FrameType::Control)}) {
        released = 0;
        const auto message = messageClaiming(4, 4, written);
        IncomingMessage proto;
        EXPECT_THROW(readTaggedFrame(1, message, proto, expected), std::bad_cast);
        EXPECT_EQ(proto.calls, 0);
        EXPECT_EQ(message->frame(1), nullptr);
        EXPECT_EQ(released, 1);
    }
}

TEST(TaggedFramingTest, AFrameIsReadOnce) {
    const auto message = makeMessage("tag", "x");
    IncomingMessage proto;
    readTaggedFrame(1, message, proto, FrameType::Object);
    EXPECT_THROW(readTaggedFrame(1, message, proto, FrameType::Object), std::bad_cast);
    EXPECT_EQ(proto.calls, 1);
}

TEST(TaggedFramingTest, ANullBufferCountsAsLengthZeroBeforeTheLengthIsTested) {
    for (const unsigned long claimed : {5UL, 1UL << 31, ~0UL}) {
        Frames frames(2);
        frames[1] = std::make_unique<TaggedFrame>(FrameType::Object, 7U, "tag", FrameBuffer(nullptr, claimed), 1UL);
        const auto message = std::make_unique<Message>(std::move(frames));
        IncomingMessage proto;
        readTaggedFrame(1, message, proto, FrameType::Object);
        EXPECT_EQ(proto.calls, 1);
        EXPECT_EQ(proto.size, 0);
    }
}

TEST(TaggedFramingTest, LengthsAbove31BitsArePositiveOverflowAndTheFrameIsGone) {
    for (const unsigned long claimed : {1UL << 31, (1UL << 32) + 5, ~0UL}) {
        released = 0;
        const auto message = messageClaiming(claimed, 1);
        IncomingMessage proto;
        EXPECT_THROW(readTaggedFrame(1, message, proto, FrameType::Object), boost::numeric::positive_overflow);
        EXPECT_EQ(proto.calls, 0);
        EXPECT_EQ(message->frame(1), nullptr);
        EXPECT_EQ(released, 1);
    }
}

TEST(TaggedFramingTest, TheLargestLengthIsParsed) {
    released = 0;
    const auto message = messageClaiming(0x7FFFFFFF, 1);
    IncomingMessage proto;
    readTaggedFrame(1, message, proto, FrameType::Object);
    EXPECT_EQ(proto.size, 0x7FFFFFFF);
    EXPECT_EQ(released, 1);
}

TEST(TaggedFramingTest, TheResultOfTheParseIsIgnored) {
    released = 0;
    const auto message = messageClaiming(4, 4);
    IncomingMessage proto{false};
    EXPECT_NO_THROW(readTaggedFrame(1, message, proto, FrameType::Object));
    EXPECT_EQ(proto.calls, 1);
    EXPECT_EQ(released, 1);
}

TEST(TaggedFramingTest, TheBufferIsFreedWhenParsingThrows) {
    released = 0;
    const auto message = messageClaiming(4, 4);
    IncomingMessage proto{true, true};
    EXPECT_THROW(readTaggedFrame(1, message, proto, FrameType::Object), SerializationFault);
    EXPECT_EQ(message->frame(1), nullptr);
    EXPECT_EQ(released, 1);
}

// The parser's own limit of 64 MiB on older versions must not cut it.
TEST(TaggedFramingTest, ATextEventOf65MebibytesRoundTrips) {
    const auto registry = transport::sessionRegistry();
    const auto& serializer = transport::serializer<EventFamily>(*registry, "krutil:TextBaseEvent");
    const transport::SerializationContext context;
    const auto stream = std::make_shared<RecordingStream>();
    std::u16string text(std::size_t{65} << 20, u'a');
    text.back() = u'z';
    const auto event = boost::make_shared<krutil::io::TextBaseEvent>(foundation::msg_svc::exchange::IDType(1, 2),
                                                                     krutil::io::StreamTypeEnum::ERROR_STREAM, text);
    serializer.serialize(event, 7, 1, stream, registry, context);
    Frames frames(2);
    frames[1] = std::move(stream->frames.at(0));
    EXPECT_GT(frames[1]->size(), std::size_t{65} << 20);
    const auto back = serializer.deserialize(1, std::make_unique<Message>(std::move(frames)), registry, context);
    EXPECT_TRUE(dynamic_cast<const krutil::io::TextBaseEvent&>(*back).getText() == text);
}

}  // namespace
