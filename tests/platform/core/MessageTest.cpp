#include "foundation/msg_svc/transport/layers/message/Message.hpp"

#include <gtest/gtest.h>

#include <limits>

#include "foundation/vantor/carrier/framing/DataFrame.hpp"

namespace foundation::msg_svc::transport::layers::message {
namespace {

std::unique_ptr<Frame> makeFrame(unsigned long index) {
    return std::make_unique<framing::DataFrame>(framing::FrameType::Object, 1, framing::FrameBuffer(), true, index);
}

std::unique_ptr<Message> threeFrames() {
    std::vector<std::unique_ptr<Frame>> frames;
    frames.push_back(nullptr);
    frames.push_back(makeFrame(1));
    frames.push_back(makeFrame(2));
    return std::make_unique<Message>(std::move(frames));
}

TEST(MessageTest, FrameIsTheElementAtItsIndex) {
    const auto message = threeFrames();
    EXPECT_EQ(message->size(), 3U);
    EXPECT_EQ(message->frame(0), nullptr);
    EXPECT_EQ(message->frame(1)->index(), 1U);
    EXPECT_EQ(message->frame(2)->index(), 2U);
}

TEST(MessageTest, HostileIndexIsNullAndNeverGrowsTheMessage) {
    const auto message = threeFrames();
    for (const unsigned long index : {3UL, 4UL, 1UL << 31, 1UL << 63, std::numeric_limits<unsigned long>::max()}) {
        EXPECT_EQ(message->frame(index), nullptr) << index;
        EXPECT_EQ(message->release(index), nullptr) << index;
    }
    EXPECT_EQ(message->size(), 3U);
}

TEST(MessageTest, ReferenceToAFrameTurnsNullWhenTheFrameIsReleased) {
    const auto message = threeFrames();
    const std::unique_ptr<Frame>& reference = message->frame(2);
    const std::unique_ptr<Frame> taken = message->release(2);
    EXPECT_EQ(taken->index(), 2U);
    EXPECT_EQ(reference, nullptr);
    EXPECT_EQ(&message->frame(2), &reference);
    EXPECT_EQ(message->release(2), nullptr);
    EXPECT_EQ(message->size(), 3U);
}

TEST(MessageTest, EmptyMessageHasNoFrames) {
    Message message({});
    EXPECT_EQ(message.size(), 0U);
    EXPECT_EQ(message.frame(0), nullptr);
    EXPECT_EQ(message.release(0), nullptr);
}

}  // namespace
}  // namespace foundation::msg_svc::transport::layers::message
