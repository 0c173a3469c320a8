// Calls with zero copy switched on and off. The choice is made once in the life of a process, so each test's client has
// a process of its own, as each engine has.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>

#include "apps/qvm/calls/CallFixture.hpp"

namespace qvm_test {
namespace {

using testing::ExitedWithCode;
using testing::HasSubstr;

constexpr const char* variable = "QX_DISABLE_ZEROCOPY";

void setVariable(const char* value) {
    if (value == nullptr) {
        ::unsetenv(variable);
    } else {
        ::setenv(variable, value, 1);
    }
}

// What was settled, and whether arrays came back as they went. Inside messages they are subject to the limit of an
// array message, beside them they are not: so that limit tells which way they went.
std::string account(EngineProcess& process) {
    session::Limits limits;
    limits.arrayMessage = 100'000;
    EngineClient client(process.connection(), limits);
    std::string text = client.session().features().at("ZEROCOPY");
    for (const std::uint64_t size : {0UL, 1UL, 2047UL, 2048UL, 99'000UL}) {
        const Array sent = bytes(size);
        const std::vector<Array> got = call(client, "numpy.asarray", {sent});
        if (got.size() != 1 || !(got[0] == sent)) {
            return text + ", but " + std::to_string(size) + " bytes differ";
        }
    }
    const Evaluation large = client.await(client.enqueue(callOf("numpy.asarray", {bytes(100'001)})));
    return text + (large.error ? " inside" : " beside");
}

std::string account(const std::vector<std::string>& arguments = {"--stdio"}) {
    EngineProcess process(arguments);
    return account(process);
}

[[noreturn]] void report(const std::string& text) {
    std::fprintf(stderr, "(%s)\n", text.c_str());
    std::_Exit(0);
}

std::string refusal(EngineProcess& process) {
    try {
        return account(process);
    } catch (const session::HandshakeRefused& refused) {
        const int code = process.wait();
        return std::string(refused.what()) + " [" + std::to_string(code) + "] " + process.stderrText();
    }
}

class ZeroCopyCallDeathTest : public testing::Test {
  protected:
    ZeroCopyCallDeathTest() { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
};

TEST_F(ZeroCopyCallDeathTest, ArraysTravelBesideTheirMessagesUnlessSwitchedOff) {
    EXPECT_EXIT(setVariable(nullptr); report(account()), ExitedWithCode(0), "\\(enable beside\\)");
    EXPECT_EXIT(setVariable(""); report(account()), ExitedWithCode(0), "\\(enable beside\\)");
}

TEST_F(ZeroCopyCallDeathTest, AnyValueSwitchesItOff) {
    for (const char* value : {"0", "false", "1"}) {
        EXPECT_EXIT(setVariable(value); report(account()), ExitedWithCode(0), "\\(disable inside\\)") << value;
    }
}

TEST_F(ZeroCopyCallDeathTest, OptionOfTheEngineSwitchesItOff) {
    EXPECT_EXIT(
        {
            setVariable(nullptr);
            EngineProcess engine({"--stdio", "--no-zero-copy"});
            setVariable("1");
            report(account(engine));
        },
        ExitedWithCode(0), "\\(disable inside\\)");
}

TEST_F(ZeroCopyCallDeathTest, ChangeAfterTheFirstSessionHasNoEffect) {
    EXPECT_EXIT(
        {
            setVariable(nullptr);
            EngineProcess first({"--stdio"});
            EngineProcess second({"--stdio"});
            const std::string before = account(first);
            setVariable("1");
            report(before + ", " + account(second));
        },
        ExitedWithCode(0), "\\(enable beside, enable beside\\)");
}

TEST_F(ZeroCopyCallDeathTest, EndsThatDifferAreRefusedWithTheReason) {
    EXPECT_EXIT(
        {
            setVariable(nullptr);
            EngineProcess engine({"--stdio", "--no-zero-copy"});
            report(refusal(engine));
        },
        ExitedWithCode(0),
        "\\(the session is refused: feature \"ZEROCOPY\": \"disable\" is all that both ends accept, but the client has "
        "zero copy switched on; set QX_DISABLE_ZEROCOPY for both ends or for neither \\[5\\] krutil-qvm: .*the session "
        "is refused by the client: feature \"ZEROCOPY\"");
    EXPECT_EXIT(
        {
            setVariable(nullptr);
            EngineProcess engine({"--stdio"});
            setVariable("1");
            report(refusal(engine));
        },
        ExitedWithCode(0),
        "\\(the session is refused by the engine: feature \"ZEROCOPY\": \"disable\" is all that both ends accept, but "
        "the engine has zero copy switched on; set QX_DISABLE_ZEROCOPY for both ends or for neither \\[5\\]");
}

}  // namespace
}  // namespace qvm_test
