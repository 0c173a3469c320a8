#include "foundation/msg_svc/transport/layers/session/OutgoingQueue.hpp"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>

#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"
#include "foundation/vantor/carrier/framing/DataFrame.hpp"
#include "foundation/vantor/carrier/framing/TaggedFrame.hpp"
#include "platform/session/support/WireBytes.hpp"

namespace foundation::msg_svc::transport::layers::session {
namespace {

using framing::BufferAllocator;
using Frames = std::vector<std::unique_ptr<framing::Frame>>;

framing::FrameBuffer bufferOf(const std::string& bytes) {
    framing::FrameBuffer buffer = BufferAllocator::makeFrameBuffer(bytes.size());
    std::memcpy(buffer.first.get(), bytes.data(), bytes.size());
    return buffer;
}

Frames message(const std::string& bulk, const std::string& content, bool shareable = true) {
    Frames frames;
    frames.push_back(
        std::make_unique<framing::DataFrame>(static_cast<framing::FrameType>(4), 7U, bufferOf(bulk), shareable, 1UL));
    frames.push_back(
        std::make_unique<framing::TaggedFrame>(framing::FrameType::Object, 7U, "tag", bufferOf(content), 2UL));
    return frames;
}

std::string bytesOf(const std::string& bulk, const std::string& content) {
    return wire::data(7, 1, false, bulk) + wire::tagged(7, 2, true, "tag", content);
}

std::string joined(const std::vector<iovec>& pieces) {
    std::string bytes;
    for (const iovec& piece : pieces) {
        bytes.append(static_cast<const char*>(piece.iov_base), piece.iov_len);
    }
    return bytes;
}

std::vector<iovec> gathered(const OutgoingPieces& pieces) {
    GatheredWrite all{{}, {}, 1U << 30, 1000};
    pieces.gather(all);
    return all.pieces;
}

TEST(OutgoingPiecesTest, FramesLieAsTheWireHasThem) {
    const OutgoingPieces pieces(message("bulk", "content"), false);
    EXPECT_EQ(joined(gathered(pieces)), bytesOf("bulk", "content"));
    EXPECT_EQ(pieces.bytes(), bytesOf("bulk", "content").size());
}

TEST(OutgoingPiecesTest, ContentsAreWrittenFromTheFramesOwnBuffers) {
    Frames frames = message("bulk", "content");
    const char* const bulk = frames[0]->data();
    const char* const content = frames[1]->data();
    const OutgoingPieces pieces(std::move(frames), false);
    const auto all = gathered(pieces);
    // Header, content, header, tag, content.
    ASSERT_EQ(all.size(), 5U);
    EXPECT_EQ(all[1].iov_base, bulk);
    EXPECT_EQ(all[4].iov_base, content);
}

TEST(OutgoingPiecesTest, MovingLeavesThePiecesWhereTheyAre) {
    OutgoingPieces pieces(message("bulk", "content"), true);
    const auto before = gathered(pieces);
    const OutgoingPieces moved = std::move(pieces);
    const auto after = gathered(moved);
    ASSERT_EQ(before.size(), after.size());
    for (std::size_t i = 0; i < before.size(); ++i) {
        EXPECT_EQ(before[i].iov_base, after[i].iov_base) << i;
    }
    EXPECT_TRUE(moved.answer());
}

TEST(OutgoingPiecesTest, EveryPartialWriteLeavesTheRest) {
    const std::string bytes = bytesOf("bulk", "content");
    for (std::size_t first = 0; first <= bytes.size(); ++first) {
        OutgoingPieces pieces(message("bulk", "content"), false);
        std::size_t written = first;
        pieces.consume(written);
        ASSERT_EQ(written, 0U);
        ASSERT_EQ(joined(gathered(pieces)), bytes.substr(first)) << first;
        ASSERT_EQ(pieces.begun(), first != 0);
        ASSERT_EQ(pieces.done(), first == bytes.size());
    }
}

TEST(OutgoingPiecesTest, GatheringKeepsToItsBounds) {
    const OutgoingPieces pieces(message("bulk", "content"), false);
    GatheredWrite some{{}, {}, 26, 1000};
    pieces.gather(some);
    EXPECT_EQ(joined(some.pieces), bytesOf("bulk", "content").substr(0, 26));
    EXPECT_EQ(some.bytesLeft, 0U);
    GatheredWrite few{{}, {}, 1000, 2};
    pieces.gather(few);
    EXPECT_EQ(few.pieces.size(), 2U);
    EXPECT_EQ(few.piecesLeft, 0U);
}

TEST(OutgoingPiecesTest, BytesThatMayChangeAreCopiedWhenTheyMustWait) {
    for (const std::size_t first : {std::size_t{0}, std::size_t{24}, std::size_t{26}}) {
        Frames frames = message("bulk", "content", false);
        char* const bulk = const_cast<char*>(frames[0]->data());
        OutgoingPieces pieces(std::move(frames), false);
        std::size_t written = first;
        pieces.consume(written);
        pieces.detachUnshareable();
        std::memcpy(bulk, "XXXX", 4);
        EXPECT_EQ(joined(gathered(pieces)), bytesOf("bulk", "content").substr(first)) << first;
    }
}

TEST(OutgoingPiecesTest, BytesThatDoNotChangeAreNeverCopied) {
    Frames frames = message("bulk", "content", true);
    const char* const bulk = frames[0]->data();
    OutgoingPieces pieces(std::move(frames), false);
    pieces.detachUnshareable();
    EXPECT_EQ(gathered(pieces)[1].iov_base, bulk);
}

TEST(OutgoingPiecesTest, ControlFramesOfTheSession) {
    EXPECT_EQ(joined(gathered(OutgoingPieces(FrameKind::Goodbye, ""))), wire::goodbye());
    EXPECT_EQ(joined(gathered(OutgoingPieces(FrameKind::Abort, "why"))), wire::abort("why"));
}

class OutgoingQueueTest : public testing::Test {
  protected:
    void SetUp() override {
        ASSERT_EQ(::pipe2(ends_.data(), O_NONBLOCK | O_CLOEXEC), 0);
        buffersBefore_ = BufferAllocator::inUse();
    }
    void TearDown() override {
        for (const int end : ends_) {
            ::close(end);
        }
        written_.clear();
        EXPECT_EQ(BufferAllocator::inUse(), buffersBefore_);
    }

    std::string drain() {
        std::string bytes;
        std::array<char, 4096> some{};
        for (ssize_t count = 0; (count = ::read(ends_[0], some.data(), some.size())) > 0;) {
            bytes.append(some.data(), static_cast<std::size_t>(count));
        }
        return bytes;
    }

    std::array<int, 2> ends_{};
    std::vector<OutgoingPieces> written_;
    std::size_t buffersBefore_ = 0;
};

TEST_F(OutgoingQueueTest, SeveralMessagesGoOutInOneWrite) {
    OutgoingQueue queue;
    std::string expected;
    for (int i = 0; i < 3; ++i) {
        queue.push(OutgoingPieces(message(std::to_string(i), "c"), false));
        expected += bytesOf(std::to_string(i), "c");
    }
    EXPECT_EQ(queue.writeOnce(ends_[1], written_), 0);
    EXPECT_TRUE(queue.empty());
    EXPECT_EQ(written_.size(), 3U);
    EXPECT_EQ(drain(), expected);
}

TEST_F(OutgoingQueueTest, MessageThatThePipeDoesNotTakeGoesOutPieceByPiece) {
    OutgoingQueue queue;
    const std::string bulk(3'000'000, 'b');
    queue.push(OutgoingPieces(message(bulk, "c"), false));
    std::string got;
    int waits = 0;
    while (!queue.empty()) {
        const int error = queue.writeOnce(ends_[1], written_);
        if (error != 0) {
            ASSERT_EQ(error, EAGAIN);
            ++waits;
            got += drain();
        }
    }
    got += drain();
    EXPECT_GT(waits, 10);
    EXPECT_EQ(got, bytesOf(bulk, "c"));
    EXPECT_EQ(written_.size(), 1U);
}

TEST_F(OutgoingQueueTest, MessageOfVeryManyFramesIsWrittenWhole) {
    Frames frames;
    std::string expected;
    for (unsigned long index = 1; index <= 1000; ++index) {
        const bool last = index == 1000;
        frames.push_back(
            std::make_unique<framing::TaggedFrame>(framing::FrameType::Object, 7U, "tag", bufferOf("c"), index));
        expected += wire::tagged(7, index, last, "tag", "c");
    }
    OutgoingQueue queue;
    queue.push(OutgoingPieces(std::move(frames), false));
    std::string got;
    while (!queue.empty()) {
        ASSERT_EQ(queue.writeOnce(ends_[1], written_), 0);
        got += drain();
    }
    EXPECT_EQ(got, expected);
}

TEST_F(OutgoingQueueTest, OneWriteIsBounded) {
    std::array<int, 2> sockets{};
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0, sockets.data()), 0);
    OutgoingQueue queue;
    queue.push(OutgoingPieces(message(std::string(8U << 20, 'b'), "c"), false));
    EXPECT_EQ(queue.writeOnce(sockets[1], written_), 0);
    EXPECT_FALSE(queue.empty());
    ::close(sockets[0]);
    ::close(sockets[1]);
}

TEST_F(OutgoingQueueTest, TakingAllKeepsAMessageThatIsWrittenInPart) {
    OutgoingQueue queue;
    queue.push(OutgoingPieces(message(std::string(1'000'000, 'b'), "c"), false));
    queue.push(OutgoingPieces(message("2", "c"), false));
    EXPECT_EQ(queue.takeAll(true).size(), 2U) << "nothing was written yet";
    queue.push(OutgoingPieces(message(std::string(1'000'000, 'b'), "c"), false));
    queue.push(OutgoingPieces(message("2", "c"), false));
    ASSERT_EQ(queue.writeOnce(ends_[1], written_), 0);
    EXPECT_EQ(queue.takeAll(true).size(), 1U);
    EXPECT_EQ(queue.size(), 1U);
    EXPECT_EQ(queue.takeAll(false).size(), 1U);
    EXPECT_TRUE(queue.empty());
}

TEST_F(OutgoingQueueTest, ClosedReaderIsReported) {
    OutgoingQueue queue;
    queue.push(OutgoingPieces(message("1", "c"), false));
    ::signal(SIGPIPE, SIG_IGN);
    ::close(std::exchange(ends_[0], -1));
    EXPECT_EQ(queue.writeOnce(ends_[1], written_), EPIPE);
    EXPECT_FALSE(queue.empty());
    EXPECT_EQ(queue.takeAll(false).size(), 1U);
}

}  // namespace
}  // namespace foundation::msg_svc::transport::layers::session
