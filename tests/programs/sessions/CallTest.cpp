// Functions that are called with arrays, in an engine in another process.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <csignal>
#include <filesystem>
#include <fstream>
#include <map>
#include <nlohmann/json.hpp>
#include <optional>
#include <sstream>

#include "programs/support/Program.hpp"
#include "support/TemporaryDirectory.hpp"

namespace programs_test {
namespace {

using nlohmann::json;
using ::testing::AllOf;
using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::StartsWith;

// Runs a program of NumPy in `directory`.
void numpy(const test_support::TemporaryDirectory& directory, const std::string& program) {
    const Ran ran = run({"/usr/bin/python3", "-c", "import numpy as np\n" + program},
                        {.input = {}, .environment = {}, .directory = directory.file(".")});
    ASSERT_EQ(ran.exitCode, 0) << ran.err;
}

Ran call(const test_support::TemporaryDirectory& directory, std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), "call");
    return runClient(std::move(arguments), {.input = {}, .environment = {}, .directory = directory.file(".")});
}

Ran call(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), "call");
    return runClient(std::move(arguments));
}

// The objects of a --json output that are of this event.
std::vector<json> events(const std::string& lines, const std::string& name) {
    std::vector<json> found;
    std::istringstream in(lines);
    for (std::string line; std::getline(in, line);) {
        auto object = json::parse(line);
        if (object.at("event") == name) {
            found.push_back(std::move(object));
        }
    }
    return found;
}

TEST(ProgramsCallTest, ANumberInAndOut) {
    const Ran ran = call({"math.sqrt", "2.25"});
    EXPECT_EQ(ran.out, "double: 1.5\n");
    EXPECT_EQ(ran.err, "");
    EXPECT_EQ(ran.exitCode, 0);
}

TEST(ProgramsCallTest, LiteralsArriveAsTheTypesThatTheyAre) {
    EXPECT_EQ(call({"numpy.add", "[1,2,3]", "[10,20,30]"}).out, "int64, 3 elements:\n[11, 22, 33]\n");
    EXPECT_EQ(call({"numpy.add", "[1,2.5]", "1"}).out, "double, 2 elements:\n[  2, 3.5]\n");
    EXPECT_EQ(call({"numpy.multiply", "1+2j", "2j"}).out, "complex double: -4+2j\n");
    EXPECT_EQ(call({"numpy.logical_not", "[true,false]"}).out, "bool, 2 elements:\n[false,  true]\n");
    EXPECT_EQ(call({"numpy.transpose", "[[1,2,3],[4,5,6]]"}).out, "int64, 3 x 2:\n[[1, 4],\n [2, 5],\n [3, 6]]\n");
}

TEST(ProgramsCallTest, TextInAndOut) {
    EXPECT_EQ(call({"str.upper", "\"hello \u00e4 \U0001F600\""}).out,
              "text of 10 characters: HELLO \u00c4 \U0001F600\n");
    EXPECT_EQ(call({"len", "\"four\""}).out, "int64: 4\n");
}

TEST(ProgramsCallTest, ACallWithoutArguments) {
    const Ran ran = call({"os.getpid"});
    EXPECT_THAT(ran.out, StartsWith("int64: "));
    EXPECT_EQ(ran.exitCode, 0);
}

TEST(ProgramsCallTest, WhatTheFunctionPrintsComesBeforeItsOutputs) {
    const Ran ran = call({"--nout", "0", "print", "\"printed\""});
    EXPECT_EQ(ran.out, "printed\n");
    EXPECT_EQ(ran.exitCode, 0);
}

TEST(ProgramsCallTest, SeveralOutputsAreNumbered) {
    const Ran ran = call({"divmod", "17", "5", "--nout", "2"});
    EXPECT_EQ(ran.out, "output 1 of 2: int64: 3\noutput 2 of 2: int64: 2\n");
    EXPECT_EQ(ran.exitCode, 0);
}

TEST(ProgramsCallTest, ASingularValueDecompositionIsThatOfNumPy) {
    const test_support::TemporaryDirectory directory;
    numpy(directory, "np.save('a.npy', np.random.default_rng(1).standard_normal((40, 30)))");
    const Ran ran =
        call(directory, {"numpy.linalg.svd", "a.npy", "-o", "u.npy", "-o", "s.npy", "-o", "v.npy", "--nout", "3"});
    EXPECT_EQ(ran.err, "");
    EXPECT_EQ(ran.out,
              "output 1 of 3: double, 40 x 40 -> u.npy\n"
              "output 2 of 3: double, 30 elements -> s.npy\n"
              "output 3 of 3: double, 30 x 30 -> v.npy\n");
    EXPECT_EQ(ran.exitCode, 0);
    numpy(directory, R"(
a = np.load('a.npy')
for name, expected in zip('usv', np.linalg.svd(a)):
    assert np.array_equal(np.load(name + '.npy'), expected), name
)");
}

TEST(ProgramsCallTest, AsManyOutputsAreWantedAsThereAreFiles) {
    const test_support::TemporaryDirectory directory;
    const Ran ran = call(directory, {"divmod", "17", "5", "-o", "q.npy", "-o", "r.npy"});
    EXPECT_EQ(ran.out, "output 1 of 2: int64 -> q.npy\noutput 2 of 2: int64 -> r.npy\n");
    EXPECT_EQ(ran.exitCode, 0);
}

TEST(ProgramsCallTest, OutputsWithoutAFileAreShown) {
    const test_support::TemporaryDirectory directory;
    const Ran ran = call(directory, {"divmod", "17", "5", "--nout", "2", "-o", "q.npy"});
    EXPECT_EQ(ran.out, "output 1 of 2: int64 -> q.npy\noutput 2 of 2: int64: 2\n");
    EXPECT_EQ(ran.exitCode, 0);
}

class LargeCallTest : public ::testing::TestWithParam<std::vector<std::string>> {};

TEST_P(LargeCallTest, AnArrayOfManyMebibytesThereAndBackIsEqual) {
    const test_support::TemporaryDirectory directory;
    // With zero copy off an array and what describes it share one message of at most 64 MiB.
    const bool copied = !GetParam().empty();
    numpy(directory, std::string("a = np.random.default_rng(2).standard_normal((2048, ") + (copied ? "2048" : "4096") +
                         "))\nnp.save('a.npy', a)\nnp.save('f.npy', np.asfortranarray(a))");
    for (const std::string name : {"a", "f"}) {
        std::vector<std::string> arguments{"numpy.negative", name + ".npy", "-o", name + "-out.npy"};
        arguments.insert(arguments.end(), GetParam().begin(), GetParam().end());
        const Ran ran = call(directory, arguments);
        EXPECT_EQ(ran.err, "");
        EXPECT_THAT(ran.out, AllOf(StartsWith("double, 2048 x "), EndsWith(" -> " + name + "-out.npy\n")));
        ASSERT_EQ(ran.exitCode, 0);
    }
    numpy(directory, R"(
a = np.load('a.npy', mmap_mode='r')
c, f = np.load('a-out.npy', mmap_mode='r'), np.load('f-out.npy', mmap_mode='r')
assert np.array_equal(c, -a) and np.array_equal(f, -a)
assert c.flags.c_contiguous and f.flags.f_contiguous
)");
}

INSTANTIATE_TEST_SUITE_P(ZeroCopyOnAndOff, LargeCallTest,
                         ::testing::Values(std::vector<std::string>{}, std::vector<std::string>{"--no-zero-copy"}));

TEST(ProgramsCallTest, AllTypesAndOrdersComeBackAsTheyWent) {
    const test_support::TemporaryDirectory directory;
    numpy(directory, R"(
n = np.arange(1, 7).reshape(2, 3)
for t in 'bool int8 uint8 int16 uint16 int32 uint32 int64 uint64 float32 float64 complex64 complex128'.split():
    a = (n - 2j * n if t.startswith('complex') else n).astype(t)
    np.save(t + '-C.npy', a)
    np.save(t + '-F.npy', np.asfortranarray(a))
    np.save(t + '-B.npy', a.astype(a.dtype.newbyteorder('>')))
    np.save(t + '-0.npy', a[0, 0])
    np.save(t + '-E.npy', a[:, :0])
)");
    // A function that returns arrays of equal shape as they are.
    std::map<char, std::vector<std::string>> byShape;
    for (const auto& entry : std::filesystem::directory_iterator(directory.file("."))) {
        const std::string name = entry.path().filename().string();
        const char kind = name[name.size() - std::string("C.npy").size()];
        byShape[kind == 'F' || kind == 'B' ? 'C' : kind].push_back(name);
    }
    ASSERT_EQ(byShape.size(), 3U);
    ASSERT_EQ(byShape['C'].size(), 39U);
    for (const auto& [shape, names] : byShape) {
        std::vector<std::string> arguments{"numpy.broadcast_arrays"};
        for (const auto& name : names) {
            arguments.insert(arguments.end(), {name, "-o", "out-" + name});
        }
        const Ran ran = call(directory, arguments);
        EXPECT_EQ(ran.err, "");
        ASSERT_EQ(ran.exitCode, 0);
    }
    numpy(directory, R"(
import glob
checked = 0
for name in glob.glob('[!o]*.npy'):
    a, b = np.load(name), np.load('out-' + name)
    assert a.shape == b.shape and a.dtype.newbyteorder('=') == b.dtype, (name, b)
    assert np.array_equal(a, b), (name, b)
    assert a.flags.f_contiguous == b.flags.f_contiguous and a.flags.c_contiguous == b.flags.c_contiguous, name
    checked += 1
assert checked == 65
)");
}

TEST(ProgramsCallTest, JsonShowsEachOutput) {
    const Ran ran = call({"--json", "--nout", "2", "numpy.linalg.eig", "[[2,0],[0,3]]"});
    EXPECT_EQ(ran.exitCode, 0);
    const auto outputs = events(ran.out, "output");
    ASSERT_EQ(outputs.size(), 2U);
    EXPECT_EQ(outputs[0].at("number"), 1);
    EXPECT_EQ(outputs[0].at("type"), "double");
    EXPECT_EQ(outputs[0].at("dimensions"), json::array({2}));
    EXPECT_EQ(outputs[0].at("elements"), json::array({2.0, 3.0}));
    EXPECT_EQ(outputs[1].at("elements"), json::parse("[[1.0,0.0],[0.0,1.0]]"));
    EXPECT_EQ(events(ran.out, "reply").at(0).at("request"), outputs[0].at("request"));
    const json text = events(call({"--json", "str.upper", "\"a\""}).out, "output").at(0);
    EXPECT_EQ(text.at("text"), "A");
    const json complex = events(call({"--json", "numpy.multiply", "[nan,1]", "[1,1j]"}).out, "output").at(0);
    EXPECT_EQ(complex.at("elements").at(1), json::array({0.0, 1.0}));
    EXPECT_EQ(complex.at("elements").at(0).at(0), "nan");
}

TEST(ProgramsCallTest, AnErrorOfTheFunctionIsShownAsForCode) {
    const Ran ran = call({"math.sqrt", "-1"});
    EXPECT_EQ(ran.out, "");
    EXPECT_THAT(ran.err, HasSubstr("math domain error"));
    EXPECT_EQ(ran.exitCode, 1);
}

TEST(ProgramsCallTest, AFunctionThatIsNotThereIsAnError) {
    const Ran ran = call({"numpy.no_such_function"});
    EXPECT_THAT(ran.err, HasSubstr("no_such_function"));
    EXPECT_EQ(ran.exitCode, 1);
}

TEST(ProgramsCallTest, MoreOutputsThanTheFunctionReturnsAreAnError) {
    const Ran ran = call({"divmod", "17", "5", "--nout", "3"});
    EXPECT_EQ(ran.out, "");
    EXPECT_THAT(ran.err, AllOf(HasSubstr("3"), HasSubstr("2"), HasSubstr("output")));
    EXPECT_EQ(ran.exitCode, 1);
}

TEST(ProgramsCallTest, AnOutputFileStaysWhatItWasWhenTheCallFails) {
    const test_support::TemporaryDirectory directory;
    std::ofstream(directory.file("out.npy")) << "old";
    EXPECT_EQ(call(directory, {"math.sqrt", "-1", "-o", "out.npy"}).exitCode, 1);
    std::ostringstream content;
    content << std::ifstream(directory.file("out.npy")).rdbuf();
    EXPECT_EQ(content.str(), "old");
    EXPECT_EQ(std::distance(std::filesystem::directory_iterator(directory.file(".")), {}), 1);
}

TEST(ProgramsCallTest, ArgumentsThatCannotBeReadAreUsageErrors) {
    const test_support::TemporaryDirectory directory;
    const Ran literal = call(directory, {"abs", "1", "[1,[2]]"});
    EXPECT_EQ(literal.err,
              "krutil: argument 2: expected a number like the elements before it, got '['\n"
              "  [1,[2]]\n"
              "     ^\n");
    EXPECT_EQ(literal.exitCode, 2);
    const Ran missing = call(directory, {"abs", "none.npy"});
    EXPECT_EQ(missing.err, "krutil: argument 1: cannot open 'none.npy': No such file or directory\n");
    EXPECT_EQ(missing.exitCode, 2);
    std::ofstream(directory.file("text")) << "no array";
    const Ran text = call(directory, {"abs", "@text"});
    EXPECT_EQ(text.err,
              "krutil: argument 1: cannot read 'text': it is no .npy file (it does not begin with "
              "\"\\x93NUMPY\")\n");
    EXPECT_EQ(text.exitCode, 2);
    const Ran output = call(directory, {"abs", "1", "-o", "nowhere/out.npy"});
    EXPECT_EQ(output.err, "krutil: cannot write 'nowhere/out.npy': No such file or directory\n");
    EXPECT_EQ(output.exitCode, 2);
    const Ran files = call(directory, {"abs", "1", "--nout", "1", "-o", "a.npy", "-o", "b.npy"});
    EXPECT_EQ(files.err, "krutil: --output is given 2 times, but --nout asks for 1\n");
    EXPECT_EQ(files.exitCode, 2);
}

TEST(ProgramsCallTest, ArgumentsLargerThanTheEngineAcceptsAreUsageErrors) {
    const test_support::TemporaryDirectory directory;
    numpy(directory, "np.save('a.npy', np.zeros(1 << 20))");
    const Ran ran = call(directory, {"--engine", quotedForShell(enginePath()) + " --stdio --limit-message 1MiB",
                                     "numpy.negative", "a.npy"});
    EXPECT_THAT(ran.err, AllOf(StartsWith("krutil: \"krutil:IIPEnqueueMessage\" is larger than the engine accepts: its "
                                          "limit \"message\" is 1048576 bytes, the message has "),
                               EndsWith("\n")));
    EXPECT_EQ(ran.exitCode, 2);
}

// An engine that listens, with these options.
class Listening {
  public:
    explicit Listening(std::vector<std::string> options) {
        std::vector<std::string> arguments{enginePath(), "--listen", socket()};
        arguments.insert(arguments.end(), options.begin(), options.end());
        engine_.emplace(arguments);
        EXPECT_TRUE(engine_->waitForErr("serving "));
    }
    ~Listening() {
        engine_->signal(SIGTERM);
        engine_->finish();
    }
    std::string socket() const { return directory_.file("engine"); }

  private:
    test_support::TemporaryDirectory directory_;
    std::optional<Program> engine_;
};

TEST(NoZeroCopyTest, OnTheClientOnlyIsRefused) {
    const Listening engine({});
    const Ran ran = call({"--connect", engine.socket(), "--no-zero-copy", "abs", "-1"});
    EXPECT_EQ(ran.err,
              "krutil: the session is refused by the engine: feature \"ZEROCOPY\": \"disable\" is all that both "
              "ends accept, but the engine has zero copy switched on; set QX_DISABLE_ZEROCOPY for both ends or "
              "for neither\n");
    EXPECT_EQ(ran.exitCode, 5);
    EXPECT_EQ(call({"--connect", engine.socket(), "abs", "-1"}).out, "int64: 1\n");
}

TEST(NoZeroCopyTest, OnTheEngineOnlyIsRefused) {
    const Listening engine({"--no-zero-copy"});
    const Ran ran = call({"--connect", engine.socket(), "abs", "-1"});
    EXPECT_EQ(ran.err,
              "krutil: the session is refused: feature \"ZEROCOPY\": \"disable\" is all that both ends accept, "
              "but the client has zero copy switched on; set QX_DISABLE_ZEROCOPY for both ends or for neither\n");
    EXPECT_EQ(ran.exitCode, 5);
    EXPECT_EQ(call({"--connect", engine.socket(), "--no-zero-copy", "abs", "-1"}).out, "int64: 1\n");
}

TEST(NoZeroCopyTest, AnEngineThatIsStartedIsToldForCodeToo) {
    EXPECT_EQ(runClient({"eval", "--no-zero-copy", "1 + 1"}).out, "2\n");
}

TEST(NoZeroCopyTest, WithItAnArrayIsOneFrameWithoutItTwo) {
    const test_support::TemporaryDirectory directory;
    numpy(directory, "np.save('a.npy', np.arange(100000.0))");
    const auto framesSent = [&](const std::vector<std::string>& options) {
        std::vector<std::string> arguments{"--trace", "numpy.sum", "a.npy"};
        arguments.insert(arguments.end(), options.begin(), options.end());
        std::istringstream trace(call(directory, arguments).err);
        std::vector<std::string> kinds;
        for (std::string line; std::getline(trace, line);) {
            if (line.starts_with("--> ")) {
                kinds.push_back(line.substr(line.find(" type ") + 6, 7));
            }
        }
        return kinds;
    };
    EXPECT_EQ(framesSent({}), (std::vector<std::string>{"11 data", "29 krut", "29 krut", "27 krut"}));
    EXPECT_EQ(framesSent({"--no-zero-copy"}), (std::vector<std::string>{"29 krut", "29 krut", "27 krut"}));
}

}  // namespace
}  // namespace programs_test
