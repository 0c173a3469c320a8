// What is said about a message that cannot be read. The frames that a real serializer asks for are tested with the real
// protocol; here are the errors that no small message causes.
#include "foundation/msg_svc/transport/layers/session/FrameNotes.hpp"

#include <gtest/gtest.h>

#include <boost/numeric/conversion/cast.hpp>
#include <new>
#include <stdexcept>
#include <thread>
#include <vector>

#include "foundation/msg_svc/transport/layers/message/Message.hpp"
#include "foundation/vantor/carrier/framing/TaggedFrame.hpp"

namespace foundation::msg_svc::transport::layers::session {
namespace {

using Frames = std::vector<std::unique_ptr<framing::Frame>>;

std::unique_ptr<framing::Frame> tagged(const std::string& tag, unsigned long index) {
    framing::FrameBuffer buffer(
        std::unique_ptr<char[], std::function<void(char*)>>(new char[10], std::default_delete<char[]>()), 10);
    return std::make_unique<framing::TaggedFrame>(framing::FrameType::Object, 1U, tag, std::move(buffer), index);
}

// A message of two frames whose second has been taken out, and whose first was then looked at.
class FrameNotesTest : public testing::Test {
  protected:
    FrameNotesTest() {
        Frames frames;
        frames.push_back(tagged("test:part", 1));
        frames.push_back(tagged("test:root", 2));
        notes_.take(frames);
        frames.insert(frames.begin(), nullptr);
        message_ = std::make_unique<message::Message>(std::move(frames));
        message_->release(2);
        message_->frame(1);
    }

    std::string explain(const std::exception& error) const { return notes_.explain(error, registry_, "test:array"); }

    FrameNotes notes_;
    serialization::Registry registry_;
    std::unique_ptr<message::Message> message_;
};

TEST_F(FrameNotesTest, ErrorsWithWordsOfTheirOwnSayThem) {
    EXPECT_EQ(explain(std::logic_error("Required field missing: a.b")), "Required field missing: a.b");
    EXPECT_EQ(explain(std::runtime_error("Array: 1 needs 8 bytes")), "Array: 1 needs 8 bytes");
    EXPECT_EQ(explain(std::invalid_argument("it must not be null")), "it must not be null");
}

TEST_F(FrameNotesTest, FrameThatWasAskedForLastIsTheOneThatIsNamed) {
    EXPECT_EQ(explain(std::bad_cast()),
              "frame 1: expected an object that \"test:root\" can refer to, got one with tag \"test:part\"");
    message_->release(1);
    EXPECT_EQ(explain(std::bad_cast()), "frame 1: expected the frame type of \"test:part\", got 29");
    message_->frame(2);
    EXPECT_EQ(explain(std::bad_cast()), "frame 2: expected a frame, got none: it was read already");
    message_->frame(3);
    EXPECT_EQ(explain(std::bad_cast()), "frame 3: expected a frame, got none: the message has 2");
}

TEST_F(FrameNotesTest, RootThatItsSerializerLeavesAloneIsNamed) {
    Frames frames;
    frames.push_back(tagged("test:root", 1));
    notes_.take(frames);
    frames.insert(frames.begin(), nullptr);
    const message::Message message(std::move(frames));
    message.frame(1);
    EXPECT_EQ(explain(std::bad_cast()),
              "frame 1: expected an object that can be the root, got one with tag \"test:root\"");
}

TEST_F(FrameNotesTest, OtherThreadsReadTheirOwnMessages) {
    std::thread([] {
        Frames frames(4);
        const message::Message other(std::move(frames));
        other.frame(3);
    }).join();
    EXPECT_EQ(explain(std::bad_cast()),
              "frame 1: expected an object that \"test:root\" can refer to, got one with tag \"test:part\"");
}

TEST_F(FrameNotesTest, UnknownTagIsNamed) {
    EXPECT_EQ(explain(std::out_of_range("unordered_map::at")),
              "frame 1: no serializer is registered for its tag \"test:part\"");
}

TEST_F(FrameNotesTest, ContentThatIsTooLargeIsCounted) {
    EXPECT_EQ(explain(boost::numeric::positive_overflow()),
              "frame 1 with tag \"test:part\": expected a content of at most 2147483647 bytes, got 10");
}

TEST_F(FrameNotesTest, WantOfMemoryIsCalledSo) {
    EXPECT_EQ(explain(std::bad_alloc()), "frame 1 with tag \"test:part\": there is no memory for its object");
}

TEST_F(FrameNotesTest, ErrorsOfLibrariesNameTheFrame) {
    EXPECT_EQ(explain(std::length_error("basic_string::_M_create")),
              "frame 1 with tag \"test:part\": its content makes no object (basic_string::_M_create)");
}

TEST_F(FrameNotesTest, LargeMessageLeavesNothingBehind) {
    Frames large;
    for (unsigned long index = 1; index <= 1000; ++index) {
        large.push_back(tagged("test:large", index));
    }
    notes_.take(large);
    Frames small;
    small.push_back(tagged("test:small", 1));
    notes_.take(small);
    const message::Message message(Frames(3));
    message.frame(2);
    EXPECT_EQ(explain(std::bad_cast()), "frame 2: expected a frame, got none: the message has 1");
}

}  // namespace
}  // namespace foundation::msg_svc::transport::layers::session
