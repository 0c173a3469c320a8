// How errors of running code reach the client.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>

#include <algorithm>

#include "apps/qvm/fixture/EngineFixture.hpp"
#include "msg_svc/protobuf/ustring.hpp"

namespace qvm_test {
namespace {

using cmddistributor::RuntimeException;
using krutil::cmddistributor::inCOMPILE_ERROR;
using krutil::cmddistributor::inEXECUTION_CTRLC;
using krutil::cmddistributor::inRUNTIME_ERROR;
using testing::Contains;
using testing::ElementsAre;
using testing::EndsWith;
using testing::HasSubstr;
using testing::Not;
using testing::StartsWith;

constexpr char replacement[] = "\xEF\xBF\xBD";

// "file:line function", outermost first.
std::vector<std::string> framesOf(const RuntimeException& error) {
    std::vector<std::string> result;
    for (const cmddistributor::StackFrame& frame : error.getStackFrames()) {
        result.push_back(msg_svc::protobuf::ustring_to_utf8(frame.file) + ":" +
                         std::to_string(static_cast<int>(frame.line)) + " " + frame.func);
    }
    return result;
}

std::string textOf(const RuntimeException& error) {
    return msg_svc::protobuf::ustring_to_utf8(error.GetUnicodeMessageTxt());
}

std::size_t depthOf(const RuntimeException& error) {
    std::size_t deepest = 0;
    for (const RuntimeException& cause : error.getCauses()) {
        deepest = std::max(deepest, depthOf(cause));
    }
    return deepest + 1;
}

class ErrorTest : public testing::Test {
  protected:
    // The error of a request that is expected to fail.
    RuntimeException errorOf(const std::string& code) {
        const Evaluation result = engine_.client.eval(code);
        if (!result.error) {
            throw std::runtime_error("The code raised no error: " + code);
        }
        return *result.error;
    }

    EngineSession engine_;
};

// The thread sanitizer holds a signal back until the thread calls something that it knows, which a loop in the
// interpreter never does. Tests that need such a signal are a suite of their own, which it does not run.
using InterruptedErrorTest = ErrorTest;

TEST_F(ErrorTest, ErrorCarriesStatusTypeTextFunctionAndFrames) {
    const RuntimeException error = errorOf(
        "def inner(x):\n"
        "    raise ValueError('caf\u00e9')\n"
        "def outer():\n"
        "    inner(1)\n"
        "outer()");
    EXPECT_EQ(error.getExecutionStatus(), inRUNTIME_ERROR);
    EXPECT_EQ(error.GetID(), "ValueError");
    EXPECT_EQ(textOf(error), "caf\u00e9");
    EXPECT_EQ(error.getFunctionName(), "inner");
    EXPECT_THAT(framesOf(error), ElementsAre("<eval-1>:5 <module>", "<eval-1>:4 outer", "<eval-1>:2 inner"));
    EXPECT_TRUE(error.getCauses().empty());
    EXPECT_FALSE(error.getShown());
}

TEST_F(ErrorTest, TextBeforeTheErrorIsKept) {
    const Evaluation result = engine_.client.eval("print('before')\n1 / 0");
    EXPECT_EQ(result.output(), "before\n");
    EXPECT_EQ(result.errorId(), "ZeroDivisionError");
}

TEST_F(ErrorTest, TypesOfModulesAreQualified) {
    EXPECT_EQ(errorOf("import json\njson.loads('{')").GetID(), "json.decoder.JSONDecodeError");
    EXPECT_EQ(errorOf("class Mine(Exception): pass\nraise Mine").GetID(), "__main__.Mine");
    EXPECT_EQ(errorOf("import socket\nraise socket.gaierror(1)").GetID(), "socket.gaierror");
    EXPECT_EQ(errorOf("import numpy\nnumpy.linalg.inv(numpy.zeros((2, 2)))").GetID(), "numpy.linalg.LinAlgError");
}

TEST_F(ErrorTest, FramesOfImportedCodeNameTheirFiles) {
    const std::vector<std::string> frames = framesOf(errorOf("import json\njson.loads('{')"));
    ASSERT_GE(frames.size(), 2U);
    EXPECT_EQ(frames.front(), "<eval-1>:2 <module>");
    EXPECT_THAT(frames.back(), StartsWith("/usr/lib/python3.11/json/decoder.py:"));
}

TEST_F(ErrorTest, FramesOfTheEngineAreLeftOut) {
    EXPECT_THAT(framesOf(errorOf("class C:\n    def __repr__(self): raise ValueError('r')\nC()")),
                ElementsAre("<eval-1>:2 __repr__"));
    EXPECT_THAT(framesOf(errorOf("import qvm\nclass S:\n    def __str__(self): raise KeyError(1)\nqvm.link(S(), '')")),
                ElementsAre("<eval-2>:4 <module>", "<eval-2>:3 __str__"));
}

TEST_F(ErrorTest, TextThatIsNoCodeIsACompileError) {
    const RuntimeException error = errorOf("x = 1\nfor in");
    EXPECT_EQ(error.getExecutionStatus(), inCOMPILE_ERROR);
    EXPECT_EQ(error.GetID(), "SyntaxError");
    EXPECT_EQ(textOf(error), "invalid syntax (<eval-1>, line 2)");
    EXPECT_TRUE(error.getStackFrames().empty());
    EXPECT_TRUE(error.getCauses().empty());
    EXPECT_EQ(errorOf("x").GetID(), "NameError");
    EXPECT_EQ(errorOf("if 1:\nx").GetID(), "IndentationError");
}

TEST_F(ErrorTest, CodeTextWithNulIsACompileError) {
    const RuntimeException error = errorOf(std::string("1\0+1", 4));
    EXPECT_EQ(error.getExecutionStatus(), inCOMPILE_ERROR);
    EXPECT_EQ(textOf(error), "source code string cannot contain null bytes");
}

TEST_F(ErrorTest, TooDeeplyNestedCodeTextIsACompileError) {
    EXPECT_EQ(errorOf(std::string(100'000, '(')).getExecutionStatus(), inCOMPILE_ERROR);
    EXPECT_EQ(errorOf(std::string(100'000, '-') + "1").getExecutionStatus(), inCOMPILE_ERROR);
    EXPECT_EQ(engine_.client.eval("1").shown(), "1\n");
}

TEST_F(ErrorTest, SyntaxErrorThatRunningCodeRaisesIsARuntimeError) {
    const RuntimeException error = errorOf("compile('for in', 'f', 'exec')");
    EXPECT_EQ(error.getExecutionStatus(), inRUNTIME_ERROR);
    EXPECT_EQ(error.GetID(), "SyntaxError");
}

TEST_F(ErrorTest, KeyboardInterruptIsCtrlC) {
    EXPECT_EQ(errorOf("raise KeyboardInterrupt").getExecutionStatus(), inEXECUTION_CTRLC);
    EXPECT_EQ(errorOf("class K(KeyboardInterrupt): pass\nraise K").getExecutionStatus(), inEXECUTION_CTRLC);
}

TEST_F(InterruptedErrorTest, InterruptSignalEndsTheRequestAndNothingElse) {
    const IDType id = engine_.client.enqueue("print('running')\nwhile True: pass");
    engine_.client.awaitText("running");
    engine_.process.signal(SIGINT);
    const Evaluation result = engine_.client.await(id);
    ASSERT_TRUE(result.error);
    EXPECT_EQ(result.error->getExecutionStatus(), inEXECUTION_CTRLC);
    EXPECT_EQ(engine_.client.eval("1").shown(), "1\n");
    // An interrupt that finds nothing to interrupt is dropped.
    engine_.process.signal(SIGINT);
    EXPECT_FALSE(engine_.client.eval("pass").error);
}

TEST_F(ErrorTest, CausesAreTheStatedCauseAndTheContext) {
    const RuntimeException error = errorOf(
        "try:\n"
        "    try:\n"
        "        {}['k']\n"
        "    except KeyError as e:\n"
        "        raise ValueError('v') from e\n"
        "except ValueError:\n"
        "    raise TypeError('t')");
    EXPECT_EQ(error.GetID(), "TypeError");
    ASSERT_EQ(error.getCauses().size(), 1U);
    const RuntimeException& value = error.getCauses()[0];
    EXPECT_EQ(value.GetID(), "ValueError");
    EXPECT_THAT(framesOf(value), ElementsAre("<eval-1>:5 <module>"));
    ASSERT_EQ(value.getCauses().size(), 1U);
    EXPECT_EQ(value.getCauses()[0].GetID(), "KeyError");
    EXPECT_EQ(textOf(value.getCauses()[0]), "'k'");
    EXPECT_EQ(value.getCauses()[0].getExecutionStatus(), inRUNTIME_ERROR);
}

TEST_F(ErrorTest, SuppressedContextIsNoCause) {
    EXPECT_TRUE(
        errorOf("try:\n    1 / 0\nexcept ZeroDivisionError:\n    raise ValueError from None").getCauses().empty());
}

TEST_F(ErrorTest, MembersOfAGroupAreCauses) {
    const RuntimeException error = errorOf("raise ExceptionGroup('g', [ValueError(1), TypeError(2)])");
    EXPECT_EQ(error.GetID(), "ExceptionGroup");
    ASSERT_EQ(error.getCauses().size(), 2U);
    EXPECT_EQ(error.getCauses()[0].GetID(), "ValueError");
    EXPECT_EQ(error.getCauses()[1].GetID(), "TypeError");
}

TEST_F(ErrorTest, CyclesOfCausesAreCut) {
    const RuntimeException error = errorOf(
        "a, b = ValueError('a'), ValueError('b')\n"
        "a.__cause__, b.__cause__ = b, a\n"
        "a.__context__ = a.__cause__\n"
        "a.__suppress_context__ = False\n"
        "raise a");
    EXPECT_EQ(textOf(error), "a");
    ASSERT_EQ(error.getCauses().size(), 1U);
    EXPECT_EQ(textOf(error.getCauses()[0]), "b");
    EXPECT_TRUE(error.getCauses()[0].getCauses().empty());
}

TEST_F(ErrorTest, CausesEndAfter64Levels) {
    for (const char* levels : {"63", "64", "50_000"}) {
        const RuntimeException error = errorOf(std::string("e = ValueError(0)\nfor i in range(1, ") + levels +
                                               "):\n    n = ValueError(i)\n    n.__cause__ = e\n    e = n\nraise e");
        EXPECT_EQ(depthOf(error), std::string(levels) == "63" ? 63U : 64U);
    }
}

TEST_F(ErrorTest, ManyCausesAreCutOff) {
    const RuntimeException error = errorOf("raise ExceptionGroup('g', [ValueError(i) for i in range(100_000)])");
    EXPECT_EQ(error.getCauses().size(), 999U);
}

TEST_F(ErrorTest, TypeThatLiesAboutItselfIsNamedAsItIs) {
    EXPECT_EQ(errorOf("class Meta(type):\n"
                      "    def __getattribute__(cls, name): raise RuntimeError('no ' + name)\n"
                      "class Odd(Exception, metaclass=Meta): pass\n"
                      "raise Odd('text')")
                  .GetID(),
              "__main__.Odd");
    EXPECT_EQ(errorOf("class Meta(type):\n"
                      "    __module__ = property(lambda cls: 1 / 0)\n"
                      "class Odd(Exception, metaclass=Meta):\n"
                      "    __class__ = property(lambda self: 1 / 0)\n"
                      "    def __getattribute__(self, name): raise RuntimeError(name)\n"
                      "raise Odd('text')")
                  .GetID(),
              "__main__.Odd");
    EXPECT_EQ(errorOf("class Odd(Exception): pass\nOdd.__module__ = 5\nraise Odd").GetID(), "Odd");
}

TEST_F(ErrorTest, UnprintableErrorSaysSo) {
    EXPECT_EQ(textOf(errorOf("class U(Exception):\n    def __str__(self): raise self\nraise U")),
              "<unprintable __main__.U object>");
    EXPECT_EQ(textOf(errorOf("class U(Exception):\n    def __str__(self): return 5\nraise U")),
              "<unprintable __main__.U object>");
    EXPECT_EQ(textOf(errorOf("class U(Exception):\n    def __str__(self): raise SystemExit\nraise U")),
              "<unprintable __main__.U object>");
    EXPECT_EQ(textOf(errorOf("class U(Exception):\n    def __str__(self): return str(self)\nraise U")),
              "<unprintable __main__.U object>");
    EXPECT_EQ(engine_.client.eval("1").shown(), "1\n");
}

TEST_F(ErrorTest, InterruptInsideTheTextOfAnErrorIsCtrlC) {
    const Evaluation result = engine_.client.eval(
        "class E(Exception):\n    def __str__(self): raise KeyboardInterrupt\nraise E from ValueError('v')");
    ASSERT_TRUE(result.error);
    EXPECT_EQ(result.error->getExecutionStatus(), inEXECUTION_CTRLC);
    EXPECT_EQ(result.errorId(), "KeyboardInterrupt");
    ASSERT_EQ(result.error->getCauses().size(), 1U);
    EXPECT_EQ(result.error->getCauses()[0].GetID(), "__main__.E");
    EXPECT_THAT(result.kinds(), Not(Contains("PrintableErrorEvent")));
}

TEST_F(ErrorTest, NamesAndTextsAreAlwaysWellFormed) {
    const RuntimeException error = errorOf(
        "class T(Exception): pass\n"
        "T.__qualname__ = 'T\\udc80'\n"
        "T.__module__ = 'm\\ud800'\n"
        "def f(): raise T('x\\udfff')\n"
        "f.__code__ = f.__code__.replace(co_name='n\\udcff', co_filename='file\\udcfe')\n"
        "f()");
    EXPECT_EQ(error.GetID(), std::string("m") + replacement + ".T" + replacement);
    EXPECT_EQ(textOf(error), std::string("x") + replacement);
    EXPECT_EQ(error.getFunctionName(), std::string("n") + replacement);
    EXPECT_THAT(framesOf(error),
                ElementsAre("<eval-1>:6 <module>", std::string("file") + replacement + ":4 n" + replacement));
}

TEST_F(ErrorTest, HugeTextIsCut) {
    const std::string text = textOf(errorOf("raise ValueError('\\u20ac' * 50_000_000)"));
    EXPECT_LE(text.size(), (1U << 20) + 100);
    EXPECT_GT(text.size(), (1U << 20) - 100);
    EXPECT_THAT(text, EndsWith("... (49650475 more characters)"));
}

TEST_F(ErrorTest, HugeTextsOfCausesShareOneBound) {
    const RuntimeException error = errorOf(
        "e = ValueError('first' * 1_000_000)\n"
        "for i in range(60):\n"
        "    n = ValueError('x' * 5_000_000)\n"
        "    n.__cause__ = e\n"
        "    e = n\n"
        "raise e");
    EXPECT_GE(depthOf(error), 2U);
    EXPECT_THAT(textOf(error), EndsWith("more characters)"));
}

TEST_F(ErrorTest, LongStackLosesItsMiddle) {
    const RuntimeException error = errorOf(
        "import sys\n"
        "sys.setrecursionlimit(10_000)\n"
        "def f(n):\n"
        "    if n == 0: raise ValueError\n"
        "    f(n - 1)\n"
        "f(3000)");
    const std::vector<std::string> frames = framesOf(error);
    ASSERT_EQ(frames.size(), 1001U);
    EXPECT_EQ(frames[0], "<eval-1>:6 <module>");
    EXPECT_EQ(frames[499], "<eval-1>:5 f");
    EXPECT_EQ(frames[500], ":0 (2002 frames left out)");
    EXPECT_EQ(frames[999], "<eval-1>:5 f");
    EXPECT_EQ(frames[1000], "<eval-1>:4 f");
    EXPECT_EQ(error.getFunctionName(), "f");
}

TEST_F(ErrorTest, EndlessRecursionIsAnErrorLikeAnyOther) {
    EXPECT_EQ(errorOf("def f(): f()\nf()").GetID(), "RecursionError");
    EXPECT_EQ(engine_.client.eval("1").shown(), "1\n");
}

TEST_F(ErrorTest, OutOfMemoryIsAnErrorLikeAnyOther) {
    EXPECT_EQ(errorOf("'x' * (1 << 62)").GetID(), "MemoryError");
    EXPECT_EQ(engine_.client.eval("1").shown(), "1\n");
}

TEST_F(ErrorTest, TracebacksInsideTheCodeShowItsSource) {
    engine_.client.eval("def fail():\n    raise ValueError('deep')");
    EXPECT_THAT(engine_.client.eval("import traceback\ntry:\n    fail()\nexcept ValueError:\n    traceback.print_exc()")
                    .errors(),
                HasSubstr("  File \"<eval-2>\", line 3, in <module>\n    fail()\n"
                          "  File \"<eval-1>\", line 2, in fail\n    raise ValueError('deep')\n"));
    EXPECT_THAT(engine_.client.eval("import inspect\nprint(inspect.getsource(fail), end='')").output(),
                "def fail():\n    raise ValueError('deep')");
}

TEST_F(ErrorTest, SourcesOfOldRequestsAreForgotten) {
    for (int i = 0; i < 1010; ++i) {
        engine_.client.eval("pass");
    }
    EXPECT_EQ(
        engine_.client.eval("import linecache\nlen([k for k in linecache.cache if k.startswith('<eval-')])").shown(),
        "1000\n");
}

TEST(ErrorLimitTest, ErrorIsCutToWhatTheClientAccepts) {
    session::Limits limits;
    limits.taggedFrame = 1024;
    EngineSession engine({}, limits);
    const Evaluation result = engine.client.eval(
        "def f(n):\n"
        "    if n == 0: raise ValueError('x' * 5000) from KeyError('y' * 5000)\n"
        "    f(n - 1)\n"
        "f(100)");
    EXPECT_EQ(result.errorId(), "ValueError");
    EXPECT_THAT(result.errorText(), StartsWith("xxx"));
}

TEST(ErrorLimitTest, ANoteAboutFramesIsNoFunction) {
    session::Limits limits;
    limits.taggedFrame = 4096;
    EngineSession engine({}, limits);
    // The text alone takes what an error may hold.
    const Evaluation result = engine.client.eval("raise ValueError('x' * 100000)");
    ASSERT_TRUE(result.error);
    EXPECT_THAT(framesOf(*result.error), ElementsAre(":0 (1 frames left out)"));
    EXPECT_EQ(result.error->getFunctionName(), "");
}

TEST(ErrorLimitTest, ResultThatCannotBeSentIsReplacedByOneThatSaysWhy) {
    session::Limits limits;
    limits.taggedFrame = 300;
    EngineSession engine({}, limits);
    // The error's fixed parts alone exceed what the client accepts.
    const Evaluation result = engine.client.eval("raise type('T' * 2000, (Exception,), {})");
    ASSERT_TRUE(result.error);
    EXPECT_EQ(engine.client.eval("1").shown(), "1\n");
}

}  // namespace
}  // namespace qvm_test
