// More requests at once than an engine keeps, from a client that reads while it writes.
#include <gtest/gtest.h>

#include <cstdint>
#include <string>
#include <thread>
#include <vector>

#include "apps/qvm/bytes/ByteClient.hpp"
#include "platform/session/support/WireBytes.hpp"

namespace qvm_test {
namespace {

// What an engine has written after the handshake.
struct Account {
    std::vector<unsigned> replies;  // by stream ID
    unsigned refusals = 0;
    std::string lastTag;
    std::string abort;
};

Account accountOf(const std::string& bytes, std::size_t streams) {
    Account account;
    account.replies.resize(streams + 1);
    for (std::size_t position = 0; position + 24 <= bytes.size();) {
        const auto tagSize = static_cast<std::size_t>(wire::number(bytes, position + 2, 2));
        const auto stream = static_cast<std::size_t>(wire::number(bytes, position + 4, 4));
        const auto contentSize = static_cast<std::size_t>(wire::number(bytes, position + 16, 8));
        account.lastTag = bytes.substr(position + 24, tagSize);
        const std::string content = bytes.substr(position + 24 + tagSize, contentSize);
        if (tagSize == 0) {
            account.abort = content;
        } else if (account.lastTag == "krutil:IIPReply") {
            ++account.replies.at(stream);
        } else if (account.lastTag == "krutil:IIPResult" && content.find("queue is full") != std::string::npos) {
            ++account.refusals;
        }
        position += 24 + tagSize + contentSize;
    }
    return account;
}

TEST(ManyRequestsTest, EachIsAnsweredAndWhatIsBeyondTheQueueIsRefused) {
    constexpr std::uint32_t count = 100'000;
    constexpr std::uint32_t kept = 1024;
    ByteClient client;
    // Holds up the others, until the goodbye ends its prompt.
    client.write(evaluation(1, "input()", enqueueing(1, 1)));
    EXPECT_EQ(client.awaitTag("krutil:DebugLoopEvent").stream, 1U);
    std::string requests;
    for (std::uint32_t stream = 2; stream <= 1 + count; ++stream) {
        requests += evaluation(stream, "None", enqueueing(1, stream));
    }
    std::thread writer([&] { client.write(requests + wire::goodbye()); });
    const Account account = accountOf(client.readAll(), 1 + count);
    writer.join();
    EXPECT_EQ(account.abort, "");
    EXPECT_EQ(account.lastTag, "krutil:QVMShutdownEvent");
    std::vector<unsigned> once(2 + count, 1);
    once[0] = 0;
    EXPECT_TRUE(account.replies == once);
    EXPECT_EQ(account.refusals, count - kept);
    EXPECT_EQ(client.engine().wait(), 0);
}

}  // namespace
}  // namespace qvm_test
