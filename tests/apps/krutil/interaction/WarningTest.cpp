// Warnings and errors to print, as both printers show them.

#include <gtest/gtest.h>

#include <limits>
#include <nlohmann/json.hpp>

#include "apps/krutil/CaughtOutput.hpp"
#include "cmddistributor/DebugLoopEvent.hpp"
#include "korvel/lang/diagnostic/IssuedEnabledWarningEvent.hpp"
#include "korvel/lang/diagnostic/IssuedWarningEvent.hpp"
#include "krutil/display/JsonPrinter.hpp"
#include "krutil/display/PersonPrinter.hpp"
#include "krutil/display/WarningText.hpp"
#include "krutil/io/PrintableErrorEvent.hpp"

namespace krutil_client {
namespace {

using cmddistributor::DebugLoopEvent;
using foundation::msg_svc::exchange::IDType;
using korvel::lang::PrintfArgument;
using korvel::lang::diagnostic::IssuedEnabledWarningEvent;
using korvel::lang::diagnostic::IssuedWarningEvent;
using korvel::lang::diagnostic::Warning;

const IDType request(1, 2);
const std::string requestText = "00000000000000010000000000000002";

Warning warning() {
    return {"UserWarning",
            u"%d \u00e4",
            {PrintfArgument(-3), PrintfArgument(std::numeric_limits<unsigned long>::max()), PrintfArgument(0.5),
             PrintfArgument(std::u16string(u"t\u00e4"))},
            u"no \u00e4 good",
            {{u"<eval-1>", u"<module>", 3}, {u"a.py", u"", 7}},
            true,
            738'000.25};
}

cmddistributor::RuntimeException error(krutil::cmddistributor::inExecutionStatus status) {
    return {status, u"no good", "ValueError", "", {}, {}, false};
}

TEST(WarningTextTest, TheStackIsShownOnRequest) {
    EXPECT_EQ(warningText(warning(), false), "Warning: no \u00e4 good (UserWarning)\n");
    EXPECT_EQ(warningText(warning(), true),
              "Warning: no \u00e4 good (UserWarning)\n"
              "  In \"<eval-1>\", line 3, in <module>\n"
              "  In \"a.py\", line 7\n");
}

TEST(WarningTextTest, WithoutAnIdentifierThereIsNone) {
    EXPECT_EQ(warningText(Warning("", u"", {}, u"x", {}, false, 0), true), "Warning: x\n");
}

using ClientWarningTest = PrinterFixture;

TEST_F(ClientWarningTest, APersonSeesAWarningOnceAndHiddenOnesNever) {
    PersonPrinter printer(out, err, {});
    printer.subscribe(events);
    publish<IssuedWarningEvent>(request, warning());
    publish<IssuedWarningEvent>(request, warning());
    publish<IssuedEnabledWarningEvent>(request, warning());
    EXPECT_EQ(outPipe.content(), "");
    EXPECT_EQ(errPipe.content(), "Warning: no \u00e4 good (UserWarning)\n");
}

TEST_F(ClientWarningTest, APersonSeesAnErrorAsTheEnginePrintsItAndOnlyOnce) {
    PersonPrinter printer(out, err, {});
    printer.subscribe(events);
    const auto raised = error(krutil::cmddistributor::inRUNTIME_ERROR);
    publish<krutil::io::PrintableErrorEvent>(request, raised, u"Traceback \u00e4\n");
    printer.replied({request, &raised, true});
    EXPECT_EQ(errPipe.content(), "Traceback \u00e4\n");
}

TEST_F(ClientWarningTest, CancelsAndTheDebuggersQuitAreOneLine) {
    PersonPrinter printer(out, err, {});
    const auto cancelled = error(krutil::cmddistributor::inEXECUTION_CTRLC);
    const auto quit = error(krutil::cmddistributor::inEXECUTION_DBQUIT);
    printer.replied({request, &cancelled});
    printer.replied({request, &quit});
    EXPECT_EQ(errPipe.content(), "krutil: cancelled\nkrutil: the debugger was left with quit\n");
}

TEST_F(ClientWarningTest, JsonHasBothEventsOfAWarning) {
    JsonPrinter printer(out);
    printer.subscribe(events);
    publish<IssuedWarningEvent>(request, warning());
    publish<IssuedEnabledWarningEvent>(request, warning());
    const auto expected = [](const std::string& shown) {
        return R"({"event":"warning","request":")" + requestText + R"(","shown":)" + shown +
               ",\"id\":\"UserWarning\",\"message\":\"no \u00e4 good\",\"format\":\"%d \u00e4\","
               "\"arguments\":[-3,18446744073709551615,0.5,\"t\u00e4\"],"
               R"("stack":[{"file":"<eval-1>","function":"<module>","line":3},{"file":"a.py","function":"","line":7}],)"
               R"("hidden":true,"time":738000.25})"
               "\n";
    };
    EXPECT_EQ(outPipe.content(), expected("false") + expected("true"));
}

TEST_F(ClientWarningTest, JsonHasErrorsToPrintAndLoops) {
    JsonPrinter printer(out);
    printer.subscribe(events);
    publish<krutil::io::PrintableErrorEvent>(request, error(krutil::cmddistributor::inRUNTIME_ERROR), u"text\n");
    publish<DebugLoopEvent>(request, DebugLoopEvent::ENTER, krutil::prompt::InputRequester::mnDEBUG_PROMPT);
    publish<DebugLoopEvent>(request, DebugLoopEvent::EXIT, krutil::prompt::InputRequester::mnINPUT_PROMPT);
    EXPECT_EQ(outPipe.content(), R"({"event":"error","request":")" + requestText +
                                     R"(","text":"text\n","error":{"status":"runtime error",)"
                                     R"("id":"ValueError","message":"no good","function":"","frames":[],"causes":[]}})"
                                     "\n"
                                     R"({"event":"loop","request":")" +
                                     requestText +
                                     R"(","state":"enter","loop":"debug"})"
                                     "\n"
                                     R"({"event":"loop","request":")" +
                                     requestText +
                                     R"(","state":"exit","loop":"input"})"
                                     "\n");
}

}  // namespace
}  // namespace krutil_client
