// What Ctrl-C does while a request runs.

#include <gtest/gtest.h>
#include <unistd.h>

#include <csignal>

#include "apps/krutil/CaughtOutput.hpp"
#include "apps/krutil/interaction/ScriptedEngine.hpp"
#include "cmddistributor/IIPCancelMessage.hpp"
#include "cmddistributor/IIPCancelReply.hpp"
#include "krutil/base/ExitCode.hpp"
#include "krutil/display/PersonPrinter.hpp"
#include "krutil/session/Canceller.hpp"
#include "krutil/session/Client.hpp"

namespace krutil_client {
namespace {

using cmddistributor::IIPCancelMessage;
using cmddistributor::IIPCancelReply;
using cmddistributor::IIPEnqueueMessage;
using foundation::msg_svc::exchange::IDType;

void pressCtrlC() {
    ::kill(::getpid(), SIGINT);
}

cmddistributor::RuntimeException interrupted() {
    return {krutil::cmddistributor::inEXECUTION_CTRLC, u"", "KeyboardInterrupt", "", {}, {}, false};
}

class ClientCancelTest : public ::testing::Test, protected CaughtOutput {
  protected:
    // Remembers the request and the cancels of it, and answers as the test says.
    ScriptedEngine::Action engine(std::function<void(ScriptedEngine&)> onRequest,
                                  std::function<void(ScriptedEngine&, ScriptedEngine::StreamID)> onCancel) {
        return [this, onRequest, onCancel](ScriptedEngine& peer, auto stream, const auto& message) {
            if (const auto* enqueue = dynamic_cast<const IIPEnqueueMessage*>(&message)) {
                requestStream = stream;
                request = enqueue->getID();
                onRequest(peer);
            } else {
                const auto& cancel = dynamic_cast<const IIPCancelMessage&>(message);
                EXPECT_EQ(cancel.getID(), request);
                EXPECT_TRUE(cancel.getEvenIfRunning());
                ++cancels;
                onCancel(peer, stream);
            }
        };
    }

    Answer run(const ScriptedEngine& peer) {
        ConnectionOptions connection;
        connection.socket = peer.path();
        client.emplace(connection, DisplayOptions{}, printer, out, err, interrupt, false);
        return client->request(
            {.iip = client->evaluation("1", cmddistributor::CodeType::CodeBlockType, {}), .name = ""});
    }

    static void cancelReply(ScriptedEngine& peer, ScriptedEngine::StreamID stream,
                            IIPCancelReply::CancelStatus status) {
        peer.reply(stream, boost::shared_ptr<const ScriptedEngine::Reply>(new IIPCancelReply(status)));
    }

    PersonPrinter printer{out, err, {}};
    ScriptedEngine::StreamID requestStream = 0;
    IDType request;
    int cancels = 0;
    std::optional<Client> client;
};

TEST_F(ClientCancelTest, TheFirstCtrlCAsksTheEngineToCancelEvenIfRunning) {
    ScriptedEngine peer(engine([](ScriptedEngine&) { pressCtrlC(); },
                               [this](ScriptedEngine& self, auto stream) {
                                   cancelReply(self, stream, IIPCancelReply::PENDING_CANCEL);
                                   self.answer(requestStream, request, interrupted());
                               }));
    EXPECT_EQ(run(peer).exitCode, ExitCode::Cancelled);
    EXPECT_EQ(client->finish(), "");
    peer.waitForEnd();
    EXPECT_EQ(cancels, 1);
    EXPECT_EQ(outPipe.content(), "");
    EXPECT_EQ(errPipe.content(), "krutil: cancelled\n");
}

TEST_F(ClientCancelTest, ARequestThatEndsBeforeTheCancelHasEndedAsItHas) {
    ScriptedEngine peer(engine([](ScriptedEngine&) { pressCtrlC(); },
                               [this](ScriptedEngine& self, auto stream) {
                                   self.answer(requestStream, request);
                                   cancelReply(self, stream, IIPCancelReply::UNABLE_TO_CANCEL_ALREADY_DONE);
                               }));
    EXPECT_EQ(run(peer).exitCode, ExitCode::Ok);
    EXPECT_EQ(client->finish(), "");
    EXPECT_EQ(errPipe.content(), "");
}

TEST_F(ClientCancelTest, TheSecondCtrlCWithinTwoSecondsClosesAConnection) {
    ScriptedEngine peer(engine([](ScriptedEngine&) { pressCtrlC(); }, [](ScriptedEngine&, auto) { pressCtrlC(); }));
    try {
        run(peer);
        FAIL();
    } catch (const Failure& failure) {
        EXPECT_EQ(failure.code(), ExitCode::Cancelled);
        EXPECT_STREQ(failure.what(), "cancelled; the connection was closed, which ends the session");
    }
    client.reset();
    peer.waitForEnd();
    EXPECT_EQ(cancels, 1);
}

TEST_F(ClientCancelTest, AnEngineThatDoesNotStopIsTalkedAbout) {
    request = IDType(1, 2);
    ScriptedEngine peer(
        engine([](ScriptedEngine&) { pressCtrlC(); },
               [](ScriptedEngine& self, auto stream) { cancelReply(self, stream, IIPCancelReply::PENDING_CANCEL); }));
    try {
        ConnectionOptions connection;
        connection.socket = peer.path();
        client.emplace(connection, DisplayOptions{}, printer, out, err, interrupt, false);
        bool said = false;
        std::string sentence;
        Canceller canceller(
            client->conversation(), client->engine(), interrupt, [this] { return std::vector{request}; },
            [&](const std::string& text) {
                sentence = text;
                said = true;
            });
        const auto begin = Conversation::Clock::now();
        pressCtrlC();
        canceller.run([&said] { return said; });
        EXPECT_GE(Conversation::Clock::now() - begin, Canceller::patience);
        EXPECT_EQ(sentence,
                  "the engine has not stopped yet; code that is not Python's may hold it up. Press Ctrl-C twice to "
                  "end the engine");
    } catch (const std::exception& error) {
        FAIL() << error.what();
    }
    EXPECT_EQ(client->finish(), "");
}

TEST_F(ClientCancelTest, AnEngineThatDoesNotAnswerIsTalkedAboutAndThenEnded) {
    request = IDType(1, 2);
    ScriptedEngine peer(engine([](ScriptedEngine&) {},
                               [this](ScriptedEngine&, auto) {
                                   if (cancels == 2) {
                                       pressCtrlC();
                                   }
                               }));
    ConnectionOptions connection;
    connection.socket = peer.path();
    client.emplace(connection, DisplayOptions{}, printer, out, err, interrupt, false);
    std::vector<std::string> said;
    Canceller canceller(
        client->conversation(), client->engine(), interrupt, [this] { return std::vector{request}; },
        [&](const std::string& text) { said.push_back(text); });
    const std::vector<std::string> expected{
        "the engine does not answer. Press Ctrl-C twice within two seconds to end the engine"};
    pressCtrlC();
    canceller.run([&said] { return !said.empty(); });
    EXPECT_EQ(said, expected);
    // What the sentence says is what helps.
    try {
        pressCtrlC();
        canceller.run([] { return false; });
        FAIL();
    } catch (const Failure& failure) {
        EXPECT_EQ(failure.code(), ExitCode::Cancelled);
        EXPECT_STREQ(failure.what(), "cancelled; the connection was closed, which ends the session");
    }
    EXPECT_EQ(said, expected);
}

}  // namespace
}  // namespace krutil_client
