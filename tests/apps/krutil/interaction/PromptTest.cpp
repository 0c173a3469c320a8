// Prompts of an engine, answered by a script instead of a person.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <deque>

#include "apps/krutil/CaughtOutput.hpp"
#include "apps/krutil/interaction/ScriptedEngine.hpp"
#include "cmddistributor/DebugLoopEvent.hpp"
#include "cmddistributor/IIPCancelMessage.hpp"
#include "cmddistributor/IIPCancelReply.hpp"
#include "cmddistributor/IIPStateEvent.hpp"
#include "krutil/base/ExitCode.hpp"
#include "krutil/display/PersonPrinter.hpp"
#include "krutil/session/Client.hpp"
#include "krutil/terminal/Prompts.hpp"

namespace krutil_client {
namespace {

using cmddistributor::DebugLoopEvent;
using cmddistributor::IIPCancelMessage;
using cmddistributor::IIPCancelReply;
using cmddistributor::IIPEnqueueMessage;
using cmddistributor::IIPStartedEvent;
using foundation::msg_svc::exchange::IDType;
using krutil::prompt::InputRequester;
using ::testing::ElementsAre;
using ::testing::HasSubstr;

// Only what is a line of input may be taken as one.
krutil::cmddistributor::WhenToDequeue::WhenToDequeue modeAt(InputRequester loop) {
    using namespace krutil::cmddistributor::WhenToDequeue;
    return loop == InputRequester::mnINPUT_PROMPT   ? DEQUEUE_AT_PROMPT
           : loop == InputRequester::mnPAUSE_PROMPT ? DEQUEUE_AT_PAUSE
                                                    : DEQUEUE_AT_PPE;
}

class ClientPromptTest : public ::testing::Test, protected CaughtOutput {
  protected:
    // Opens a prompt for the first request; takes the requests at it until `leaves` says that one of them leaves it.
    ScriptedEngine::Action engine(InputRequester loop, std::function<bool(const std::u16string& command)> leaves) {
        return [this, loop, leaves](ScriptedEngine& peer, auto stream, const auto& message) {
            const auto& enqueue = dynamic_cast<const IIPEnqueueMessage&>(message);
            if (outer == IDType()) {
                outer = enqueue.getID();
                outerStream = stream;
                peer.event<IIPStartedEvent>(stream, outer);
                peer.event<DebugLoopEvent>(stream, outer, DebugLoopEvent::ENTER, loop);
                return;
            }
            const auto& eval = dynamic_cast<const cmddistributor::EvalIIP&>(*enqueue.getIIP());
            EXPECT_EQ(enqueue.getDequeueMode(), modeAt(loop));
            commands.push_back(eval.getCommand());
            peer.answer(stream, enqueue.getID());
            if (leaves(eval.getCommand())) {
                peer.event<DebugLoopEvent>(outerStream, outer, DebugLoopEvent::EXIT, loop);
                peer.answer(outerStream, outer);
            }
        };
    }

    Prompts::Read script(std::deque<ReadLine>& lines) {
        return [this, &lines](const std::string& prompt, const std::function<bool()>&) -> ReadLine {
            prompts.push_back(prompt);
            if (lines.empty()) {
                ADD_FAILURE() << "more lines are read than expected";
                return {ReadLine::End::EndOfInput, {}};
            }
            ReadLine line = lines.front();
            lines.pop_front();
            return line;
        };
    }

    void begin(const ScriptedEngine& peer) {
        ConnectionOptions connection;
        connection.socket = peer.path();
        client.emplace(connection, DisplayOptions{}, printer, out, err, interrupt, true);
    }

    ExitCode request() {
        return client
            ->request({.iip = client->evaluation("outer", cmddistributor::CodeType::CodeBlockType, {}), .name = ""})
            .exitCode;
    }

    ExitCode run(ScriptedEngine& peer) {
        begin(peer);
        const Prompts answering(*client, script(input), script(typed), out);
        const ExitCode code = request();
        EXPECT_EQ(client->finish(), "");
        peer.waitForEnd();
        return code;
    }

    static ReadLine line(const std::string& text) { return {ReadLine::End::Newline, text}; }
    static ReadLine end() { return {ReadLine::End::EndOfInput, {}}; }
    static bool always(const std::u16string&) { return true; }
    static bool leaving(const std::u16string& command) {
        return command == u"__import__('qvm').dbcont()" || command == u"__import__('qvm').dbquit()";
    }

    PersonPrinter printer{out, err, {}};
    std::optional<Client> client;
    IDType outer;
    ScriptedEngine::StreamID outerStream = 0;
    std::vector<std::u16string> commands;
    std::vector<std::string> prompts;
    std::deque<ReadLine> input;
    std::deque<ReadLine> typed;
};

TEST_F(ClientPromptTest, ALineOfInputIsSentAsItIs) {
    input = {line("some \u00e4 line ")};
    ScriptedEngine peer(engine(InputRequester::mnINPUT_PROMPT, always));
    EXPECT_EQ(run(peer), ExitCode::Ok);
    EXPECT_THAT(commands, ElementsAre(u"some \u00e4 line "));
    EXPECT_THAT(prompts, ElementsAre(""));
    EXPECT_EQ(peer.clientCapabilities(),
              (capabilities::CapabilityList{capabilities::Capability::InteractiveCommandLine,
                                            capabilities::Capability::Debugging, capabilities::Capability::WebWindow,
                                            capabilities::Capability::LocalClient}));
}

TEST_F(ClientPromptTest, AnEmptyLineIsAnEmptyLine) {
    input = {line("")};
    ScriptedEngine peer(engine(InputRequester::mnINPUT_PROMPT, always));
    EXPECT_EQ(run(peer), ExitCode::Ok);
    EXPECT_THAT(commands, ElementsAre(u""));
}

TEST_F(ClientPromptTest, TheEndOfInputIsSentAsItsCharacter) {
    input = {end()};
    ScriptedEngine peer(engine(InputRequester::mnINPUT_PROMPT, always));
    EXPECT_EQ(run(peer), ExitCode::Ok);
    EXPECT_THAT(commands, ElementsAre(u"\u0004"));
}

TEST_F(ClientPromptTest, APauseEndsWithALine) {
    input = {line("")};
    ScriptedEngine peer(engine(InputRequester::mnPAUSE_PROMPT, always));
    EXPECT_EQ(run(peer), ExitCode::Ok);
    EXPECT_THAT(commands, ElementsAre(u""));
    EXPECT_THAT(prompts, ElementsAre("Paused; press Enter to go on "));
}

TEST_F(ClientPromptTest, CodeIsEvaluatedAtADebugPromptUntilItIsLeft) {
    typed = {line("a = 1"), line(" "), line("f(a,"), line("b)"), line("if a:"), line("  g()"), line(""), line(":c")};
    ScriptedEngine peer(engine(InputRequester::mnDEBUG_PROMPT, leaving));
    EXPECT_EQ(run(peer), ExitCode::Ok);
    EXPECT_THAT(commands, ElementsAre(u"a = 1", u"f(a,\nb)", u"if a:\n  g()\n", u"__import__('qvm').dbcont()"));
    EXPECT_THAT(prompts, ElementsAre("debug> ", "debug> ", "debug> ", "... ", "debug> ", "... ", "... ", "debug> "));
}

TEST_F(ClientPromptTest, QuitLeavesAKeyboardPromptAndSoDoesTheEndOfInput) {
    for (const ReadLine& last : {line(":q"), end()}) {
        outer = IDType();
        commands.clear();
        prompts.clear();
        typed = {last};
        ScriptedEngine peer(engine(InputRequester::mnKEYBOARD_PROMPT, leaving));
        EXPECT_EQ(run(peer), ExitCode::Ok);
        EXPECT_THAT(commands, ElementsAre(u"__import__('qvm').dbquit()"));
        EXPECT_THAT(prompts, ElementsAre("keyboard> "));
    }
}

TEST_F(ClientPromptTest, APromptThatTheEngineClosesEndsTheReading) {
    ScriptedEngine peer([](ScriptedEngine& self, auto stream, const auto& message) {
        const auto id = dynamic_cast<const IIPEnqueueMessage&>(message).getID();
        self.event<IIPStartedEvent>(stream, id);
        self.event<DebugLoopEvent>(stream, id, DebugLoopEvent::ENTER, InputRequester::mnINPUT_PROMPT);
        self.event<DebugLoopEvent>(stream, id, DebugLoopEvent::EXIT, InputRequester::mnINPUT_PROMPT);
        self.answer(stream, id);
    });
    begin(peer);
    test_support::Pipe standardInput;
    LineReader reader(standardInput.read.get(), client->conversation(), out);
    const Prompts::Read read = [&reader](const auto& prompt, const auto& done) { return reader.read(prompt, done); };
    const Prompts answering(*client, read, read, out);
    EXPECT_EQ(request(), ExitCode::Ok);
    EXPECT_EQ(client->finish(), "");
}

// What an engine says to a request that it does not run.
void discard(ScriptedEngine& peer, ScriptedEngine::StreamID stream, const IDType& id,
             krutil::cmddistributor::inExecutionStatus status, const std::u16string& why) {
    peer.event<cmddistributor::IIPDiscardedEvent>(stream, id);
    peer.event<cmddistributor::LastIIPEvent>(stream, id);
    peer.answer(stream, id, cmddistributor::RuntimeException(status, why, "", "", {}, {}, false));
}

TEST_F(ClientPromptTest, AnAnswerThatComesAfterItsPauseIsTakenBackAndIsNoLineOfInput) {
    input = {line("too late"), line("Ada")};
    IDType late;
    ScriptedEngine::StreamID lateStream = 0;
    int cancels = 0;
    ScriptedEngine peer([&](ScriptedEngine& self, auto stream, const auto& message) {
        if (const auto* cancel = dynamic_cast<const IIPCancelMessage*>(&message)) {
            ++cancels;
            EXPECT_EQ(cancel->getID(), late);
            EXPECT_FALSE(cancel->getEvenIfRunning());
            discard(self, lateStream, late, krutil::cmddistributor::inEXECUTION_CTRLC, u"");
            self.reply(stream, boost::shared_ptr<const ScriptedEngine::Reply>(
                                   new IIPCancelReply(IIPCancelReply::SUCCESSFUL_CANCEL)));
            return;
        }
        const auto& enqueue = dynamic_cast<const IIPEnqueueMessage&>(message);
        if (outer == IDType()) {
            outer = enqueue.getID();
            outerStream = stream;
            self.event<IIPStartedEvent>(stream, outer);
            self.event<DebugLoopEvent>(stream, outer, DebugLoopEvent::ENTER, InputRequester::mnPAUSE_PROMPT);
            return;
        }
        const auto& eval = dynamic_cast<const cmddistributor::EvalIIP&>(*enqueue.getIIP());
        commands.push_back(eval.getCommand());
        if (late == IDType()) {
            late = enqueue.getID();
            lateStream = stream;
            EXPECT_EQ(enqueue.getDequeueMode(), modeAt(InputRequester::mnPAUSE_PROMPT));
            self.event<DebugLoopEvent>(outerStream, outer, DebugLoopEvent::EXIT, InputRequester::mnPAUSE_PROMPT);
            self.event<DebugLoopEvent>(outerStream, outer, DebugLoopEvent::ENTER, InputRequester::mnINPUT_PROMPT);
            return;
        }
        EXPECT_EQ(cancels, 1) << "the next prompt is answered before the late answer is taken back";
        self.answer(stream, enqueue.getID());
        self.event<DebugLoopEvent>(outerStream, outer, DebugLoopEvent::EXIT, InputRequester::mnINPUT_PROMPT);
        self.answer(outerStream, outer);
    });
    EXPECT_EQ(run(peer), ExitCode::Ok);
    EXPECT_THAT(commands, ElementsAre(u"too late", u"Ada"));
    EXPECT_THAT(prompts, ElementsAre("Paused; press Enter to go on ", ""));
    EXPECT_EQ(cancels, 1);
    EXPECT_EQ(errPipe.content(), "");
}

TEST_F(ClientPromptTest, AnAnswerThatIsRefusedIsAskedForAgain) {
    input = {line("one"), line("two")};
    ScriptedEngine peer([this](ScriptedEngine& self, auto stream, const auto& message) {
        const auto& enqueue = dynamic_cast<const IIPEnqueueMessage&>(message);
        if (outer != IDType() && commands.empty()) {
            commands.emplace_back();
            discard(self, stream, enqueue.getID(), krutil::cmddistributor::inCOMM_ERROR, u"It is full.");
            return;
        }
        engine(InputRequester::mnINPUT_PROMPT, always)(self, stream, message);
    });
    EXPECT_EQ(run(peer), ExitCode::Ok);
    EXPECT_THAT(commands, ElementsAre(u"", u"two"));
    EXPECT_THAT(errPipe.content(), HasSubstr("It is full."));
}

TEST_F(ClientPromptTest, AnAnswerThatIsTooLargeIsAskedForAgain) {
    input = {line(std::string(5U << 20, 'a')), line("b")};
    ScriptedEngine peer(engine(InputRequester::mnINPUT_PROMPT, always));
    EXPECT_EQ(run(peer), ExitCode::Ok);
    EXPECT_THAT(commands, ElementsAre(u"b"));
    EXPECT_THAT(errPipe.content(), HasSubstr("krutil: "));
}

TEST_F(ClientPromptTest, PastedLinesAreSentAtOnceAndWhatIsLeftBehindIsTalkedAbout) {
    typed = {line("a = 1\nif a:\n    b = 2\n\n    c = 3\n:c\nd = 4\ne = 5")};
    struct Request {
        ScriptedEngine::StreamID stream;
        IDType id;
    };
    std::vector<Request> waiting;
    ScriptedEngine peer([&](ScriptedEngine& self, auto stream, const auto& message) {
        const auto& enqueue = dynamic_cast<const IIPEnqueueMessage&>(message);
        if (outer == IDType()) {
            engine(InputRequester::mnDEBUG_PROMPT, leaving)(self, stream, message);
            return;
        }
        EXPECT_EQ(enqueue.getDequeueMode(), modeAt(InputRequester::mnDEBUG_PROMPT));
        commands.push_back(dynamic_cast<const cmddistributor::EvalIIP&>(*enqueue.getIIP()).getCommand());
        waiting.push_back({stream, enqueue.getID()});
        if (waiting.size() < 5) {
            return;
        }
        const auto runs = [&self](const Request& request) {
            self.event<IIPStartedEvent>(request.stream, request.id);
            self.answer(request.stream, request.id);
        };
        runs(waiting[0]);
        runs(waiting[1]);
        runs(waiting[2]);
        self.event<cmddistributor::IIPRequeuedEvent>(waiting[3].stream, waiting[3].id);
        self.event<cmddistributor::IIPRequeuedEvent>(waiting[4].stream, waiting[4].id);
        self.event<DebugLoopEvent>(outerStream, outer, DebugLoopEvent::EXIT, InputRequester::mnDEBUG_PROMPT);
        self.answer(outerStream, outer);
        self.event<cmddistributor::IIPReactivatedEvent>(waiting[3].stream, waiting[3].id);
        runs(waiting[3]);
        discard(self, waiting[4].stream, waiting[4].id, krutil::cmddistributor::inEXECUTION_CTRLC, u"");
    });
    EXPECT_EQ(run(peer), ExitCode::Ok);
    EXPECT_THAT(commands, ElementsAre(u"a = 1", u"if a:\n    b = 2\n\n    c = 3", u"__import__('qvm').dbcont()",
                                      u"d = 4", u"e = 5"));
    EXPECT_THAT(prompts, ElementsAre("debug> "));
    EXPECT_EQ(errPipe.content(),
              "krutil: left behind by the prompt, and waits for its turn: d = 4\n"
              "krutil: left behind by the prompt, and waits for its turn: e = 5\n"
              "krutil: waits for 2 requests; Ctrl-C cancels what is left\n"
              "krutil: runs now: d = 4\n"
              "krutil: cancelled\n");
}

TEST_F(ClientPromptTest, LinesAreReadWhileTheSessionGoesOnAndTheLastOneNeedsNoNewline) {
    ScriptedEngine peer(engine(InputRequester::mnINPUT_PROMPT, always));
    begin(peer);
    test_support::Pipe standardInput;
    ASSERT_EQ(::write(standardInput.write.get(), "one\n\ntwo", 8), 8);
    standardInput.write.reset();
    LineReader reader(standardInput.read.get(), client->conversation(), out);
    const auto never = [] { return false; };
    EXPECT_EQ(reader.read("prompt", never).text, "one");
    EXPECT_EQ(reader.read("prompt", never).text, "");
    EXPECT_EQ(reader.read("prompt", never).text, "two");
    EXPECT_EQ(reader.read("prompt", never).end, ReadLine::End::EndOfInput);
    EXPECT_EQ(client->finish(), "");
    EXPECT_EQ(outPipe.content(), "") << "prompts are for terminals";
}

void expectViolation(const std::function<void()>& what, const std::string& sentence) {
    try {
        what();
        FAIL() << "nothing was thrown";
    } catch (const Failure& failure) {
        EXPECT_EQ(failure.code(), ExitCode::Violation);
        EXPECT_EQ(failure.what(), sentence);
    }
}

TEST_F(ClientPromptTest, APromptOfARequestThatDoesNotRunBreaksTheProtocol) {
    ScriptedEngine peer([](ScriptedEngine& self, auto stream, const auto&) {
        self.event<DebugLoopEvent>(stream, IDType(5, 5), DebugLoopEvent::ENTER, InputRequester::mnINPUT_PROMPT);
    });
    begin(peer);
    const Prompts answering(*client, script(input), script(typed), out);
    expectViolation([this] { request(); }, "the engine opened a prompt of a request that does not run");
    client.reset();
}

TEST_F(ClientPromptTest, LeavingAPromptThatIsNotOpenBreaksTheProtocol) {
    ScriptedEngine peer([](ScriptedEngine& self, auto stream, const auto& message) {
        self.event<DebugLoopEvent>(stream, dynamic_cast<const IIPEnqueueMessage&>(message).getID(),
                                   DebugLoopEvent::EXIT, InputRequester::mnINPUT_PROMPT);
    });
    begin(peer);
    const Prompts answering(*client, script(input), script(typed), out);
    expectViolation([this] { request(); }, "the engine left a prompt that was not open");
    client.reset();
}

}  // namespace
}  // namespace krutil_client
