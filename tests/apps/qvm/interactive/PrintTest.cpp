// The engine's print() is Python's own in all that code can see.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>

#include "apps/qvm/fixture/EngineFixture.hpp"

namespace qvm_test {
namespace {

class PrintTest : public testing::Test {
  protected:
    std::string output(const std::string& code) {
        const Evaluation result = engine_.client.eval(code + "\nNone");
        EXPECT_EQ(result.errorText(), "");
        return result.output();
    }

    EngineSession engine_;
};

// A call of print() to the engine's stream, and the same one to a stream of Python's, which prints by Python's own.
class PrintedAlikeTest : public PrintTest, public testing::WithParamInterface<const char*> {};

TEST_P(PrintedAlikeTest, AsByPythonsOwn) {
    const std::string call = GetParam();
    const std::string own = output(
        "import contextlib, io, sys\nstream = io.StringIO()\n"
        "with contextlib.redirect_stdout(stream):\n    " +
        call + "\nsys.stdout.write(stream.getvalue())");
    EXPECT_FALSE(own.empty());
    EXPECT_EQ(output(call), own);
}

INSTANTIATE_TEST_SUITE_P(
    Calls, PrintedAlikeTest,
    testing::Values("print()", "print('line', 1)", "print('a', 'b', sep='', end='!')", "print('a', sep=None, end=None)",
                    "print(None, True, False, 0.1, -0.0, float('nan'), 1e400, -1)",
                    "print(2 ** 63 - 1, 2 ** 63, -2 ** 63, 10 ** 4000)", "print('\u00e9\u20ac\U0001F600', 'e')",
                    "print('x' * 5000, 'y' * 40000)", "print('x', sep='s' * 5000, end='e' * 5000)",
                    "print(1, 2, sep='s' * 5000)", "print([1], (2,), {3: 'c'}, b'd', 1j, int, Ellipsis)",
                    "print(type('S', (str,), {'__str__': lambda s: 'mine'})('text'))",
                    "print(type('I', (int,), {'__str__': lambda s: 'mine'})(3))", "print('now', flush=True)",
                    "print('explicit', file=sys.stdout)", "print('line\\n', 'another')", "print(*range(3000))"));

TEST_F(PrintTest, WrongArgumentsAreJudgedByPythonsOwn) {
    EXPECT_EQ(engine_.client.eval("print('lost', sep=3)").errorText(), "sep must be None or a string, not int");
    EXPECT_EQ(engine_.client.eval("print('lost', end=b'')").errorText(), "end must be None or a string, not bytes");
    EXPECT_EQ(engine_.client.eval("print('lost', ende='')").errorText(),
              "'ende' is an invalid keyword argument for print()");
    const Evaluation result = engine_.client.eval("print('first', 10 ** 5000)");
    EXPECT_EQ(result.output(), "first ");
    EXPECT_THAT(result.errorText(),
                testing::StartsWith("Exceeds the limit (4300 digits) for integer string conversion"));
}

TEST_F(PrintTest, ValueThatWritesItselfDoesSoInItsPlace) {
    EXPECT_EQ(output("import sys\nclass Writing:\n    def __str__(self):\n        sys.stdout.write('[written]')\n"
                     "        return 'value'\nprint('before', Writing(), 'after')"),
              "before [written]value after\n");
}

TEST_F(PrintTest, WriteThatCodeReplacedIsCalledForEachPiece) {
    EXPECT_EQ(output("import sys\nwrite, pieces = sys.stdout.write, []\nsys.stdout.write = pieces.append\n"
                     "print('a', 1)\nsys.stdout.write = write\nprint(pieces)"),
              "['a', ' ', '1', '\\n']\n");
}

TEST_F(PrintTest, StreamThatCodeReplacedGetsTheText) {
    EXPECT_EQ(output("import io, sys\nreal, sys.stdout = sys.stdout, io.StringIO()\nprint('a', 1)\n"
                     "text, sys.stdout = sys.stdout.getvalue(), None\nprint('nowhere')\ndel sys.stdout\n"
                     "try:\n    print('lost')\nexcept RuntimeError as error:\n    text += str(error)\n"
                     "sys.stdout = real\nsys.stdout.write(text)"),
              "a 1\nlost sys.stdout");
}

TEST_F(PrintTest, SurrogatesAreReplacedAsInAllText) {
    EXPECT_EQ(output("print('\\ud800', 'a\\udc00')"), "\uFFFD a\uFFFD\n");
}

TEST_F(PrintTest, ForkedChildPrintsToItsDescriptor) {
    engine_.client.eval(
        "import os\nchild = os.fork()\nif child == 0:\n    print('from', 1, 'child')\n    os._exit(0)\n"
        "os.waitpid(child, 0)");
    EXPECT_EQ(engine_.client.backgroundText(), "from 1 child\n");
}

// What a descriptor has received is sent before the text, and other threads run meanwhile.
TEST_F(PrintTest, ThreadsThatPrintAtOnceKeepTheirOwnText) {
    const Evaluation result = engine_.client.eval(
        "import os, threading\ndef lines(text):\n    for _ in range(300):\n        os.write(1, b'x')\n        "
        "print(text)\n"
        "other = threading.Thread(target=lines, args=('b' * 20,))\nother.start()\nlines('a' * 20)\nother.join()");
    std::string expected;
    for (int i = 0; i < 300; ++i) {
        expected += std::string(20, 'a') + "\n";
    }
    EXPECT_EQ(result.output(), expected);
}

TEST_F(PrintTest, LooksLikePythonsOwn) {
    EXPECT_EQ(output("import builtins, inspect, pickle\nprint(repr(print), inspect.signature(print))\n"
                     "print(print.__module__, pickle.loads(pickle.dumps(print)) is print)\n"
                     "print(print.__doc__.splitlines()[0])"),
              "<built-in function print> (*args, sep=' ', end='\\n', file=None, flush=False)\n"
              "builtins True\n"
              "Prints the values to a stream, or to sys.stdout by default.\n");
}

}  // namespace
}  // namespace qvm_test
