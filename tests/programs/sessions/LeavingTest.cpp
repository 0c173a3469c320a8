// How the client leaves an engine: what it wants is answered first, and the goodbye is the last that it says.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <fstream>

#include "programs/support/Goodbye.hpp"
#include "programs/support/Program.hpp"
#include "programs/support/Relay.hpp"
#include "support/TemporaryDirectory.hpp"

namespace programs_test {
namespace {

using ::testing::HasSubstr;

class LeavingTest : public ::testing::Test {
  protected:
    LeavingTest() {
        EXPECT_TRUE(engine.waitForErr("krutil-qvm: serving "));
        relay.record();
    }

    std::vector<std::string> across(std::vector<std::string> arguments) const {
        arguments.insert(arguments.begin() + 1, {"--connect", relay.path()});
        return clientCommand(std::move(arguments));
    }

    std::string wrong(std::size_t cancels) { return wrongGoodbye(relay.recorded(Relay::Way::ToEngine), cancels); }

    const test_support::TemporaryDirectory directory;
    const std::string socket = directory.file("private/engine");
    Program engine{{enginePath(), "--listen", socket}};
    Relay relay{directory.file("relay"), socket};
};

struct Command {
    std::string name;
    std::vector<std::string> arguments;
    std::string input;
    int exitCode;
    std::string out;
};

class CommandLeavingTest : public LeavingTest, public ::testing::WithParamInterface<Command> {};

TEST_P(CommandLeavingTest, SaysGoodbyeLast) {
    std::ofstream(directory.file("script.py")) << "print(6 * 7)\n";
    auto arguments = GetParam().arguments;
    if (arguments[0] == "run") {
        arguments.push_back(directory.file("script.py"));
    }
    Program::Options options;
    options.input = GetParam().input;
    const Ran ran = run(across(arguments), options);
    EXPECT_EQ(ran.exitCode, GetParam().exitCode) << ran.err;
    EXPECT_THAT(ran.out, HasSubstr(GetParam().out));
    EXPECT_EQ(wrong(0), "");
}

INSTANTIATE_TEST_SUITE_P(
    Commands, CommandLeavingTest,
    ::testing::Values(Command{"Eval", {"eval", "6 * 7"}, "", 0, "42"},
                      Command{"EvalError", {"eval", "1 / 0"}, "", 1, ""},
                      Command{"EvalJson", {"eval", "--json", "6 * 7"}, "", 0, "\"shutdown\""},
                      Command{"Call", {"call", "math.sqrt", "4.0"}, "", 0, "2"},
                      Command{"CallError", {"call", "math.sqrt", "-1.0"}, "", 1, ""},
                      // What cannot be stored is an error of the client's own.
                      Command{"CallUnstored", {"call", "numpy.zeros", "1000", "-o", "/dev/full"}, "", 2, ""},
                      Command{"Run", {"run"}, "", 0, "42"}, Command{"Repl", {"repl"}, "6 * 7\n", 0, "42"},
                      Command{"ReplError", {"repl"}, "6 * 7\n1 / 0\n", 1, "42"},
                      Command{"ReplQuit", {"repl"}, "6 * 7\n:quit\n", 0, "42"}),
    [](const auto& each) { return each.param.name; });

TEST_F(LeavingTest, CtrlCCancelsBeforeTheGoodbye) {
    Program::Options options;
    options.terminal = true;
    Program client(across({"eval", "print('rea' + 'dy', flush=True)\nwhile True: pass"}), options);
    ASSERT_TRUE(client.waitForOut("ready"));
    client.pressCtrlC();
    EXPECT_EQ(client.finish().exitCode, 6);
    EXPECT_EQ(wrong(1), "");
}

TEST_F(LeavingTest, CtrlDAtTheDebuggersPromptQuitsBeforeTheGoodbye) {
    Program::Options options;
    options.terminal = true;
    Program client(across({"eval", "breakpoint()\nprint('never' + ' here')"}), options);
    ASSERT_TRUE(client.waitForOut("debug> "));
    client.type("\x04");
    const Ran ran = client.finish();
    EXPECT_EQ(ran.exitCode, 1);
    EXPECT_THAT(ran.out, ::testing::Not(HasSubstr("never here")));
    EXPECT_EQ(wrong(0), "");
}

TEST_F(LeavingTest, AnEngineThatEndsByItselfIsToldNothing) {
    const Ran ran = run(across({"eval", "raise SystemExit"}));
    EXPECT_EQ(ran.exitCode, 0) << ran.err;
    EXPECT_EQ(countOf(relay.recorded(Relay::Way::ToClient), "krutil:QVMShutdownEvent"), 1U);
}

}  // namespace
}  // namespace programs_test
