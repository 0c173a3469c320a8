#include <gtest/gtest.h>

#include <cstring>

#include "foundation/vantor/carrier/framing/DataFrame.hpp"
#include "foundation/vantor/carrier/framing/TaggedFrame.hpp"

namespace foundation::vantor::carrier::framing {
namespace {

int released = 0;

void countingRelease(char* buffer) {
    ++released;
    delete[] buffer;
}

FrameBuffer bufferOf(const char* text) {
    const std::size_t size = std::strlen(text);
    FrameBuffer buffer(std::unique_ptr<char[], std::function<void(char*)>>(new char[size], &countingRelease), size);
    std::memcpy(buffer.first.get(), text, size);
    return buffer;
}

TEST(FramingTest, TaggedFrameTellsWhatItWasGiven) {
    const TaggedFrame frame(FrameType::Control, 7, "a:tag", bufferOf("abc"), 3);
    EXPECT_EQ(frame.type(), FrameType::Control);
    EXPECT_EQ(frame.streamID(), 7U);
    EXPECT_EQ(frame.index(), 3U);
    EXPECT_EQ(frame.tag(), "a:tag");
    EXPECT_EQ(std::string(frame.data(), frame.size()), "abc");
}

TEST(FramingTest, TaggedFrameHasACopyOfItsTagWhateverItsLength) {
    for (const std::size_t length : {0U, 1U, 47U, 48U, 49U, 128U, 1000U}) {
        std::string tag;
        for (std::size_t i = 0; i < length; ++i) {
            tag += static_cast<char>(i % 251);
        }
        const std::string expected = tag;
        const TaggedFrame frame(FrameType::Object, 1, tag, bufferOf(""), 1);
        tag.assign(length, '?');
        EXPECT_EQ(frame.tag(), expected) << length;
    }
}

TEST(FramingTest, DataFrameKeepsTheBufferThatItWasGiven) {
    FrameBuffer buffer = bufferOf("12345");
    const char* const address = buffer.first.get();
    const DataFrame frame(static_cast<FrameType>(200), 4'000'000'000U, std::move(buffer), true, 1ULL << 40);
    EXPECT_EQ(frame.data(), address);
    EXPECT_EQ(frame.size(), 5U);
    EXPECT_EQ(static_cast<int>(frame.type()), 200);
    EXPECT_EQ(frame.streamID(), 4'000'000'000U);
    EXPECT_EQ(frame.index(), 1ULL << 40);
    EXPECT_TRUE(frame.shareable());
}

TEST(FramingTest, DataFrameRemembersThatItsBytesMayChange) {
    EXPECT_FALSE(DataFrame(FrameType::Object, 1, bufferOf("x"), false, 1).shareable());
}

TEST(FramingTest, NullBufferHasNoBytesWhateverLengthCameWithIt) {
    const DataFrame frame(FrameType::Object, 1, FrameBuffer(nullptr, 99), true, 1);
    EXPECT_EQ(frame.data(), nullptr);
    EXPECT_EQ(frame.size(), 0U);
}

TEST(FramingTest, ReleaseBufferMovesBytesAndDeleterOut) {
    released = 0;
    {
        TaggedFrame frame(FrameType::Object, 1, "t", bufferOf("abc"), 1);
        const char* const address = frame.data();
        const FrameBuffer buffer = frame.releaseBuffer();
        EXPECT_EQ(buffer.first.get(), address);
        EXPECT_EQ(buffer.second, 3U);
        ASSERT_NE(buffer.first.get_deleter().target<void (*)(char*)>(), nullptr);
        EXPECT_EQ(*buffer.first.get_deleter().target<void (*)(char*)>(), &countingRelease);
        EXPECT_EQ(frame.data(), nullptr);
        EXPECT_EQ(frame.size(), 0U);
        EXPECT_EQ(frame.releaseBuffer().first, nullptr);
        EXPECT_EQ(released, 0);
    }
    EXPECT_EQ(released, 1);
}

TEST(FramingTest, FrameReleasesItsBufferOnce) {
    released = 0;
    { const std::unique_ptr<Frame> frame = std::make_unique<DataFrame>(FrameType::Object, 1, bufferOf("x"), true, 1); }
    EXPECT_EQ(released, 1);
}

TEST(FramingTest, FrameTypesOfTaggedFramesAreFixed) {
    EXPECT_EQ(static_cast<int>(FrameType::Control), 27);
    EXPECT_EQ(static_cast<int>(FrameType::Object), 29);
    EXPECT_EQ(sizeof(FrameType), 1U);
}

}  // namespace
}  // namespace foundation::vantor::carrier::framing
