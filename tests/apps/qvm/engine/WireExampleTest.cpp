// The example of docs/session-wire.md, sent to a real engine as it stands.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <unistd.h>

#include <array>
#include <cstring>
#include <string>
#include <vector>

#include "apps/qvm/fixture/EngineFixture.hpp"
#include "support/HexBlocks.hpp"

namespace qvm_test {
namespace {

using testing::ElementsAre;

constexpr std::size_t headerSize = 24;

std::uint64_t number(const std::string& bytes, std::size_t at, std::size_t size) {
    std::uint64_t value = 0;
    for (std::size_t i = size; i > 0; --i) {
        value = value << 8 | static_cast<unsigned char>(bytes.at(at + i - 1));
    }
    return value;
}

// What an engine has sent.
struct Said {
    std::string verdict;
    std::vector<std::string> roots;  ///< the tag of each message, in order
    std::string lastMessage;
};

Said parsed(const std::string& bytes) {
    Said said;
    std::size_t at = 16 + number(bytes, 12, 4);
    said.verdict = bytes.substr(at, 4 + number(bytes, at, 4));
    at += said.verdict.size();
    std::size_t begin = at;
    while (at < bytes.size()) {
        const std::size_t tagSize = number(bytes, at + 2, 2);
        const bool last = (number(bytes, at, 1) & 0x80U) != 0;
        const std::string tag = bytes.substr(at + headerSize, tagSize);
        at += headerSize + tagSize + number(bytes, at + 16, 8);
        if (last) {
            said.roots.push_back(tag);
            said.lastMessage = bytes.substr(begin, at - begin);
            begin = at;
        }
    }
    return said;
}

class WireExampleTest : public testing::Test {
  protected:
    WireExampleTest() : connection_(engine_.connection()) {
        timeval limit{};
        limit.tv_sec = patience.count();
        ::setsockopt(connection_, SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof(limit));
    }
    ~WireExampleTest() override { ::close(connection_); }

    void write(const std::string& bytes) {
        ASSERT_EQ(::write(connection_, bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
    }

    // Everything up to the end of the stream.
    std::string readAll() {
        std::string bytes;
        std::array<char, 4096> piece{};
        for (;;) {
            const ssize_t count = ::read(connection_, piece.data(), piece.size());
            if (count <= 0) {
                EXPECT_EQ(count, 0) << std::strerror(errno);
                return bytes;
            }
            bytes.append(piece.data(), static_cast<std::size_t>(count));
        }
    }

    void expectAnswered() {
        const Said said = parsed(readAll());
        EXPECT_EQ(said.verdict, blocks_.at(1));
        EXPECT_THAT(said.roots,
                    ElementsAre("krutil:IIPStartedEvent", "krutil:SinkTextEvent", "krutil:IIPCompletedEvent",
                                "krutil:detail::LastIIPEvent", "krutil:IIPReply", "krutil:QVMShutdownEvent"));
        EXPECT_EQ(said.lastMessage, blocks_.at(4));
        EXPECT_EQ(engine_.wait(), 0);
        EXPECT_EQ(engine_.stderrText(), "");
    }

    // The client's first message, the verdict, a request, the goodbye, and the engine's shutdown event.
    const std::vector<std::string> blocks_ = test_support::hexBlocksOf(KRUTIL_WIRE_DOCUMENT);
    const std::string example_ = blocks_.at(0) + blocks_.at(1) + blocks_.at(2) + blocks_.at(3);
    EngineProcess engine_{{"--stdio"}};
    int connection_;
};

TEST_F(WireExampleTest, OneWriteIsAnswered) {
    write(example_);
    expectAnswered();
}

TEST_F(WireExampleTest, SingleBytesAreAnswered) {
    for (const char byte : example_) {
        write(std::string(1, byte));
    }
    expectAnswered();
}

TEST_F(WireExampleTest, ClientMayEndItsDirectionBehindTheGoodbye) {
    write(example_);
    ::shutdown(connection_, SHUT_WR);
    expectAnswered();
}

}  // namespace
}  // namespace qvm_test
