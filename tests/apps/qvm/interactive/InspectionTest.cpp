// What a client asks about code: signature and documentation of a name, and whether the code is complete.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "apps/qvm/calls/CallFixture.hpp"
#include "apps/qvm/fixture/EngineFixture.hpp"
#include "apps/qvm/interactive/HostileClasses.hpp"
#include "msg_svc/protobuf/ustring.hpp"

namespace qvm_test {
namespace {

using namespace krutil::cmddistributor::WhenToDequeue;
using capabilities::Capability;
using cmddistributor::DebugLoopEvent;
using msg_svc::protobuf::ustring_to_utf8;
using msg_svc::protobuf::utf8_to_ustring;
using testing::StartsWith;

class InspectionTest : public testing::Test {
  protected:
    InspectionTest() { promptly_.mode = DEQUEUE_AT_PPE; }

    EngineClient& client() { return engine_.client; }

    std::vector<std::string> ask(const std::string& function, std::vector<Array> arguments, unsigned long wanted) {
        const auto request = callOf(function, std::move(arguments), wanted);
        std::vector<std::string> texts;
        for (const Array& output : outputsOf(client().await(client().enqueue(request, promptly_)))) {
            texts.push_back(ustring_to_utf8(output.toText()));
        }
        texts.resize(wanted);
        return texts;
    }

    std::string inspectAt(const std::string& code, std::int64_t cursor) {
        return ask("qvm.inspect", {text(utf8_to_ustring(code)), ArrayFactory().createScalar(cursor)}, 1)[0];
    }

    std::string inspect(const std::string& code) { return inspectAt(code, static_cast<std::int64_t>(code.size())); }

    // State and indentation.
    std::string complete(const std::string& code) {
        const std::vector<std::string> answer = ask("qvm.is_complete", {text(utf8_to_ustring(code))}, 2);
        return answer[0] + ":" + answer[1];
    }

    void run(const std::string& code) { EXPECT_EQ(client().eval(code).errorText(), ""); }

    EvalOptions promptly_;
    EngineSession engine_{{}, {}, {Capability::InteractiveCommandLine, Capability::Debugging}};
};

TEST_F(InspectionTest, SignatureAndDocumentationOfFunctions) {
    run("def f(first, /, second, *rest, third=3, **more):\n"
        "    '''What it does.\n\n       In words.\n    '''\n"
        "def g(a, *, b='text', c=f, d=None): pass\n");
    EXPECT_EQ(inspect("f"), "f(first, /, second, *rest, third=3, **more)\n\nWhat it does.\n\nIn words.");
    EXPECT_EQ(inspect("print(g"), "g(a, *, b='text', c=..., d=None)");
    EXPECT_EQ(inspect("len"), "len(obj, /)\n\nReturn the number of items in a container.");
    EXPECT_EQ(inspect("g(f(1), [2], "), inspect("g"));
    EXPECT_EQ(inspectAt("len(g)", 1), inspect("len"));
    EXPECT_EQ(inspectAt("len(g)", 4), inspect("g"));
}

TEST_F(InspectionTest, ClassesMethodsModulesAndValues) {
    run("import colorsys\n"
        "class Thing:\n"
        "    'A thing.'\n"
        "    def __init__(self, size=1): pass\n"
        "    def method(self, value, other=2): 'Acts.'\n"
        "thing = Thing()\nnumber = 5");
    EXPECT_EQ(inspect("Thing"), "Thing(size=1)\n\nA thing.");
    EXPECT_EQ(inspect("thing.method"), "method(value, other=2)\n\nActs.");
    EXPECT_EQ(inspect("Thing.method"), "method(self, value, other=2)\n\nActs.");
    EXPECT_EQ(inspect("thing"), "thing: Thing\n\nA thing.");
    EXPECT_THAT(inspect("number"), StartsWith("number: int\n\nint([x]) -> integer"));
    EXPECT_THAT(inspect("colorsys"), StartsWith("colorsys: module\n\nConversion functions between RGB"));
    EXPECT_EQ(inspect("'x'.upper"), "upper()\n\nReturn a copy of the string converted to uppercase.");
}

TEST_F(InspectionTest, NothingIsKnownOfOtherPlaces) {
    for (const char* const code : {"", "unknown", "len + ", "# len", "'len", "1", "len()."}) {
        EXPECT_EQ(inspect(code), "") << code;
    }
}

TEST_F(InspectionTest, AtADebugPromptNamesAreThoseOfTheStoppedFrame) {
    const IDType stopped = client().enqueue("def f(local):\n    breakpoint()\nf(lambda x, y: 0)");
    client().awaitLoop(stopped, DebugLoopEvent::ENTER);
    EXPECT_EQ(inspect("local"), "local(x, y)");
    client().eval("import qvm; qvm.dbquit()", promptly_);
    client().await(stopped);
    EXPECT_EQ(inspect("local"), "");
}

TEST_F(InspectionTest, NothingOfTheUsersRuns) {
    run(hostileClasses);
    run("def defaults(a=thing, *, b=text, c=row): pass");
    for (const char* const code : {"thing",        "thing.own",
                                   "thing.prop",   "thing.descriptor",
                                   "thing.bound",  "thing.method",
                                   "thing(",       "Hostile",
                                   "Hostile(",     "Hostile.bound",
                                   "Meta",         "Meta(",
                                   "mapping",      "row",
                                   "text",         "inner",
                                   "inner['key']", "inner['other']",
                                   "wrapped",      "wrapped(",
                                   "shadowed",     "shadowed(",
                                   "Shadowed",     "plain",
                                   "defaults"}) {
        inspect(code);
        EXPECT_EQ(client().eval("list.__repr__(ran)").shown(), "'[]'\n") << code;
        run("ran.clear()");
    }
    EXPECT_EQ(inspect("defaults"), "defaults(a=..., *, b=..., c=...)");
}

TEST_F(InspectionTest, CodeIsCompleteIncompleteOrInvalid) {
    for (const char* const code : {"", "  ", "# words", "x", "x = 1", "x = (1\n)", "if x:\n    y\n", "await x",
                                   "class A: pass", "if x:\n    y\nz", "def f():\n    if x:\n        y\n    "}) {
        EXPECT_EQ(complete(code), "complete:") << code;
    }
    EXPECT_EQ(complete("if x:"), "incomplete:    ");
    EXPECT_EQ(complete("if x:\n    y"), "incomplete:    ");
    EXPECT_EQ(complete("if x:\n    for y in z:  # each"), "incomplete:        ");
    EXPECT_EQ(complete("def f():\n    if x:\n        return 1"), "incomplete:    ");
    EXPECT_EQ(complete("x = f("), "incomplete:    ");
    EXPECT_EQ(complete("x = f(1,\n      2,"), "incomplete:      ");
    // A statement of several lines is as deep as its first one.
    EXPECT_EQ(complete("def f():\n    '''Doc.\n\nMore.'''"), "incomplete:    ");
    EXPECT_EQ(complete("def f():\n    x = g(1,\n          2)"), "incomplete:    ");
    EXPECT_EQ(complete("def f():\n    if (x and\n            y):\n"), "incomplete:        ");
    EXPECT_EQ(complete("if x:\n    return (1,\n            2)"), "incomplete:");
    EXPECT_EQ(complete("if x:\n    y\n# why\n    z"), "incomplete:    ");
    EXPECT_EQ(complete("x = '''text"), "incomplete:");
    EXPECT_EQ(complete("x = \\"), "incomplete:");
    EXPECT_EQ(complete("@decorator"), "incomplete:");
    for (const char* const code : {"1 +", "x = 'text", "x)", "import", "if x:\ny"}) {
        EXPECT_EQ(complete(code), "invalid:") << code;
    }
    EXPECT_EQ(complete(std::string("x\0y", 3)), "invalid:");
    EXPECT_EQ(ask("qvm.is_complete", {text(u"if x:")}, 1)[0], "incomplete");
}

TEST_F(InspectionTest, ExamplesInTheDocumentationHold) {
    EXPECT_EQ(client()
                  .eval("import doctest, qvm, sys\n"
                        "sys.__displayhook__ = lambda value: value is None or print(repr(value))\n"
                        "for each in qvm.complete, qvm.inspect, qvm.is_complete:\n"
                        "    doctest.run_docstring_examples(each, {'qvm': qvm})")
                  .output(),
              "");
}

TEST_F(InspectionTest, WhetherCodeIsCompleteIsToldWithoutAWarning) {
    run("import warnings; before = warnings.filters[:]; warnings.simplefilter('error')");
    EXPECT_EQ(complete("'\\d' is 1"), "complete:");
    EXPECT_EQ(client().eval("warnings.filters[1:] == before").shown(), "True\n");
}

}  // namespace
}  // namespace qvm_test
