// Clients of a listening engine that do not come to the end of the handshake, and those who come after them.
#include <gtest/gtest.h>
#include <unistd.h>

#include <future>
#include <memory>
#include <string>
#include <vector>

#include "apps/qvm/fixture/EngineFixture.hpp"
#include "platform/session/support/ByteEnd.hpp"
#include "support/Eventually.hpp"
#include "support/TemporaryDirectory.hpp"

namespace qvm_test {
namespace {

using msg_svc::protobuf::SessionHello;
using msg_svc::protobuf::SessionVerdict;

constexpr std::size_t mostHandshakes = 64;

class UnfinishedHandshakeTest : public testing::Test {
  protected:
    void serve(std::vector<std::string> more = {}) {
        more.insert(more.begin(), {"--listen", path_});
        engine_ = std::make_unique<EngineProcess>(more);
        engine_->awaitStderr("krutil-qvm: serving " + path_ + "\n");
    }

    // A client that reads the engine's first message, after which the handshake has begun there.
    std::unique_ptr<wire::ByteEnd> begin() {
        const int connection = connectTo(path_);
        auto end = std::make_unique<wire::ByteEnd>(connection, connection);
        hello_ = end->readHello();
        return end;
    }

    // Its first message, which fits.
    std::string firstMessage() const {
        SessionHello hello = hello_;
        hello.set_role(SessionHello::CLIENT);
        return wire::helloBytes(hello);
    }

    // What a client is told that asks for a session; empty when it has one.
    std::string told() {
        try {
            EngineClient client(connectTo(path_));
            EXPECT_EQ(client.eval("6 * 7").shown(), "42\n");
            return {};
        } catch (const session::HandshakeRefused& refused) {
            return refused.what();
        }
    }

    test_support::TemporaryDirectory directory_;
    std::string path_ = directory_.file("private/socket");
    std::unique_ptr<EngineProcess> engine_;
    SessionHello hello_;
};

TEST_F(UnfinishedHandshakeTest, TheOldestGivesWayAndIsToldWhy) {
    serve();
    std::vector<std::unique_ptr<wire::ByteEnd>> silent;
    for (std::size_t i = 0; i < mostHandshakes; ++i) {
        silent.push_back(begin());
    }
    EXPECT_EQ(told(), "");
    const SessionVerdict verdict = silent.front()->readVerdict();
    EXPECT_FALSE(verdict.accepted());
    EXPECT_EQ(verdict.refusal(), "it has 64 unfinished handshakes, of which this is the oldest; try again");
    EXPECT_EQ(silent.front()->readAll(), "");
    engine_->awaitStderr("refused a client: its handshake was the oldest of 64 unfinished ones\n");
    // The others go on.
    for (const std::size_t i : {std::size_t{1}, mostHandshakes - 1}) {
        silent[i]->write(firstMessage());
        EXPECT_TRUE(silent[i]->readVerdict().accepted()) << i;
    }
}

TEST_F(UnfinishedHandshakeTest, IsNoSession) {
    serve({"--max-sessions", "1"});
    const auto silent = begin();
    EngineClient client(connectTo(path_));
    EXPECT_EQ(client.eval("6 * 7").shown(), "42\n");
    // It is late, and reads why.
    silent->write(firstMessage());
    EXPECT_EQ(silent->readVerdict().refusal(),
              "it has 1 session and may have no more (--max-sessions); try again when one has ended");
    engine_->awaitStderr("refused a client: 1 sessions are open (--max-sessions)\n");
}

TEST_F(UnfinishedHandshakeTest, GivesItsSeatAwayWhenTheClientDoesNotAnswer) {
    serve({"--max-sessions", "1"});
    const auto stalled = begin();
    stalled->write(firstMessage());
    EXPECT_TRUE(stalled->readVerdict().accepted());
    // It has the only seat for a moment.
    EXPECT_TRUE(test_support::eventually([this] { return told().empty(); }));
    EXPECT_EQ(stalled->readAll(), "");
}

TEST_F(UnfinishedHandshakeTest, ClientsThatComeAtOnceGetAsManySessionsAsThereMayBe) {
    serve({"--max-sessions", "3"});
    std::vector<std::future<std::unique_ptr<EngineClient>>> coming;
    for (int i = 0; i < 8; ++i) {
        coming.push_back(std::async(std::launch::async, [this]() -> std::unique_ptr<EngineClient> {
            try {
                return std::make_unique<EngineClient>(connectTo(path_));
            } catch (const session::HandshakeRefused& refused) {
                EXPECT_STREQ(refused.what(),
                             "the session is refused by the engine: it has 3 sessions and may have no more "
                             "(--max-sessions); try again when one has ended");
                return nullptr;
            }
        }));
    }
    std::vector<std::unique_ptr<EngineClient>> sessions;
    for (auto& each : coming) {
        if (auto client = each.get()) {
            sessions.push_back(std::move(client));
        }
    }
    EXPECT_EQ(sessions.size(), 3U);
    for (const auto& client : sessions) {
        EXPECT_EQ(client->eval("6 * 7").shown(), "42\n");
    }
}

TEST_F(UnfinishedHandshakeTest, EndsWithItsListener) {
    serve();
    const auto silent = begin();
    engine_->signal(SIGTERM);
    EXPECT_EQ(engine_->wait(), 0);
    EXPECT_EQ(silent->readAll(), "");
}

TEST_F(UnfinishedHandshakeTest, ComesToItsEndWithoutTheListener) {
    serve();
    const auto client = begin();
    engine_->signal(SIGKILL);
    engine_->wait();
    client->write(firstMessage());
    EXPECT_TRUE(client->readVerdict().accepted());
}

}  // namespace
}  // namespace qvm_test
