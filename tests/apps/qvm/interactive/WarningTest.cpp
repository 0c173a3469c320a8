// Warnings of running code as events.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>

#include "apps/qvm/fixture/EngineFixture.hpp"
#include "korvel/lang/diagnostic/IssuedEnabledWarningEvent.hpp"
#include "korvel/lang/diagnostic/IssuedWarningEvent.hpp"

namespace qvm_test {
namespace {

using korvel::lang::PrintfArgument;
using korvel::lang::StackFrame;
using korvel::lang::diagnostic::IssuedEnabledWarningEvent;
using korvel::lang::diagnostic::IssuedWarningEvent;
using korvel::lang::diagnostic::Warning;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::SizeIs;

template <class EventT>
std::vector<Warning> warningsIn(const std::vector<Happening>& events) {
    std::vector<Warning> warnings;
    for (const Happening& each : events) {
        if (const auto* const event = dynamic_cast<const EventT*>(each.event.get())) {
            warnings.push_back(event->getWarning());
        }
    }
    return warnings;
}

class EngineWarningTest : public testing::Test {
  protected:
    EngineClient& client() { return engine_.client; }

    Evaluation eval(const std::string& code) {
        Evaluation result = client().eval("import warnings, qvm\n" + code);
        EXPECT_FALSE(result.error) << result.errorText();
        EXPECT_EQ(result.errors(), "");
        return result;
    }

    // The one warning of a request, which must be shown.
    Warning shown(const std::string& code) {
        const Evaluation result = eval(code);
        EXPECT_THAT(result.kinds(), ElementsAre("IIPStartedEvent", "IssuedWarningEvent", "IssuedEnabledWarningEvent",
                                                "IIPCompletedEvent", "LastIIPEvent"));
        const std::vector<Warning> issued = warningsIn<IssuedWarningEvent>(result.events);
        const std::vector<Warning> enabled = warningsIn<IssuedEnabledWarningEvent>(result.events);
        if (issued.size() != 1 || enabled.size() != 1) {
            throw std::runtime_error("one warning was expected");
        }
        EXPECT_EQ(issued.front(), enabled.front());
        EXPECT_FALSE(issued.front().getWasDisabled());
        return issued.front();
    }

    // The one warning of a request, which must be hidden.
    Warning hidden(const std::string& code) {
        const Evaluation result = eval(code);
        EXPECT_THAT(warningsIn<IssuedEnabledWarningEvent>(result.events), IsEmpty());
        const std::vector<Warning> issued = warningsIn<IssuedWarningEvent>(result.events);
        if (issued.size() != 1) {
            throw std::runtime_error("one warning was expected");
        }
        EXPECT_TRUE(issued.front().getWasDisabled());
        return issued.front();
    }

    EngineSession engine_;
};

TEST_F(EngineWarningTest, CarriesItsCategoryTextStackAndTime) {
    const auto now = [] {
        return 719529.0 +
               std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count() / 86400;
    };
    const double before = now();
    const Warning warning = shown("def f():\n    warnings.warn('careful: \u00e9 100%')\nf()\nNone");
    EXPECT_EQ(warning.getIdentifier(), "UserWarning");
    EXPECT_EQ(warning.getFormat(), u"careful: \u00e9 100%");
    EXPECT_EQ(warning.getMessage(), u"careful: \u00e9 100%");
    EXPECT_THAT(warning.getArguments(), IsEmpty());
    EXPECT_THAT(warning.getStack(),
                ElementsAre(StackFrame(u"<eval-1>", u"<module>", 4), StackFrame(u"<eval-1>", u"f", 3)));
    EXPECT_GE(warning.getTime(), before - 1e-6);
    EXPECT_LE(warning.getTime(), now() + 1e-6);
}

TEST_F(EngineWarningTest, StackEndsAtThePlaceThatTheWarningIsAbout) {
    EXPECT_THAT(shown("def f():\n    warnings.warn('x', stacklevel=2)\nf()\nNone").getStack(),
                ElementsAre(StackFrame(u"<eval-1>", u"<module>", 4)));
    EXPECT_THAT(shown("warnings.warn_explicit('x', UserWarning, 'file.py', 7)\nNone").getStack(),
                ElementsAre(StackFrame(u"<eval-2>", u"<module>", 2), StackFrame(u"file.py", u"", 7)));
}

TEST_F(EngineWarningTest, IdentifierNamesTheModuleOfACategory) {
    EXPECT_EQ(shown("class Own(UserWarning): pass\nwarnings.warn('x', Own)").getIdentifier(), "__main__.Own");
    EXPECT_EQ(shown("warnings.warn(Own('y'))").getIdentifier(), "__main__.Own");
    EXPECT_EQ(shown("warnings.warn('x', RuntimeWarning)").getIdentifier(), "RuntimeWarning");
}

TEST_F(EngineWarningTest, HiddenOnesAreToldApart) {
    EXPECT_EQ(
        hidden("warnings.simplefilter('ignore', BytesWarning)\nwarnings.warn('quiet', BytesWarning)").getMessage(),
        u"quiet");
    EXPECT_EQ(hidden("warnings.warn('later', PendingDeprecationWarning)").getIdentifier(), "PendingDeprecationWarning");
}

TEST_F(EngineWarningTest, RepeatsInOneRequestAreHiddenAndInTheNextShown) {
    for (int i = 0; i < 2; ++i) {
        const Evaluation result = eval("for i in range(3): warnings.warn('again')");
        EXPECT_THAT(warningsIn<IssuedWarningEvent>(result.events), SizeIs(3));
        EXPECT_THAT(warningsIn<IssuedEnabledWarningEvent>(result.events), SizeIs(1));
    }
}

TEST_F(EngineWarningTest, CodeThatTakesAWarningKeepsItFromTheClient) {
    EXPECT_EQ(hidden("with warnings.catch_warnings(record=True) as taken:\n    warnings.warn('taken')\n"
                     "assert len(taken) == 1")
                  .getMessage(),
              u"taken");
}

TEST_F(EngineWarningTest, WarningTurnedIntoAnErrorIsNone) {
    const Evaluation result = client().eval(
        "import warnings\nwith warnings.catch_warnings():\n    warnings.simplefilter('error')\n    "
        "warnings.warn('now')");
    EXPECT_EQ(result.errorId(), "UserWarning");
    EXPECT_THAT(warningsIn<IssuedWarningEvent>(result.events), IsEmpty());
    ASSERT_TRUE(result.error);
    EXPECT_THAT(result.error->getStackFrames(), SizeIs(1));
}

TEST_F(EngineWarningTest, WarningsOfCCodeAreShownWhereTheyArise) {
    const Warning division = shown("import numpy\nnumpy.array([1.0]) / 0\nNone");
    EXPECT_EQ(division.getIdentifier(), "RuntimeWarning");
    EXPECT_EQ(division.getMessage(), u"divide by zero encountered in divide");
    EXPECT_THAT(division.getStack(), ElementsAre(StackFrame(u"<eval-1>", u"<module>", 3)));
    const Warning syntax = shown("1 is 1\nNone");
    EXPECT_EQ(syntax.getIdentifier(), "SyntaxWarning");
    EXPECT_THAT(syntax.getStack(), ElementsAre(StackFrame(u"<eval-2>", u"", 2)));
}

TEST_F(EngineWarningTest, OwnWarningCarriesArgumentsOfTheirTypes) {
    const Warning warning =
        shown("qvm.warning('a:b', '%d %d %d %d %s %.1f %s', 7, 2**31, -2**63, 2**64 - 1, 'text', 2.5, True)");
    EXPECT_EQ(warning.getIdentifier(), "a:b");
    EXPECT_EQ(warning.getFormat(), u"%d %d %d %d %s %.1f %s");
    EXPECT_EQ(warning.getMessage(), u"7 2147483648 -9223372036854775808 18446744073709551615 text 2.5 True");
    std::vector<int> types;
    for (const PrintfArgument& each : warning.getArguments()) {
        types.push_back(each.getValue().which());
    }
    EXPECT_THAT(types, ElementsAre(0, 2, 2, 3, 5, 4, 0));
    EXPECT_EQ(warning.getArguments()[1], PrintfArgument(2147483648L));
    EXPECT_EQ(warning.getArguments()[3], PrintfArgument(18446744073709551615UL));
    EXPECT_THAT(warning.getStack(), ElementsAre(StackFrame(u"<eval-1>", u"<module>", 2)));
    EXPECT_EQ(shown("qvm.warning('c', '%s', 2**70)").getArguments().front(),
              PrintfArgument(std::u16string(u"1180591620717411303424")));
    EXPECT_EQ(shown("qvm.warning('c', '100%')").getMessage(), u"100%");
}

TEST_F(EngineWarningTest, TextAndWarningsKeepTheirOrder) {
    const Evaluation result = eval("print('a', end='')\nqvm.warning('w', 'x')\nprint('b', end='')");
    EXPECT_THAT(result.kinds(),
                ElementsAre("IIPStartedEvent", "TextBaseEvent", "IssuedWarningEvent", "IssuedEnabledWarningEvent",
                            "TextBaseEvent", "IIPCompletedEvent", "LastIIPEvent"));
}

TEST_F(EngineWarningTest, WarningOfAThreadBelongsToNoRequest) {
    const Evaluation result = eval(
        "import threading\nt = threading.Thread(target=lambda: qvm.warning('t', 'of a thread'))\nt.start()\nt.join()");
    EXPECT_THAT(warningsIn<IssuedWarningEvent>(result.events), IsEmpty());
    client().eval("None");
    EXPECT_THAT(warningsIn<IssuedWarningEvent>(client().background()), SizeIs(1));
}

TEST(WarningLimitTest, WarningThatTheClientCannotTakeIsShortened) {
    session::Limits limits;
    limits.taggedFrame = 16'384;
    EngineSession engine({}, limits);
    const Evaluation result = engine.client.eval("import warnings\nwarnings.warn('x' * 100000)\nprint('on')");
    EXPECT_FALSE(result.error);
    EXPECT_EQ(result.output(), "on\n");
    const std::vector<Warning> issued = warningsIn<IssuedWarningEvent>(result.events);
    ASSERT_THAT(issued, SizeIs(1));
    EXPECT_EQ(issued.front().getMessage(), std::u16string(1024, u'x') + u"...");
    EXPECT_THAT(warningsIn<IssuedEnabledWarningEvent>(result.events), SizeIs(1));
}

}  // namespace
}  // namespace qvm_test
