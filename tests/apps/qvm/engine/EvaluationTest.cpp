// What requests show and print.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <utility>
#include <vector>

#include "apps/qvm/fixture/EngineFixture.hpp"
#include "krutil/io/TextBaseEvent.hpp"
#include "support/TemporaryDirectory.hpp"

namespace qvm_test {
namespace {

using cmddistributor::CodeType;
using cmddistributor::IqmStreamID;
using krutil::io::SinkTraits;
using testing::ElementsAre;
using testing::HasSubstr;

const SinkTraits links(false, true, false, false, false, false);
const SinkTraits formatted(false, false, true, false, false, false);
const SinkTraits diary(false, false, false, true, false, false);
const SinkTraits echo(false, false, false, false, true, false);
const SinkTraits logging(false, false, false, false, false, true);

EvalOptions withType(CodeType codeType) {
    EvalOptions options;
    options.codeType = codeType;
    return options;
}

EvalOptions withOut(const SinkTraits& traits) {
    EvalOptions options;
    options.out = traits;
    return options;
}

EvalOptions withStreams(int streams) {
    EvalOptions options;
    options.streams = static_cast<IqmStreamID>(streams);
    return options;
}

constexpr char printOnThread[] =
    "import threading\n"
    "thread = threading.Thread(target=lambda: print('from the thread'))\n"
    "thread.start()\n"
    "thread.join()\n";

class EvaluationTest : public testing::Test {
  protected:
    EngineClient& client() { return engine_.client; }

    EngineSession engine_;
};

TEST_F(EvaluationTest, PrintedTextIsOutputOfTheRequest) {
    const Evaluation result = client().eval("print(1 + 1)");
    EXPECT_THAT(result.kinds(), ElementsAre("IIPStartedEvent", "TextBaseEvent", "IIPCompletedEvent", "LastIIPEvent"));
    EXPECT_EQ(result.output(), "2\n");
    EXPECT_FALSE(result.error);
}

TEST_F(EvaluationTest, OutputAndErrorsKeepTheirOrder) {
    const Evaluation result = client().eval(
        "import sys\n"
        "print('a', end='')\n"
        "print('b', end='', file=sys.stderr)\n"
        "print('c\\n', end='')\n"
        "7");
    ASSERT_EQ(result.events.size(), 7U);
    EXPECT_EQ(result.events[1].text, "a");
    EXPECT_EQ(result.events[2].text, "b");
    EXPECT_EQ(result.events[2].type, StreamTypeEnum::ERROR_STREAM);
    EXPECT_EQ(result.events[3].text, "c\n");
    EXPECT_EQ(result.events[4].kind, "SinkTextEvent");
    EXPECT_EQ(result.events[4].text, "7\n");
}

TEST_F(EvaluationTest, BlockShowsTheValueOfATrailingExpression) {
    EXPECT_EQ(client().eval("6 * 7").shown(), "42\n");
    EXPECT_EQ(client().eval("x = 6\nx * 7").shown(), "42\n");
    EXPECT_EQ(client().eval("x = 6; x * 8").shown(), "48\n");
    EXPECT_EQ(client().eval("x = 6").shown(), "");
    EXPECT_EQ(client().eval("1\n2\n3").shown(), "3\n");
    EXPECT_EQ(client().eval("").kinds().size(), 3U);
}

TEST_F(EvaluationTest, LineThatBeginsLikeAStatementShowsWhatTheParserFinds) {
    const std::vector<std::pair<const char*, const char*>> lines{
        {"pass", ""},
        {"  ", ""},
        {"x = 6\n\n", ""},
        {"x == 6", "True\n"},
        {"x= 7; x", "7\n"},
        {"x = 8\rx", "8\n"},
        {"import sys; sys is None", "False\n"},
        {"if x: x", ""},
        {"not x", "False\n"},
        {"*[1], x", "(1, 8)\n"},
        {"x; pass", ""},
    };
    for (const auto& [line, shown] : lines) {
        const Evaluation result = client().eval(line);
        EXPECT_FALSE(result.error) << line;
        EXPECT_EQ(result.shown(), shown) << line;
    }
    for (const char* const line : {"pass 1", "  x = 1", "lambda = 1", "x = "}) {
        const Evaluation result = client().eval(line);
        ASSERT_TRUE(result.error) << line;
        EXPECT_EQ(result.error->getExecutionStatus(), krutil::cmddistributor::inCOMPILE_ERROR) << line;
    }
}

TEST_F(EvaluationTest, PlainStatementIsCompiledOnce) {
    client().eval(
        "import sys\n"
        "compiled = []\n"
        "sys.addaudithook(lambda event, arguments: compiled.append(arguments) if event == 'compile' else None)");
    for (const char* const statement : {"pass", "y = 5", "import sys", "for i in range(3): i"}) {
        client().eval("compiled.clear()");
        client().eval(statement);
        // The question is the second of them.
        EXPECT_EQ(client().eval("len(compiled)").shown(), "2\n") << statement;
    }
}

TEST_F(EvaluationTest, NoneIsNotShown) {
    EXPECT_EQ(client().eval("None").shown(), "");
    EXPECT_EQ(client().eval("print('x')").shown(), "");
}

TEST_F(EvaluationTest, UndefinedCodeTypeIsABlock) {
    EXPECT_EQ(client().eval("x = 1\nx + 1", withType(CodeType::Undefined)).shown(), "2\n");
}

TEST_F(EvaluationTest, ShownValueIsKeptUnderTheNameUnderscore) {
    client().eval("6 * 7");
    EXPECT_EQ(client().eval("_ + 1").shown(), "43\n");
    client().eval("None");
    EXPECT_EQ(client().eval("print(_)").output(), "43\n");
}

TEST_F(EvaluationTest, ScriptShowsNoValueAndIsMain) {
    const Evaluation result =
        client().eval("if __name__ == '__main__':\n    print('main')\n42", withType(CodeType::ScriptType));
    EXPECT_EQ(result.output(), "main\n");
    EXPECT_EQ(result.shown(), "");
}

TEST_F(EvaluationTest, ConventionalIsASingleStatement) {
    const EvalOptions single = withType(CodeType::ConventionalType);
    EXPECT_EQ(client().eval("6 * 7", single).shown(), "42\n");
    EXPECT_EQ(client().eval("for i in range(3):\n    i", single).shown(), "0\n1\n2\n");
    EXPECT_EQ(client().eval("y = 5", single).shown(), "");
    for (const char* two : {"y = 6\ny", "y = 6; y"}) {
        const Evaluation result = client().eval(two, single);
        ASSERT_TRUE(result.error) << two;
        EXPECT_EQ(result.error->getExecutionStatus(), krutil::cmddistributor::inCOMPILE_ERROR);
        EXPECT_THAT(result.errorText(), HasSubstr("multiple statements found while compiling a single statement"));
    }
    EXPECT_EQ(client().eval("y").shown(), "5\n");
}

TEST_F(EvaluationTest, DefinitionsOfEarlierRequestsPersist) {
    client().eval("def double(x):\n    return 2 * x");
    EXPECT_EQ(client().eval("double(21)").shown(), "42\n");
}

TEST_F(EvaluationTest, PlugInNameIsCarriedAndMeansPythonWhateverItIs) {
    EvalOptions options;
    options.pluginType = "anything";
    EXPECT_EQ(client().eval("1", options).shown(), "1\n");
}

TEST_F(EvaluationTest, DisplayHookOfTheCodeIsUsed) {
    client().eval("import sys\nsys.displayhook = lambda value: print('hook', value)");
    EXPECT_EQ(client().eval("5").output(), "hook 5\n");
    client().eval("del sys.displayhook");
    const Evaluation result = client().eval("5");
    EXPECT_EQ(result.errorId(), "RuntimeError");
    EXPECT_EQ(result.errorText(), "lost sys.displayhook");
}

TEST_F(EvaluationTest, EchoComesFirst) {
    const Evaluation result = client().eval("x = 1\nx", withOut(echo));
    EXPECT_EQ(result.shown(), ">>> x = 1\n... x\n1\n");
    EXPECT_EQ(result.events[1].text, ">>> x = 1\n... x\n");
    EvalOptions onErrors;
    onErrors.err = echo;
    EXPECT_EQ(client().eval("2", onErrors).text("SinkTextEvent", StreamTypeEnum::ERROR_STREAM), ">>> 2\n");
    EXPECT_EQ(client().eval("", withOut(echo)).shown(), ">>> \n");
    EvalOptions onBoth = withOut(echo);
    onBoth.err = echo;
    const Evaluation twice = client().eval("pass", onBoth);
    EXPECT_EQ(twice.shown(), ">>> pass\n");
    EXPECT_EQ(twice.text("SinkTextEvent", StreamTypeEnum::ERROR_STREAM), ">>> pass\n");
}

TEST_F(EvaluationTest, FormattedSinkGetsValuesLaidOut) {
    const std::string code = "['a' * 30, 'b' * 30, 'c' * 30]";
    const std::string a(30, 'a');
    const std::string b(30, 'b');
    const std::string c(30, 'c');
    EXPECT_EQ(client().eval(code).shown(), "['" + a + "', '" + b + "', '" + c + "']\n");
    EXPECT_EQ(client().eval(code, withOut(formatted)).shown(), "['" + a + "',\n '" + b + "',\n '" + c + "']\n");
}

TEST_F(EvaluationTest, LinkIsMarkupOnlyWhereTheSinkHasLinks) {
    const std::string code = "import qvm\nprint(qvm.link('here', 'https://example.org/a b\\x1b'))";
    EXPECT_EQ(client().eval(code).output(), "here\n");
    EXPECT_EQ(client().eval(code, withOut(links)).output(),
              "\x1b]8;;https://example.org/a%20b%1B\x1b\\here\x1b]8;;\x1b\\\n");
}

TEST_F(EvaluationTest, NoStreamsMeansNoText) {
    const Evaluation result = client().eval("print('x')\n1", withStreams(-2));
    EXPECT_THAT(result.kinds(), ElementsAre("IIPStartedEvent", "IIPCompletedEvent", "LastIIPEvent"));
    EXPECT_EQ(client().backgroundText(), "");
}

TEST_F(EvaluationTest, UnknownStreamNumberActsAsTheCommandWindow) {
    for (const int number : {7, 999, 1001}) {
        client().replaceStream1000(number);
        const Evaluation result = client().eval(std::string(printOnThread) + "print('x')\n1", withStreams(1000));
        EXPECT_EQ(result.generic(), "") << number;
        EXPECT_EQ(result.output(), "x\n");
        EXPECT_EQ(result.shown(), "1\n");
    }
}

TEST_F(EvaluationTest, TextOfOtherThreadsIsGeneric) {
    const Evaluation result = client().eval(printOnThread);
    EXPECT_EQ(result.output(), "");
    const Happening text = client().awaitText("from the thread");
    EXPECT_EQ(text.type, StreamTypeEnum::GENERIC_STREAM);
    EXPECT_EQ(text.id, IDType());
    EXPECT_EQ(client().backgroundText(), "from the thread\n");
}

TEST_F(EvaluationTest, AllStreamsTakeTheTextOfOtherThreads) {
    for (const int streams : {-1, 1000}) {
        const Evaluation result = client().eval(std::string(printOnThread) + "print('own')", withStreams(streams));
        EXPECT_EQ(result.generic(), "from the thread\n");
        EXPECT_EQ(result.output(), "own\n");
    }
    EXPECT_EQ(client().backgroundText(), "");
}

TEST_F(EvaluationTest, TextOfNoRequestIsGeneric) {
    Gate gate;
    client().eval(
        "import threading\n"
        "def later():\n"
        "    " +
        gate.wait() +
        "\n"
        "    print('later\\n', end='')\n"
        "threading.Thread(target=later).start()");
    gate.open();
    const Happening text = client().awaitText("later");
    EXPECT_EQ(text.type, StreamTypeEnum::GENERIC_STREAM);
    EXPECT_EQ(text.id, IDType());
    EXPECT_EQ(client().background().size(), 1U);
}

TEST_F(EvaluationTest, LineIsSentWhileTheCodeGoesOn) {
    Gate gate;
    const IDType id = client().enqueue("print('first')\n" + gate.wait() + "\nprint('second')");
    client().awaitText("first");
    gate.open();
    EXPECT_EQ(client().await(id).output(), "first\nsecond\n");
}

TEST_F(EvaluationTest, PartOfALineIsSentAfterAWhile) {
    Gate gate;
    const IDType id = client().enqueue("print('part', end='')\n" + gate.wait());
    client().awaitText("part");
    gate.open();
    client().await(id);
}

TEST_F(EvaluationTest, SparinglyFlushedOutputComesInFewEvents) {
    EvalOptions options;
    options.flushSparingly = true;
    const Evaluation result = client().eval("for i in range(100):\n    print(i)", options);
    EXPECT_LE(result.events.size(), 3U + 10U);
}

TEST_F(EvaluationTest, LinesThatAreApartComeInAnEventEach) {
    const Evaluation result =
        client().eval("import time\nfor i in range(100):\n    print(f'{i}\\n', end='')\n    time.sleep(0.0011)");
    EXPECT_EQ(result.events.size(), 3U + 100U);
}

TEST_F(EvaluationTest, FlushIsHonoured) {
    Gate gate;
    EvalOptions options;
    options.flushSparingly = true;
    const IDType id = client().enqueue("print('now', end='', flush=True)\n" + gate.wait(), options);
    client().awaitText("now");
    gate.open();
    client().await(id);
}

TEST_F(EvaluationTest, AnyTextArrivesWellFormed) {
    EXPECT_EQ(client().eval("print('\\u03b1\\U0001F600\\0b')").output(),
              std::string("\xCE\xB1\xF0\x9F\x98\x80\0b\n", 9));
    EXPECT_EQ(client().eval("print('a\\ud800b\\udfffc\\ud83d\\ude00')").output(),
              "a\xEF\xBF\xBD"
              "b\xEF\xBF\xBD"
              "c\xEF\xBF\xBD\xEF\xBF\xBD\n");
    EXPECT_EQ(client().eval("'\\ud800'").shown(), "'\\ud800'\n");
    client().eval("class C:\n    def __repr__(self): return '\\udcff'");
    EXPECT_EQ(client().eval("C()").shown(), "\xEF\xBF\xBD\n");
}

TEST_F(EvaluationTest, BytesOfTheBufferAreText) {
    EXPECT_EQ(client()
                  .eval("import sys\n"
                        "sys.stdout.buffer.write(b'\\xce')\n"
                        "sys.stdout.buffer.write(b'\\xb1\\xff')\n"
                        "sys.stdout.buffer.flush()\n"
                        "None")
                  .output(),
              "\xCE\xB1\xEF\xBF\xBD");
}

TEST_F(EvaluationTest, StandardStreamsBehaveAsTextFiles) {
    EXPECT_EQ(client()
                  .eval("import sys, io\n"
                        "o = sys.stdout\n"
                        "print(isinstance(o, io.TextIOBase), o.writable(), o.readable(), o.isatty(), o.closed,\n"
                        "      o.encoding, o.fileno(), sys.stderr.fileno(), o.name, o is sys.__stdout__)\n"
                        "o.writelines(['a', 'b\\n'])\n"
                        "print(o.write('xyz\\n'))\n"
                        "o.reconfigure(line_buffering=True)\n"
                        "o.close()\n"
                        "print('still open')")
                  .output(),
              "True True False False False utf-8 1 2 <stdout> True\nab\nxyz\n4\nstill open\n");
    const Evaluation wrong = client().eval("sys.stdout.write(b'x')");
    EXPECT_EQ(wrong.errorId(), "TypeError");
    EXPECT_EQ(wrong.errorText(), "write() argument must be str, not bytes");
}

TEST_F(EvaluationTest, HugeWriteArrivesWholeAndInBoundedEvents) {
    const Evaluation result = client().eval("import sys\nsys.stdout.write('\\u20ac' * 5_000_000)\nNone");
    std::size_t length = 0;
    for (const Happening& each : result.events) {
        EXPECT_LE(each.text.size(), 100'000U);
        length += each.text.size();
    }
    EXPECT_EQ(length, 15'000'000U);
}

TEST_F(EvaluationTest, InputFindsNoLine) {
    EXPECT_EQ(client().eval("input('? ')").errorId(), "EOFError");
    EXPECT_EQ(client().eval("import os\nprint(os.readlink('/proc/self/fd/0'))").output(), "/dev/null\n");
}

TEST_F(EvaluationTest, PythonIsTheDistributionsOwn) {
    EXPECT_EQ(
        client().eval("import sys\nprint(sys.executable, sys.version_info >= (3, 11), sys.flags.utf8_mode)").output(),
        "/usr/bin/python3 True 1\n");
    EXPECT_EQ(client().eval("import numpy\nprint(numpy.arange(3).sum())").output(), "3\n");
}

TEST_F(EvaluationTest, RequestOfADebugPromptWaitsForOne) {
    EvalOptions options;
    options.mode = krutil::cmddistributor::WhenToDequeue::DEQUEUE_AT_DEBUG_PROMPT;
    const IDType waiting = client().enqueue("1", options);
    EXPECT_EQ(client().eval("2").shown(), "2\n");
    client().session().sayGoodbye();
    EXPECT_TRUE(client().await(waiting).discarded());
}

TEST(SinkTest, DiaryAndLogGetTheTextOfSinksThatAskForIt) {
    test_support::TemporaryDirectory directory;
    EngineSession engine({"--diary", directory.file("diary"), "--log", directory.file("log")});
    EvalOptions options;
    options.out = diary;
    options.err = logging;
    engine.client.eval("import sys\nprint('to the diary')\nprint('to the log', file=sys.stderr)\n'\u03b1'", options);
    engine.client.eval("print('to neither')");
    options.streams = IqmStreamID::ekIqmNoStreams;
    engine.client.eval("print('to neither')", options);
    engine.client.goodbye();
    engine.process.wait();
    EXPECT_EQ(contentsOf(directory.file("diary")), "to the diary\n'\u03b1'\n");
    const std::string log = contentsOf(directory.file("log"));
    EXPECT_THAT(log, HasSubstr("to the log\n"));
    EXPECT_THAT(log, HasSubstr("session with engine test\n"));
    EXPECT_THAT(log, Not(HasSubstr("to the diary")));
    EXPECT_THAT(log, Not(HasSubstr("to neither")));
    EXPECT_EQ(engine.process.stderrText(), "");
}

TEST(SinkTest, TraitsWithoutFilesHaveNoEffect) {
    EngineSession engine;
    EvalOptions options;
    options.out = SinkTraits(false, false, false, true, false, true);
    EXPECT_EQ(engine.client.eval("print('x')", options).output(), "x\n");
    engine.client.goodbye();
    engine.process.wait();
    EXPECT_EQ(engine.process.stderrText(), "");
}

TEST_F(EvaluationTest, WhatTheEngineOffersIsInOneModule) {
    const std::string code =
        "import qvm\n"
        "offered = [name for name in dir(qvm) if not name.startswith('_')]\n"
        "print(*offered)\n"
        "{getattr(qvm, name).__module__ for name in offered}";
    const Evaluation result = client().eval(code);
    EXPECT_EQ(
        result.output(),
        "DebuggerQuit bind_display complete dbcont dbquit debugger down full inspect is_complete keyboard link list "
        "next pause shorten step take_displays up warning where\n");
    EXPECT_EQ(result.shown(), "{'qvm'}\n");
}

TEST(SinkTest, EventsFitWhatTheClientAccepts) {
    session::Limits limits;
    limits.taggedFrame = 512;
    EngineSession engine({}, limits);
    const Evaluation result = engine.client.eval("import sys\nsys.stdout.write('\\u20ac' * 10_000)\n'x' * 2_000");
    EXPECT_EQ(result.output().size(), 30'000U);
    EXPECT_EQ(result.shown().size(), 2'003U);
    EXPECT_FALSE(result.error);
}

TEST_F(EvaluationTest, OutputWaitsForAClientThatDoesNotRead) {
    // Each event is held up for a moment, so that the code would be far ahead if nothing stopped it.
    client().eval(usedMemory + "before = most = used()");
    client().slowDown(std::chrono::microseconds(200));
    client().eval(
        "line = 'x' * 30_000\n"
        "for i in range(2_000):\n"
        "    print(line)\n"
        "    most = max(most, used())");
    client().slowDown(std::chrono::microseconds(0));
    EXPECT_EQ(client().eval("most - before if most - before > 20_000_000 else 'little'").shown(), "'little'\n");
}

}  // namespace
}  // namespace qvm_test
