// The program's answers to wrong command lines, run as a user runs it.

#include <gtest/gtest.h>
#include <sys/wait.h>

#include <cstdio>
#include <string>
#include <utility>

namespace krutil_client {
namespace {

std::pair<int, std::string> runProgram(const std::string& arguments) {
    FILE* pipe = ::popen((std::string("'" KRUTIL_CLIENT "' ") + arguments + " 2>&1 </dev/null").c_str(), "r");
    std::string text;
    for (int c = 0; (c = std::fgetc(pipe)) != EOF;) {
        text += static_cast<char>(c);
    }
    const int status = ::pclose(pipe);
    return {WIFEXITED(status) ? WEXITSTATUS(status) : -1, text};
}

TEST(ClientUsageTest, WrongCommandLinesExitWithTwo) {
    for (const std::string arguments : {"evaluate 1", "eval", "eval 1 2", "eval 1 -f x", "eval --type poem 1",
                                        "eval --limit-tag 0 1", "eval --engine a --connect b 1"}) {
        const auto [code, text] = runProgram(arguments);
        EXPECT_EQ(code, 2) << arguments << "\n" << text;
        EXPECT_EQ(text.substr(0, 8), "krutil: ") << arguments;
    }
}

TEST(ClientUsageTest, HelpAndVersionExitWithZero) {
    for (const std::string arguments : {"--help", "eval --help", "--version"}) {
        const auto [code, text] = runProgram(arguments);
        EXPECT_EQ(code, 0) << arguments;
        EXPECT_FALSE(text.empty()) << arguments;
    }
}

}  // namespace
}  // namespace krutil_client
