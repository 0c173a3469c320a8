// What a terminal shows while arrays are on their way.

#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>

// The client has a Program.hpp too.
#include "apps/krutil/pseudoterminal/TerminalFixture.hpp"
#include "programs/support/Program.hpp"
#include "programs/support/Relay.hpp"

namespace krutil_client {
namespace {

using programs_test::Relay;
using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::Not;

constexpr std::uint64_t mebi = 1U << 20;
// For what is sent besides an array.
constexpr std::uint64_t besides = 8U << 10;
const std::string at = Screen::cursor;

// What a line says of how far a transfer is; -1 for another line.
int percentOf(const std::string& line) {
    const auto sign = line.find('%');
    return sign == std::string::npos || sign < 4 ? -1 : std::stoi(line.substr(sign - 4, 4));
}

class TerminalCallTest : public TerminalTest {
  protected:
    TerminalCallTest() {
        EXPECT_TRUE(engine.waitForErr("serving "));
        // 16 MiB of zeros.
        std::string header = "{'descr': '<f8', 'fortran_order': False, 'shape': (2097152,), }";
        header.resize(117, ' ');
        std::ofstream(array, std::ios::binary) << std::string("\x93NUMPY\x01\x00\x76\x00", 10) << header << '\n';
        std::filesystem::resize_file(array, 128 + 16 * mebi);
    }

    std::vector<std::string> call(const Relay& through, const std::string& function,
                                  const std::string& argument) const {
        return command({"call", "--connect", through.path(), function, argument});
    }

    programs_test::Program engine{{programs_test::enginePath(), "--listen", (directory / "engine").string()}};
    Relay relay{(directory / "relay").string(), (directory / "engine").string()};
    const std::string array = (directory / "array.npy").string();
};

TEST_F(TerminalCallTest, ALineGrowsWhileAnArrayIsSentAndIsTakenAway) {
    relay.passAtMost(Relay::Way::ToEngine, 4 * mebi);
    Terminal terminal(call(relay, "numpy.sum", array), environment());
    // What is on its way between the two counts as sent.
    terminal.expectScreen("how much was sent", [](const auto& lines) {
        return lines.back().rfind("sending   [#######", 0) == 0 && percentOf(lines.back()) >= 25 &&
               lines.back().find(" of 16.0 MiB" + at) != std::string::npos;
    });
    EXPECT_LT(percentOf(terminal.lines().back()), 50);
    relay.passAtMost(Relay::Way::ToEngine, 12 * mebi);
    terminal.expectScreen("that more was sent", [](const auto& lines) { return percentOf(lines.back()) >= 75; });
    EXPECT_LT(percentOf(terminal.lines().back()), 100);
    relay.passAll(Relay::Way::ToEngine);
    EXPECT_EQ(terminal.exitCode(), 0);
    EXPECT_THAT(terminal.lines(), ElementsAre("double: 0", at));
}

TEST_F(TerminalCallTest, ALineShowsHowMuchOfAnArrayHasArrived) {
    relay.passAtMost(Relay::Way::ToClient, 8 * mebi + besides);
    Terminal terminal(call(relay, "numpy.zeros", "2097152"), environment());
    terminal.expectBottom({"receiving [###############               ]  50%  8.0 of 16.0 MiB" + at});
    relay.passAtMost(Relay::Way::ToClient, 12 * mebi + besides);
    terminal.expectBottom({"receiving [######################        ]  75%  12.0 of 16.0 MiB" + at});
    relay.passAll(Relay::Way::ToClient);
    EXPECT_EQ(terminal.exitCode(), 0);
    EXPECT_THAT(terminal.lines(), Each(Not(HasSubstr("receiving"))));
}

TEST_F(TerminalCallTest, AnErrorOutputThatIsNoTerminalGetsNoLine) {
    Relay other((directory / "other").string(), (directory / "engine").string());
    for (Relay* each : {&relay, &other}) {
        each->passAtMost(Relay::Way::ToEngine, 4 * mebi);
    }
    const auto errors = directory / "errors";
    Terminal redirected(shell("\"$KRUTIL\" call --connect '" + relay.path() + "' numpy.sum '" + array + "' 2>'" +
                              errors.string() + "'"),
                        environment());
    relay.waitUntilHeld(Relay::Way::ToEngine);
    // Begun later, so where this one shows the line, the first one would have done so.
    Terminal shown(call(other, "numpy.sum", array), environment());
    shown.expectScreen("how much was sent", [](const auto& lines) { return percentOf(lines.back()) > 0; });
    for (Relay* each : {&relay, &other}) {
        each->passAll(Relay::Way::ToEngine);
    }
    EXPECT_EQ(shown.exitCode(), 0);
    EXPECT_EQ(redirected.exitCode(), 0);
    EXPECT_EQ(redirected.sent(), "double: 0\r\n");
    EXPECT_EQ(std::filesystem::file_size(errors), 0U);
}

TEST_F(TerminalCallTest, CtrlCTakesTheLineAway) {
    relay.passAtMost(Relay::Way::ToEngine, 4 * mebi);
    Terminal terminal(call(relay, "numpy.sum", array), environment());
    terminal.expectScreen("how much was sent", [](const auto& lines) { return percentOf(lines.back()) > 0; });
    terminal.type("\x03");
    // Taken away for the answer to the key, and shown again.
    terminal.expect("^C");
    terminal.expect("\r\x1b[K");
    terminal.expectScreen("how much was sent", [](const auto& lines) { return percentOf(lines.back()) > 0; });
    terminal.type("\x03");
    EXPECT_EQ(terminal.exitCode(), 6);
    EXPECT_THAT(terminal.lines(),
                ElementsAre("krutil: cancelled; the connection was closed, which ends the session", at));
}

}  // namespace
}  // namespace krutil_client
