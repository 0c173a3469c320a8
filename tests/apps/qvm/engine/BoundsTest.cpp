// The numbers of docs/protocol.md under "What is cut".
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "apps/qvm/fixture/EngineFixture.hpp"
#include "korvel/lang/diagnostic/IssuedWarningEvent.hpp"
#include "krutil/io/PrintableErrorEvent.hpp"
#include "msg_svc/protobuf/ustring.hpp"

namespace qvm_test {
namespace {

using korvel::lang::diagnostic::IssuedWarningEvent;
using krutil::io::PrintableErrorEvent;

constexpr char restLeftOut[] = "\n... (the rest is left out)\n";

session::Limits withTaggedFrame(std::uint64_t bytes) {
    session::Limits limits;
    limits.taggedFrame = bytes;
    return limits;
}

// Bytes of each text event.
std::vector<std::size_t> sizesOf(const Evaluation& result, const std::string& kind) {
    std::vector<std::size_t> sizes;
    for (const Happening& each : result.events) {
        if (each.kind == kind) {
            sizes.push_back(each.text.size());
        }
    }
    return sizes;
}

TEST(EngineBoundsTest, TextEventHolds32768UnitsOrAnEighthOfTheLimit) {
    // 16,384 characters of two UTF-16 units and four bytes each.
    const std::string code = "import sys\nsys.stdout.write('\\U0001F600' * 16384)\nNone";
    EngineSession engine;
    EXPECT_THAT(sizesOf(engine.client.eval(code), "TextBaseEvent"), testing::ElementsAre(4U * 16'384U));
    EngineSession narrow({}, withTaggedFrame(4096));
    EXPECT_EQ(sizesOf(narrow.client.eval(code), "TextBaseEvent"), std::vector<std::size_t>(64, 4U * 256U));
    EngineSession narrowest({}, withTaggedFrame(100));
    EXPECT_THAT(sizesOf(narrowest.client.eval("'abcdefghijklmnopqrstuvwxyz'"), "SinkTextEvent"),
                testing::ElementsAre(16U, 13U));
}

TEST(EngineBoundsTest, PrintedErrorHolds262144CharactersOrASixteenthOfTheLimit) {
    const std::string code = "raise ValueError('x' * 1_000_000)";
    const auto printed = [&code](EngineSession& engine) {
        for (const Happening& each : engine.client.eval(code).events) {
            if (const auto* const event = dynamic_cast<const PrintableErrorEvent*>(each.event.get())) {
                return msg_svc::protobuf::ustring_to_utf8(event->getText());
            }
        }
        return std::string();
    };
    EngineSession engine;
    EXPECT_EQ(printed(engine).size(), 262'144U + sizeof(restLeftOut) - 1);
    EngineSession narrow({}, withTaggedFrame(8192));
    const std::string text = printed(narrow);
    EXPECT_EQ(text.size(), 512U + sizeof(restLeftOut) - 1);
    EXPECT_THAT(text, testing::EndsWith(restLeftOut));
}

TEST(EngineBoundsTest, NameInAnErrorHolds1024Bytes) {
    EngineSession engine;
    EXPECT_EQ(engine.client.eval("raise type('T' * 5000, (Exception,), {})").errorId(),
              "__main__." + std::string(1024, 'T') + "... (3976 more characters)");
}

TEST(EngineBoundsTest, StackOfAWarningHolds200Frames) {
    EngineSession engine;
    const Evaluation result = engine.client.eval(
        "import qvm\n"
        "def f(n):\n"
        "    if n == 0: qvm.warning('a', 'b')\n"
        "    else: f(n - 1)\n"
        "f(300)");
    for (const Happening& each : result.events) {
        if (const auto* const event = dynamic_cast<const IssuedWarningEvent*>(each.event.get())) {
            const auto& stack = event->getWarning().getStack();
            ASSERT_EQ(stack.size(), 200U);
            EXPECT_EQ(stack.front().line, 4U);
            EXPECT_EQ(stack.back().line, 3U);
            return;
        }
    }
    ADD_FAILURE() << "no warning";
}

}  // namespace
}  // namespace qvm_test
