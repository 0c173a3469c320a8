// The command line of a call, and how its outputs are shown.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <complex>
#include <limits>
#include <nlohmann/json.hpp>

#include "foundation/korveldata/ArrayFactory.hpp"
#include "krutil/base/Interrupt.hpp"
#include "krutil/commands/CallCommand.hpp"
#include "krutil/commands/CommandLine.hpp"
#include "krutil/display/JsonPrinter.hpp"
#include "krutil/display/PersonPrinter.hpp"
#include "support/Pipe.hpp"

namespace krutil_client {
namespace {

using foundation::korveldata::Array;
using foundation::korveldata::ArrayFactory;
using foundation::korveldata::MemoryOrder;
using ::testing::ElementsAre;
using ::testing::HasSubstr;

std::variant<Options, Finished> parseAsCall(std::vector<const char*> arguments) {
    arguments.insert(arguments.begin(), {"krutil", "call"});
    return parseCommandLine(static_cast<int>(arguments.size()), arguments.data());
}

CallOptions parseCall(const std::vector<const char*>& arguments) {
    return std::get<CallOptions>(std::get<Options>(parseAsCall(arguments)).command);
}

TEST(CallCommandLineTest, AFunctionWithoutArgumentsHasOneOutput) {
    const CallOptions call = parseCall({"os.getpid"});
    EXPECT_EQ(call.function, "os.getpid");
    EXPECT_TRUE(call.arguments.empty());
    EXPECT_EQ(call.outputs, 1U);
    EXPECT_TRUE(call.files.empty());
    EXPECT_FALSE(call.sparingly);
}

TEST(CallCommandLineTest, ArgumentsAreKeptAsTheyWereTyped) {
    EXPECT_THAT(parseCall({"f", "1", "-2", "{}", "", "\"a, b\"", "a b.npy", "@x", "-1+2j", "eval"}).arguments,
                ElementsAre("1", "-2", "{}", "", "\"a, b\"", "a b.npy", "@x", "-1+2j", "eval"));
    EXPECT_THAT(parseCall({"f", "{}"}).arguments, ElementsAre("{}"));
    EXPECT_THAT(parseCall({"f", "--", "-.5", "--nout"}).arguments, ElementsAre("-.5", "--nout"));
}

TEST(CallCommandLineTest, ListsAreNotTakenApart) {
    EXPECT_THAT(parseCall({"f", "[1,2]", "--no-zero-copy", "[[1],[2]]", "-o", "[a,b]", "[3]"}).arguments,
                ElementsAre("[1,2]", "[[1],[2]]", "[3]"));
    EXPECT_THAT(parseCall({"f", "-o", "[a,b]"}).files, ElementsAre("[a,b]"));
    EXPECT_THAT(parseCall({"f", "--sparingly", "[1,2]"}).arguments, ElementsAre("[1,2]"));
    EXPECT_THAT(parseCall({"f", "--", "-o", "[3,4]"}).arguments, ElementsAre("-o", "[3,4]"));
}

TEST(CallCommandLineTest, OptionsMayStandBetweenArguments) {
    const CallOptions call = parseCall({"f", "1", "-o", "a.npy", "2", "--output", "b.npy", "3", "--nout", "4"});
    EXPECT_THAT(call.arguments, ElementsAre("1", "2", "3"));
    EXPECT_THAT(call.files, ElementsAre("a.npy", "b.npy"));
    EXPECT_EQ(call.outputs, 4U);
}

TEST(CallCommandLineTest, EachFileIsAnOutput) {
    EXPECT_EQ(parseCall({"f", "-o", "a", "-o", "b"}).outputs, 2U);
    EXPECT_EQ(parseCall({"f", "--nout", "0"}).outputs, 0U);
}

TEST(CallCommandLineTest, AFunctionMayBeCalledLikeACommand) {
    EXPECT_EQ(parseCall({"eval", "\"1\""}).function, "eval");
    EXPECT_EQ(parseCall({"call"}).function, "call");
}

TEST(CallCommandLineTest, NoZeroCopyIsForCodeToo) {
    EXPECT_TRUE(std::get<Options>(parseAsCall({"f", "--no-zero-copy"})).connection.noZeroCopy);
    const std::vector<const char*> eval{"krutil", "eval", "--no-zero-copy", "1"};
    EXPECT_TRUE(std::get<Options>(parseCommandLine(4, eval.data())).connection.noZeroCopy);
    EXPECT_FALSE(std::get<Options>(parseAsCall({"f"})).connection.noZeroCopy);
}

TEST(CallCommandLineTest, NoSharedMemoryIsForCodeToo) {
    EXPECT_TRUE(std::get<Options>(parseAsCall({"f", "--no-shared-memory"})).connection.noSharedMemory);
    const std::vector<const char*> eval{"krutil", "eval", "--no-shared-memory", "1"};
    EXPECT_TRUE(std::get<Options>(parseCommandLine(4, eval.data())).connection.noSharedMemory);
    EXPECT_FALSE(std::get<Options>(parseAsCall({"f"})).connection.noSharedMemory);
}

TEST(CallCommandLineTest, WrongCommandLines) {
    const auto sentence = [](const std::vector<const char*>& arguments) {
        const auto finished = std::get<Finished>(parseAsCall(arguments));
        EXPECT_EQ(finished.code, ExitCode::Usage);
        return finished.err;
    };
    EXPECT_THAT(sentence({}), HasSubstr("FUNCTION is required"));
    EXPECT_THAT(sentence({"f", "--nout", "-1"}), HasSubstr("--nout"));
    EXPECT_THAT(sentence({"f", "--nout", "65536"}), HasSubstr("65536"));
    EXPECT_THAT(sentence({"f", "--nuot", "1"}), HasSubstr("--nuot"));
}

std::string usageError(const std::string& function, const std::vector<std::string>& arguments = {}) {
    CallOptions options;
    options.function = function;
    options.arguments = arguments;
    try {
        prepareCall(options);
    } catch (const Failure& failure) {
        EXPECT_EQ(failure.code(), ExitCode::Usage);
        return failure.what();
    }
    return "accepted";
}

TEST(PrepareCallTest, AnErrorInALiteralPointsAtThePlace) {
    EXPECT_EQ(usageError("f", {"1", "[1, \u00e4]"}),
              "argument 2: expected a number, true, false or a list, got '\u00e4'\n  [1, \u00e4]\n      ^");
    EXPECT_EQ(usageError("f", {"[1,\n2"}), "argument 1: expected ',' or ']', got the end of it\n  [1, 2\n       ^");
    const std::string many(100, '1');
    EXPECT_EQ(usageError("f", {"[" + many + ".5 x " + many + "]"}),
              "argument 1: expected ',' or ']', got 'x'\n  ..." + std::string(57, '1') + ".5 x " +
                  std::string(18, '1') + "...\n  " + std::string(63, ' ') + "^");
}

TEST(PrepareCallTest, TextThatIsNotUtf8) {
    EXPECT_EQ(usageError("f\xff"), "the function's name is not valid UTF-8 (at byte 1)");
    EXPECT_EQ(usageError("f", {"\"\xff\""}), "argument 1 is not valid UTF-8 (at byte 1)");
    EXPECT_EQ(usageError(""), "the function's name is empty");
}

class OutputPrinterTest : public ::testing::Test {
  protected:
    Interrupt interrupt;
    test_support::Pipe pipe;
    Output out{pipe.write.get(), "standard output", interrupt};
    const foundation::msg_svc::exchange::IDType request{1, 2};
    const std::string none;
    const std::string file = "x.npy";
};

TEST_F(OutputPrinterTest, ForAPerson) {
    PersonPrinter printer(out, out, PersonStyle{});
    const Array number = ArrayFactory().createScalar(2.5);
    printer.returned({request, 1, 1, number, none});
    printer.returned({request, 1, 1, number, file});
    printer.returned({request, 2, 3, number, none});
    printer.returned({request, 3, 3, number, file});
    EXPECT_EQ(pipe.content(),
              "double: 2.5\ndouble -> x.npy\noutput 2 of 3: double: 2.5\noutput 3 of 3: double -> x.npy\n");
}

TEST_F(OutputPrinterTest, AsJson) {
    JsonPrinter printer(out);
    const std::int16_t numbers[] = {1, 2, 3, 4, 5, 6};
    const Array matrix = ArrayFactory().createArray(foundation::korveldata::ElementType::Int16, {2, 3},
                                                    MemoryOrder::ColumnMajor, numbers);
    printer.returned({request, 1, 2, matrix, none});
    printer.returned({request, 2, 2, matrix, file});
    printer.returned({request, 1, 1, ArrayFactory().createText(u"text \u00e4"), none});
    printer.returned({request, 1, 1, ArrayFactory().createScalar(std::complex<float>(1, -INFINITY)), none});
    printer.returned({request, 1, 1, ArrayFactory().createScalar(std::numeric_limits<std::uint64_t>::max()), none});
    printer.returned(
        {request, 1, 1, ArrayFactory().createArray(foundation::korveldata::ElementType::Bool, {1001}), none});
    const std::string begin = R"({"event":"output","request":"00000000000000010000000000000002","number":)";
    EXPECT_EQ(pipe.content(),
              begin + R"(1,"type":"int16","dimensions":[2,3],"order":"column-major","elements":[[1,3,5],[2,4,6]]})" +
                  "\n" + begin + R"(2,"type":"int16","dimensions":[2,3],"order":"column-major","file":"x.npy"})" +
                  "\n" + begin + R"(1,"type":"UTF-16 code unit","dimensions":[1,6],"order":"row-major","text":"text )" +
                  "\u00e4\"}\n" + begin +
                  R"(1,"type":"complex single","dimensions":[],"order":"row-major","elements":[1.0,"-inf"]})" + "\n" +
                  begin + R"(1,"type":"uint64","dimensions":[],"order":"row-major","elements":18446744073709551615})" +
                  "\n" + begin + R"(1,"type":"bool","dimensions":[1001],"order":"row-major"})" + "\n");
}

}  // namespace
}  // namespace krutil_client
