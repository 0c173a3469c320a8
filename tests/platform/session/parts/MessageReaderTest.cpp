#include "foundation/msg_svc/transport/layers/session/MessageReader.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <new>

#include "foundation/msg_svc/transport/layers/session/SessionError.hpp"
#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"
#include "foundation/vantor/carrier/framing/DataFrame.hpp"
#include "foundation/vantor/carrier/framing/TaggedFrame.hpp"
#include "platform/session/support/WireBytes.hpp"

namespace {

// Allocations of at least this size are counted, so that bookkeeping does not hide a copy of a content.
constexpr std::size_t countedSize = 64 * 1024;
thread_local std::size_t largeAllocations = 0;

void* allocate(std::size_t size) {
    largeAllocations += size >= countedSize ? 1 : 0;
    if (void* const memory = std::malloc(size == 0 ? 1 : size)) {
        return memory;
    }
    throw std::bad_alloc();
}

}  // namespace

void* operator new(std::size_t size) {
    return allocate(size);
}
void* operator new[](std::size_t size) {
    return allocate(size);
}
void operator delete(void* memory) noexcept {
    std::free(memory);
}
void operator delete[](void* memory) noexcept {
    std::free(memory);
}
void operator delete(void* memory, std::size_t) noexcept {
    std::free(memory);
}
void operator delete[](void* memory, std::size_t) noexcept {
    std::free(memory);
}

namespace foundation::msg_svc::transport::layers::session {
namespace {

using framing::BufferAllocator;
using framing::DataFrame;
using framing::TaggedFrame;
using testing::ElementsAre;
using testing::ThrowsMessage;

constexpr std::uint64_t huge = ~std::uint64_t{0};

// One line for each item, so that whole streams can be compared.
std::string describe(const MessageReader::Item& item) {
    if (const auto* const abort = std::get_if<MessageReader::Abort>(&item)) {
        return "abort " + abort->reason;
    }
    if (std::holds_alternative<MessageReader::Goodbye>(item)) {
        return "goodbye";
    }
    std::string text = "message";
    for (const auto& frame : std::get<MessageReader::Frames>(item).frames) {
        const auto* const tagged = dynamic_cast<const TaggedFrame*>(frame.get());
        text += " " + std::to_string(frame->index()) + "/" + std::to_string(frame->streamID()) + "/" +
                std::to_string(static_cast<int>(frame->type())) + (tagged ? "/" + std::string(tagged->tag()) : "") +
                "=" + std::string(frame->data(), frame->size());
    }
    return text;
}

// Puts `bytes` into the reader's buffers, at most `chunk` at a time, and collects what comes out.
std::vector<std::string> feed(MessageReader& reader, std::string_view bytes, std::size_t chunk = 1U << 30) {
    std::vector<std::string> items;
    while (!bytes.empty()) {
        std::size_t left = std::min(chunk, bytes.size());
        std::size_t count = 0;
        const auto buffers = reader.buffers();
        EXPECT_FALSE(buffers.empty());
        for (const iovec& buffer : buffers) {
            const std::size_t taken = std::min(left - count, buffer.iov_len);
            std::memcpy(buffer.iov_base, bytes.data() + count, taken);
            count += taken;
        }
        EXPECT_GT(count, 0U);
        reader.commit(count);
        bytes.remove_prefix(count);
        while (const auto item = reader.next()) {
            items.push_back(describe(*item));
        }
    }
    return items;
}

std::vector<std::string> read(const std::string& bytes, const Limits& limits = {}, std::size_t chunk = 1U << 30) {
    MessageReader reader(limits, "test:array");
    return feed(reader, bytes, chunk);
}

std::string recordedStream() {
    return wire::tagged(1, 1, true, "a", "one") +                                                     //
           wire::data(2, 1, false, "DATA", 5) + wire::data(2, 2, false, "") +                         //
           wire::tagged(2, 3, false, "part", "") + wire::tagged(2, 4, true, "root", "content", 27) +  //
           wire::tagged(0, 1, true, "event", std::string(300, 'e')) +                                 //
           wire::goodbye() + wire::abort("because");
}

const std::vector<std::string>& recordedItems() {
    static const std::vector<std::string> items{
        "message 1/1/29/a=one", "message 1/2/5=DATA 2/2/4= 3/2/29/part= 4/2/27/root=content",
        "message 1/0/29/event=" + std::string(300, 'e'), "goodbye", "abort because"};
    return items;
}

TEST(MessageReaderTest, RebuildsMessages) {
    EXPECT_EQ(read(recordedStream()), recordedItems());
}

TEST(MessageReaderTest, EveryChunkingGivesTheSameMessages) {
    for (std::size_t chunk = 1; chunk <= recordedStream().size(); ++chunk) {
        ASSERT_EQ(read(recordedStream(), {}, chunk), recordedItems()) << chunk;
    }
}

TEST(MessageReaderTest, EveryCutGivesTheMessagesBeforeItAndTellsWhereItIs) {
    const std::string bytes = recordedStream();
    std::vector<std::size_t> boundaries{0, 28};
    for (std::size_t cut = 0; cut <= bytes.size(); ++cut) {
        MessageReader reader(Limits(), "");
        const auto items = feed(reader, bytes.substr(0, cut));
        ASSERT_LE(items.size(), recordedItems().size());
        ASSERT_TRUE(std::equal(items.begin(), items.end(), recordedItems().begin())) << cut;
        ASSERT_EQ(reader.atBoundary(), reader.position() == "between two messages") << cut;
        // The rest completes the stream, wherever the cut was.
        auto rest = feed(reader, bytes.substr(cut));
        rest.insert(rest.begin(), items.begin(), items.end());
        ASSERT_EQ(rest, recordedItems()) << cut;
        ASSERT_TRUE(reader.atBoundary());
    }
}

TEST(MessageReaderTest, PositionNamesThePartThatIsArriving) {
    const auto positionAfter = [](const std::string& bytes) {
        MessageReader reader(Limits(), "");
        feed(reader, bytes);
        return reader.position();
    };
    const std::string first = wire::data(1, 1, false, "12345");
    const std::string second = wire::tagged(1, 2, true, "the:tag", "content");
    EXPECT_EQ(positionAfter(""), "between two messages");
    EXPECT_EQ(positionAfter(first.substr(0, 5)),
              "in the middle of a message: 5 of 24 header bytes of frame 1 had arrived");
    EXPECT_EQ(positionAfter(first.substr(0, 26)),
              "in the middle of a message: 2 of 5 content bytes of frame 1 had arrived");
    EXPECT_EQ(positionAfter(first), "in the middle of a message: 0 of 24 header bytes of frame 2 had arrived");
    EXPECT_EQ(positionAfter(first + second.substr(0, 27)),
              "in the middle of a message: 3 of 7 tag bytes of frame 2 had arrived");
    EXPECT_EQ(positionAfter(first + second.substr(0, 32)),
              "in the middle of a message: 1 of 7 content bytes of frame 2, tag \"the:tag\", had arrived");
}

// Zero copy.

TEST(MessageReaderTest, ContentIsReadIntoTheBufferThatItsFrameKeeps) {
    for (const bool tagged : {true, false}) {
        MessageReader reader(Limits(), "");
        const std::string content(100'000, 'c');
        const std::string bytes = tagged ? wire::tagged(1, 1, true, "t", content)
                                         : wire::data(1, 1, false, content) + wire::tagged(1, 2, true, "t", "");
        feed(reader, bytes.substr(0, tagged ? 25 : 24));
        const auto buffers = reader.buffers();
        ASSERT_EQ(buffers.size(), 2U);
        EXPECT_EQ(buffers[0].iov_len, content.size());
        EXPECT_EQ(buffers[1].iov_len, MessageReader::usualAhead) << "what follows the content";
        const void* const exposed = buffers[0].iov_base;
        std::memcpy(buffers[0].iov_base, content.data(), content.size());
        // What follows comes with the same read.
        const std::string rest = bytes.substr((tagged ? 25 : 24) + content.size());
        std::memcpy(buffers[1].iov_base, rest.data(), rest.size());
        reader.commit(content.size() + rest.size());
        std::optional<MessageReader::Item> item = reader.next();
        ASSERT_TRUE(item);
        EXPECT_EQ(std::get<MessageReader::Frames>(*item).frames[0]->data(), exposed);
    }
}

TEST(MessageReaderTest, OneReadTakesManyMessagesAndTheNextOneMoreWhenItWasFull) {
    MessageReader reader(Limits(), "");
    std::string bytes;
    for (int i = 0; i < 1000; ++i) {
        bytes += wire::tagged(1, 1, true, "t", std::string(100, 'c'));
    }
    std::vector<std::size_t> ahead;
    std::size_t messages = 0;
    for (std::string_view rest = bytes; !rest.empty();) {
        std::size_t count = 0;
        for (const iovec& buffer : reader.buffers()) {
            const std::size_t taken = std::min(rest.size() - count, buffer.iov_len);
            std::memcpy(buffer.iov_base, rest.data() + count, taken);
            count += taken;
            ahead.push_back(buffer.iov_len);
        }
        reader.commit(count);
        rest.remove_prefix(count);
        while (reader.next()) {
            ++messages;
        }
    }
    EXPECT_EQ(messages, 1000U);
    // The content that a read cuts is completed where it stays, before what follows.
    EXPECT_THAT(ahead, ElementsAre(4096, 29, 65'536, 89, 65'536));
    EXPECT_EQ(reader.buffers().back().iov_len, MessageReader::usualAhead) << "the last read was not full";
}

TEST(MessageReaderTest, DataFramesComeInBuffersOfTheAllocatorEmptyOnesToo) {
    const std::size_t before = BufferAllocator::inUse();
    {
        MessageReader reader(Limits(), "");
        std::vector<std::unique_ptr<framing::Frame>> frames;
        const std::string bytes =
            wire::data(1, 1, false, "12345") + wire::data(1, 2, false, "") + wire::tagged(1, 3, true, "t", "");
        std::string_view rest = bytes;
        while (!rest.empty()) {
            const iovec buffer = reader.buffers()[0];
            const std::size_t count = std::min(rest.size(), buffer.iov_len);
            std::memcpy(buffer.iov_base, rest.data(), count);
            reader.commit(count);
            rest.remove_prefix(count);
            while (auto item = reader.next()) {
                frames = std::move(std::get<MessageReader::Frames>(*item).frames);
            }
        }
        ASSERT_EQ(frames.size(), 3U);
        EXPECT_EQ(BufferAllocator::sizeOf(frames[0]->data()), 5U);
        EXPECT_EQ(BufferAllocator::sizeOf(frames[1]->data()), 0U);
        for (std::size_t i = 0; i < 2; ++i) {
            EXPECT_TRUE(dynamic_cast<DataFrame&>(*frames[i]).shareable());
            const framing::FrameBuffer buffer = frames[i]->releaseBuffer();
            ASSERT_NE(buffer.first.get_deleter().target<void (*)(char*)>(), nullptr);
            EXPECT_EQ(*buffer.first.get_deleter().target<void (*)(char*)>(), &BufferAllocator::release);
        }
        const framing::FrameBuffer root = frames[2]->releaseBuffer();
        EXPECT_NE(root.first.get_deleter().target<std::default_delete<char[]>>(), nullptr);
    }
    EXPECT_EQ(BufferAllocator::inUse(), before);
}

TEST(MessageReaderTest, ReceivingAllocatesOneBufferForEachContent) {
    const std::string dataContent(300'000, 'd');
    const std::string rootContent(200'000, 'r');
    const std::string bytes = wire::data(1, 1, false, dataContent) + wire::tagged(1, 2, true, "t", rootContent);
    MessageReader reader(Limits(), "");
    std::string_view rest = bytes;
    std::optional<MessageReader::Item> item;
    const std::size_t allocatedBefore = largeAllocations;
    const std::size_t inUseBefore = BufferAllocator::inUse();
    while (!rest.empty()) {
        std::size_t count = 0;
        for (const iovec& buffer : reader.buffers()) {
            const std::size_t taken = std::min({std::size_t{10'000}, rest.size() - count, buffer.iov_len});
            std::memcpy(buffer.iov_base, rest.data() + count, taken);
            count += taken;
            if (taken < buffer.iov_len) {
                break;
            }
        }
        reader.commit(count);
        rest.remove_prefix(count);
        while (auto next = reader.next()) {
            item = std::move(next);
        }
    }
    ASSERT_TRUE(item);
    EXPECT_EQ(BufferAllocator::inUse() - inUseBefore, 1U) << "the data frame";
    EXPECT_EQ(largeAllocations - allocatedBefore, 1U) << "the tagged frame";
}

// Limits. What is claimed is refused before memory is asked for.

struct Refusal {
    const char* name;
    wire::Header header;
    const char* text;
};

std::ostream& operator<<(std::ostream& out, const Refusal& refusal) {
    return out << refusal.name;
}

Limits smallLimits() {
    Limits limits;
    limits.tag = 10;
    limits.taggedFrame = 1000;
    limits.arrayMessage = 2000;
    limits.message = 5000;
    limits.frames = 3;
    return limits;
}

class RefusedHeaderTest : public testing::TestWithParam<Refusal> {};

TEST_P(RefusedHeaderTest, FirstHeader) {
    MessageReader reader(smallLimits(), "test:array");
    const std::size_t allocated = largeAllocations;
    const std::size_t inUse = BufferAllocator::inUse();
    EXPECT_THAT([&] { feed(reader, wire::header(GetParam().header)); },
                ThrowsMessage<ProtocolViolation>(GetParam().text));
    EXPECT_EQ(largeAllocations, allocated);
    EXPECT_EQ(BufferAllocator::inUse(), inUse);
}

INSTANTIATE_TEST_SUITE_P(
    Headers, RefusedHeaderTest,
    testing::Values(
        Refusal{"kind 0",
                {0, true, 29, 1, 1, 1, 0},
                "frame kind: expected 1 (tagged), 2 (data), 3 (goodbye) or 4 (abort), got 0"},
        Refusal{"kind 5, kept for shared memory",
                {5, true, 29, 1, 1, 1, 0},
                "frame kind: expected 1 (tagged), 2 (data), 3 (goodbye) or 4 (abort), got 5"},
        Refusal{"kind 127",
                {127, true, 29, 1, 1, 1, 0},
                "frame kind: expected 1 (tagged), 2 (data), 3 (goodbye) or 4 (abort), got 127"},
        Refusal{"index 0", {1, true, 29, 1, 1, 0, 0}, "frame index: expected 1, got 0"},
        Refusal{"index 2", {1, true, 29, 1, 1, 2, 0}, "frame index: expected 1, got 2"},
        Refusal{"largest index", {2, false, 29, 0, 1, huge, 0}, "frame index: expected 1, got 18446744073709551615"},
        Refusal{"no tag",
                {1, true, 29, 0, 1, 1, 5},
                "tag of a tagged frame (frame 1 on stream 1): expected at least 1 byte, got none"},
        Refusal{"tag of a data frame",
                {2, true, 29, 4, 1, 1, 5},
                "tag of a data frame (frame 1 on stream 1): expected none, got 4 bytes"},
        Refusal{"long tag",
                {1, true, 29, 11, 1, 1, 0},
                "tag of frame 1 on stream 1 exceeds the limit \"tag\": expected at most 10 bytes, got 11"},
        Refusal{"longest tag",
                {1, true, 29, 65535, 1, 1, 0},
                "tag of frame 1 on stream 1 exceeds the limit \"tag\": expected at most 10 bytes, got 65535"},
        Refusal{"content above both limits",
                {1, true, 29, 1, 1, 1, 2001},
                "content of frame 1 on stream 1 exceeds the limit \"arrayMessage\": expected at most 2000 bytes, got "
                "2001"},
        Refusal{"largest content",
                {1, true, 29, 1, 1, 1, huge},
                "content of frame 1 on stream 1 exceeds the limit \"arrayMessage\": expected at most 2000 bytes, got "
                "18446744073709551615"},
        Refusal{"data above the message",
                {2, false, 29, 0, 1, 1, 5001},
                "message with frame 1 on stream 1 exceeds the limit \"message\": expected at most 5000 bytes, got 0 "
                "bytes and a content of 5001"},
        Refusal{"largest data",
                {2, false, 29, 0, 1, 1, huge},
                "message with frame 1 on stream 1 exceeds the limit \"message\": expected at most 5000 bytes, got 0 "
                "bytes and a content of 18446744073709551615"},
        Refusal{"goodbye with content", {3, false, 0, 0, 0, 0, 1}, "goodbye frame: expected no content, got 1 bytes"},
        Refusal{"goodbye with a last bit",
                {3, true, 0, 0, 0, 0, 0},
                "goodbye frame: expected last bit, frame type, tag size, stream ID and index 0"},
        Refusal{"goodbye on a stream",
                {3, false, 0, 0, 9, 0, 0},
                "goodbye frame: expected last bit, frame type, tag size, stream ID and index 0"},
        Refusal{"abort with a tag",
                {4, false, 0, 1, 0, 0, 0},
                "abort frame: expected last bit, frame type, tag size, stream ID and index 0"},
        Refusal{"abort with an index",
                {4, false, 0, 0, 0, 1, 0},
                "abort frame: expected last bit, frame type, tag size, stream ID and index 0"},
        Refusal{"long abort",
                {4, false, 0, 0, 0, 0, 4097},
                "abort frame: expected a reason of at most 4096 bytes, got 4097"}));

TEST(MessageReaderTest, LimitsAreInclusive) {
    const std::string tag(10, 't');
    EXPECT_EQ(read(wire::tagged(1, 1, true, tag, std::string(1000, 'c')), smallLimits()).size(), 1U);
    EXPECT_EQ(read(wire::tagged(1, 1, true, "test:array", std::string(2000, 'c')), smallLimits()).size(), 1U);
    EXPECT_EQ(
        read(wire::data(1, 1, false, std::string(4999, 'd')) + wire::tagged(1, 2, true, "t", ""), smallLimits()).size(),
        1U);
}

TEST(MessageReaderTest, TagDecidesWhichLimitTheContentHas) {
    EXPECT_THAT(
        [] {
            read(wire::header({1, true, 29, 3, 1, 1, 1001}) + "abc", smallLimits());
        },
        ThrowsMessage<ProtocolViolation>("content of frame 1 with tag \"abc\" exceeds the limit "
                                         "\"taggedFrame\": expected at most 1000 bytes, got 1001"));
    Limits limits = smallLimits();
    limits.arrayMessage = 100;
    EXPECT_THAT(
        [&] {
            read(wire::header({1, true, 29, 10, 1, 1, 101}) + "test:array", limits);
        },
        ThrowsMessage<ProtocolViolation>("content of frame 1 with tag \"test:array\" exceeds the limit "
                                         "\"arrayMessage\": expected at most 100 bytes, got 101"));
    EXPECT_EQ(read(wire::tagged(1, 1, true, "abc", std::string(1000, 'c')), limits).size(), 1U);
}

TEST(MessageReaderTest, ContentAboveTheSmallerLimitWaitsForItsTag) {
    MessageReader reader(smallLimits(), "test:array");
    feed(reader, wire::header({1, true, 29, 10, 1, 1, 1500}) + "test:arra");
    EXPECT_EQ(reader.contentSize(), 0U) << "no memory for a content whose limit is not known";
    EXPECT_EQ(reader.buffers().size(), 1U);
    feed(reader, "y");
    EXPECT_EQ(reader.contentSize(), 1500U);
    EXPECT_EQ(reader.buffers()[0].iov_len, 1500U);
}

TEST(MessageReaderTest, MessageLimitCountsTagsAndAllFrames) {
    const std::string first = wire::data(1, 1, false, std::string(3000, 'd'));
    const std::string second = wire::tagged(1, 2, false, "12345", std::string(1000, 'c'));
    EXPECT_THAT(
        [&] {
            read(first + second + wire::header({1, true, 29, 5, 1, 3, 991}), smallLimits());
        },
        ThrowsMessage<ProtocolViolation>("message with frame 3 on stream 1 exceeds the limit \"message\": "
                                         "expected at most 5000 bytes, got 4010 bytes and a content of 991"));
    EXPECT_EQ(read(first + second + wire::tagged(1, 3, true, "12345", std::string(990, 'c')), smallLimits()).size(),
              1U);
}

TEST(MessageReaderTest, EachMessageHasTheWholeLimit) {
    const std::string message = wire::data(1, 1, false, std::string(4000, 'd')) + wire::tagged(1, 2, true, "t", "");
    EXPECT_EQ(read(message + message + message, smallLimits()).size(), 3U);
}

TEST(MessageReaderTest, FramesOfAMessageAreCounted) {
    const auto frame = [](std::uint64_t index, bool last) { return wire::data(1, index, last, ""); };
    EXPECT_EQ(read(frame(1, false) + frame(2, false) + frame(3, true), smallLimits()).size(), 1U);
    EXPECT_THAT([&] { read(frame(1, false) + frame(2, false) + frame(3, false) + frame(4, true), smallLimits()); },
                ThrowsMessage<ProtocolViolation>(
                    "number of frames of a message exceeds the limit \"frames\": expected at most 3 frames, got 4"));
}

TEST(MessageReaderTest, ContentThatNoMemoryHoldsIsRefused) {
    Limits limits;
    limits.message = huge;
    EXPECT_THAT(
        [&] {
            read(wire::header({2, false, 4, 0, 1, 1, 1ULL << 62}), limits);
        },
        ThrowsMessage<ProtocolViolation>("there is no memory for the content of frame 1, 4611686018427387904 bytes"));
}

TEST(MessageReaderTest, FrameIndexesRiseByOne) {
    for (const std::uint64_t index : {std::uint64_t{0}, std::uint64_t{1}, std::uint64_t{3}, huge}) {
        EXPECT_THAT([&] { read(wire::data(1, 1, false, "") + wire::data(1, index, true, "")); },
                    ThrowsMessage<ProtocolViolation>("frame index: expected 2, got " + std::to_string(index)));
    }
}

TEST(MessageReaderTest, FramesOfAMessageShareOneStream) {
    EXPECT_THAT([] { read(wire::data(7, 1, false, "") + wire::tagged(8, 2, true, "t", "")); },
                ThrowsMessage<ProtocolViolation>(
                    "stream ID of frame 2: expected 7 as in the frames before it in its message, got 8"));
}

TEST(MessageReaderTest, GoodbyeInsideAMessageIsRefused) {
    EXPECT_THAT([] { read(wire::data(7, 1, false, "") + wire::goodbye()); },
                ThrowsMessage<ProtocolViolation>("goodbye frame in the middle of a message: expected frame 2"));
}

TEST(MessageReaderTest, AbortMayComeBetweenTheFramesOfAMessage) {
    EXPECT_THAT(read(wire::data(7, 1, false, "x") + wire::abort("enough")), ElementsAre("abort enough"));
}

TEST(MessageReaderTest, MessageBeforeARefusedHeaderIsDelivered) {
    MessageReader reader(Limits(), "");
    const std::string bytes = wire::tagged(1, 1, true, "t", "c") + wire::header({9, true, 0, 0, 0, 0, 0});
    std::memcpy(reader.buffers()[0].iov_base, bytes.data(), bytes.size());
    reader.commit(bytes.size());
    const auto item = reader.next();
    ASSERT_TRUE(item);
    EXPECT_EQ(describe(*item), "message 1/1/29/t=c");
    EXPECT_THROW(reader.next(), ProtocolViolation);
}

TEST(MessageReaderTest, ClaimedGigabytesTouchNoMemory) {
    // The header is within the default limits; nothing follows it.
    MessageReader reader(Limits(), "");
    feed(reader, wire::header({2, false, 4, 0, 1, 1, 3ULL << 30}));
    ASSERT_EQ(reader.buffers().size(), 2U);
    EXPECT_EQ(reader.buffers()[0].iov_len, 3ULL << 30);
    EXPECT_EQ(reader.position(), "in the middle of a message: 0 of 3221225472 content bytes of frame 1 had arrived");
}

}  // namespace
}  // namespace foundation::msg_svc::transport::layers::session
