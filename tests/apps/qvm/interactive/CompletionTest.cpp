// Completion of code, as clients ask the engine for it.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <fstream>
#include <string>
#include <tuple>
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
using testing::Contains;
using testing::ElementsAre;
using testing::IsSupersetOf;
using testing::Not;
using testing::UnorderedElementsAre;

// What the engine answers.
struct Completion {
    std::int64_t begin = -1;
    std::int64_t end = -1;
    std::vector<std::string> candidates{};
};

EvalOptions at(WhenToDequeue mode) {
    EvalOptions options;
    options.mode = mode;
    return options;
}

std::int64_t integerOf(const Array& array) {
    EXPECT_EQ(array.elementType(), ElementType::Int64);
    EXPECT_TRUE(array.dimensions().empty());
    std::int64_t value = -1;
    std::copy_n(array.data(), sizeof(value), reinterpret_cast<char*>(&value));
    return value;
}

class CompletionTest : public testing::Test {
  protected:
    EngineClient& client() { return engine_.client; }

    Completion completeAt(const std::string& code, std::int64_t cursor) {
        const auto request =
            callOf("qvm.complete", {text(utf8_to_ustring(code)), ArrayFactory().createScalar(cursor)}, 3);
        const Evaluation answer = client().await(client().enqueue(request, at(DEQUEUE_AT_PPE)));
        EXPECT_THAT(answer.kinds(), ElementsAre("IIPStartedEvent", "IIPCompletedEvent", "LastIIPEvent"));
        const std::vector<Array> outputs = outputsOf(answer);
        if (outputs.size() != 3) {
            return {};
        }
        Completion result{integerOf(outputs[0]), integerOf(outputs[1])};
        const std::string lines = ustring_to_utf8(outputs[2].toText());
        for (std::size_t begin = 0; !lines.empty() && begin <= lines.size();) {
            const std::size_t end = std::min(lines.find('\n', begin), lines.size());
            result.candidates.push_back(lines.substr(begin, end - begin));
            begin = end + 1;
        }
        return result;
    }

    // At the end of the code.
    Completion complete(const std::string& code) {
        return completeAt(code, static_cast<std::int64_t>(utf8_to_ustring(code).size()));
    }

    std::vector<std::string> candidates(const std::string& code) { return complete(code).candidates; }

    void run(const std::string& code) { EXPECT_EQ(client().eval(code).errorText(), ""); }
    std::string value(const std::string& expression) { return client().eval(expression).shown(); }

    EngineSession engine_{{}, {}, {Capability::InteractiveCommandLine, Capability::Debugging}};
};

TEST_F(CompletionTest, NamesOfTheSessionBuiltinsAndKeywords) {
    run("variable = 1");
    const Completion answer = complete("print(vari");
    EXPECT_EQ(std::tie(answer.begin, answer.end), std::make_tuple(6, 10));
    EXPECT_THAT(answer.candidates, ElementsAre("variable"));
    EXPECT_THAT(candidates("enum"), ElementsAre("enumerate"));
    EXPECT_THAT(candidates("nonl"), ElementsAre("nonlocal"));
    EXPECT_THAT(candidates("x = "), Contains("variable"));
    EXPECT_THAT(candidates("x = "), Not(Contains("__name__")));
    EXPECT_THAT(candidates("__na"), ElementsAre("__name__"));
    EXPECT_THAT(candidates("if x:\n    "), ElementsAre());
}

TEST_F(CompletionTest, PlacesAreCountedInCharacters) {
    run("größe = 1");
    const Completion answer = completeAt("'\U0001F600', grö + 1", 8);
    EXPECT_EQ(std::tie(answer.begin, answer.end), std::make_tuple(5, 8));
    EXPECT_THAT(answer.candidates, ElementsAre("größe"));
    EXPECT_EQ(completeAt("abc", -5).end, 0);
    EXPECT_EQ(completeAt("abc", 500).end, 3);
}

TEST_F(CompletionTest, AttributesOfInstancesClassesAndModules) {
    run("import os\n"
        "class Base:\n    inherited = 1\n"
        "class Thing(Base):\n"
        "    __slots__ = 'slot',\n"
        "    def method(self): pass\n"
        "    @property\n    def prop(self): raise SystemExit\n"
        "thing = Thing()\nthing.own = thing\nthing.slot = 'text'");
    EXPECT_THAT(candidates("thing."), ElementsAre("inherited", "method", "own", "prop", "slot"));
    EXPECT_THAT(candidates("thing.own.own.me"), ElementsAre("method"));
    EXPECT_THAT(candidates("thing.slot.isal"), ElementsAre("isalnum", "isalpha"));
    EXPECT_THAT(candidates("Thing.inh"), ElementsAre("inherited"));
    EXPECT_THAT(candidates("os.path.exi"), ElementsAre("exists"));
    EXPECT_THAT(candidates("'text'.upp"), ElementsAre("upper"));
    // What a property or a call would give is not known.
    EXPECT_THAT(candidates("thing.prop."), ElementsAre());
    EXPECT_THAT(candidates("str(1)."), ElementsAre());
}

TEST_F(CompletionTest, LiteralKeysOfDictsListsAndTuples) {
    run("d = {'alpha': [{'inner': 1}], 'al': 2, 3: 4, ('t',): 5}\nt = (d, 'x')");
    EXPECT_THAT(candidates("d["), UnorderedElementsAre("'alpha'", "'al'", "3"));
    EXPECT_THAT(candidates("d[\"alp"), ElementsAre("\"alpha\""));
    EXPECT_THAT(candidates("d['alpha'][0]['"), ElementsAre("'inner'"));
    EXPECT_THAT(candidates("t["), ElementsAre("0", "1"));
    EXPECT_THAT(candidates("t[-1].upp"), ElementsAre("upper"));
    const Completion closed = completeAt("d['alp']", 6);
    EXPECT_EQ(std::tie(closed.begin, closed.end), std::make_tuple(2, 7));
    EXPECT_THAT(closed.candidates, ElementsAre("'alpha'"));
}

TEST_F(CompletionTest, ParametersOfFunctions) {
    run("import functools\n"
        "def f(first, /, second, *rest, third=3): pass\n"
        "@functools.wraps(f)\ndef wrapping(*arguments): pass\n"
        "class Thing:\n"
        "    def __init__(self, size): pass\n"
        "    def method(self, value): pass\n"
        "    def __call__(self, depth): pass\n"
        "thing = Thing(1)");
    EXPECT_THAT(candidates("f("), ElementsAre("second=", "third="));
    EXPECT_THAT(candidates("f(g(1), [2], thi"), ElementsAre("third=", "thing"));
    EXPECT_THAT(candidates("wrapping(sec"), ElementsAre("second="));
    EXPECT_THAT(candidates("Thing("), ElementsAre("size="));
    EXPECT_THAT(candidates("thing.method("), ElementsAre("value="));
    EXPECT_THAT(candidates("Thing.method("), ElementsAre("self=", "value="));
    EXPECT_THAT(candidates("thing("), ElementsAre("depth="));
    // Functions and classes of C, as far as they state their parameters.
    EXPECT_THAT(candidates("sorted([], "), ElementsAre("key=", "reverse="));
    EXPECT_THAT(candidates("'text'.split(max"), ElementsAre("maxsplit=", "max"));
    EXPECT_THAT(candidates("open('f', err"), ElementsAre("errors="));
    EXPECT_THAT(candidates("print(1, end"), ElementsAre("end="));
    EXPECT_THAT(candidates("enumerate([], star"), ElementsAre("start="));
    EXPECT_THAT(candidates("len(ob"), ElementsAre("object"));
    EXPECT_THAT(candidates("max(default"), ElementsAre());
}

TEST_F(CompletionTest, ModulesAndWhatTheyDefineBehindImport) {
    run("import sys\nbefore = set(sys.modules)");
    EXPECT_THAT(candidates("import colors"), ElementsAre("colorsys"));
    EXPECT_THAT(candidates("import os, sys, itert"), ElementsAre("itertools"));
    EXPECT_THAT(candidates("import os.pa"), ElementsAre("path"));
    EXPECT_THAT(candidates("from xml.et"), ElementsAre("etree"));
    EXPECT_THAT(candidates("from xml.etree import ElementT"), ElementsAre("ElementTree"));
    EXPECT_THAT(candidates("from os import getpi"), ElementsAre("getpid"));
    // A name of the module and a module of its own, once.
    EXPECT_THAT(candidates("from os import path"), ElementsAre("path", "pathconf", "pathconf_names", "pathsep"));
    EXPECT_THAT(candidates("import os as o"), ElementsAre());
    EXPECT_EQ(value("[name for name in set(sys.modules) - before if name[:3] in ('col', 'ite', 'xml', 'num')]"),
              "[]\n");
}

TEST_F(CompletionTest, FilesInTexts) {
    const test_support::TemporaryDirectory directory;
    std::ofstream(directory.file("data.csv")).put('x');
    std::ofstream(directory.file("don't")).put('x');
    std::ofstream(directory.file(".hidden")).put('x');
    run("import os; os.mkdir('" + directory.file("deep") + "')");
    const std::string code = "open('" + directory.file("d");
    const Completion answer = complete(code);
    EXPECT_EQ(answer.begin, static_cast<std::int64_t>(code.size()) - 1);
    EXPECT_THAT(answer.candidates, ElementsAre("data.csv", "deep/"));
    EXPECT_THAT(candidates("open('" + directory.file("")), ElementsAre("data.csv", "deep/"));
    EXPECT_THAT(candidates("open('" + directory.file("none/")), ElementsAre());
    EXPECT_THAT(candidates("x = 1  # d"), ElementsAre());
}

TEST_F(CompletionTest, ArraysAreAskedBecauseTheirCodeIsNumPys) {
    run("import numpy\n"
        "a = numpy.zeros(2, [('real', 'f4'), ('imaginary', 'f4')])\n"
        "class Mine(numpy.ndarray):\n    @property\n    def T(self): raise SystemExit\n"
        "mine = a.view(Mine)");
    EXPECT_THAT(candidates("a['"), ElementsAre("'real'", "'imaginary'"));
    EXPECT_THAT(candidates("a.T.dty"), ElementsAre("dtype"));
    EXPECT_THAT(candidates("mine.T."), ElementsAre());
    EXPECT_THAT(candidates("mine['"), ElementsAre());
    EXPECT_THAT(candidates("numpy.linalg.svd(a, full"), ElementsAre("full_matrices="));
}

TEST_F(CompletionTest, DataFramesAreAskedForTheirColumns) {
    const test_support::TemporaryDirectory directory;
    // What pandas offers of it, for machines that do not have it.
    std::ofstream(directory.file("pandas.py")) << "import numpy\n"
                                                  "class Index:\n"
                                                  "    def __init__(self, labels): self.labels = labels\n"
                                                  "    @property\n"
                                                  "    def values(self): return numpy.array(self.labels, object)\n"
                                                  "class DataFrame:\n"
                                                  "    def __init__(self, columns): self._axis = columns\n"
                                                  "    @property\n"
                                                  "    def columns(self): return self._axis\n"
                                                  "    def describe(self): pass\n";
    run("import sys; sys.path.insert(0, '" + directory.file("") +
        "')\n"
        "import pandas\n"
        "class Mine(pandas.DataFrame):\n    @property\n    def columns(self): raise SystemExit\n"
        "class Labels(pandas.Index):\n    @property\n    def values(self): raise SystemExit\n"
        "index = pandas.Index(['depth', 'two words', '_hidden', 7, ('a', 'b')])\n"
        "df, mine, other = pandas.DataFrame(index), Mine(index), pandas.DataFrame(Labels([]))");
    EXPECT_THAT(candidates("df."), ElementsAre("columns", "depth", "describe"));
    EXPECT_THAT(candidates("df._hid"), ElementsAre("_hidden"));
    EXPECT_THAT(candidates("df['"), ElementsAre("'depth'", "'two words'", "'_hidden'"));
    // Classes of the user may do anything.
    EXPECT_THAT(candidates("mine."), ElementsAre("columns", "describe"));
    EXPECT_THAT(candidates("mine['"), ElementsAre());
    EXPECT_THAT(candidates("other."), ElementsAre("columns", "describe"));
}

TEST_F(CompletionTest, AtADebugPromptNamesAreThoseOfTheStoppedFrame) {
    run("outside = 1");
    const IDType stopped = client().enqueue("def f(local):\n    breakpoint()\nf({'key': 1})");
    client().awaitLoop(stopped, DebugLoopEvent::ENTER);
    EXPECT_THAT(candidates("loca"), IsSupersetOf({"local", "locals"}));
    EXPECT_THAT(candidates("local['"), ElementsAre("'key'"));
    EXPECT_THAT(candidates("outs"), ElementsAre("outside"));
    client().eval("import qvm; qvm.dbcont()", at(DEQUEUE_AT_PPE));
    client().await(stopped);
    EXPECT_THAT(candidates("loca"), ElementsAre("locals"));
}

TEST_F(CompletionTest, AtAPauseNamesAreThoseOfTheSession) {
    const IDType stopped = client().enqueue("def f(local):\n    import qvm; qvm.pause()\nf(1)");
    client().awaitLoop(stopped, DebugLoopEvent::ENTER);
    EXPECT_THAT(candidates("loca"), ElementsAre("locals"));
    client().eval("", at(DEQUEUE_AT_PAUSE));
    EXPECT_FALSE(client().await(stopped).error);
}

TEST_F(CompletionTest, CodeThatBindsTheNameOfTheModuleBreaksNothing) {
    run("import sys\nqvm = 5\nsys.modules['qvm'] = None\nvariable = 1");
    EXPECT_THAT(candidates("vari"), ElementsAre("variable"));
    EXPECT_THAT(candidates("qv"), ElementsAre("qvm"));
}

TEST_F(CompletionTest, NumPyIsNotImportedForIt) {
    candidates("pri");
    EXPECT_EQ(value("import sys\n'numpy' in sys.modules"), "False\n");
}

TEST_F(CompletionTest, CandidatesAreBounded) {
    run("many = {f'key{n:05}': n for n in range(5000)}\nrow = [0] * 5000\n"
        "globals().update((f'name{n:05}', n) for n in range(5000))");
    EXPECT_EQ(candidates("many['").size(), 1000U);
    EXPECT_EQ(candidates("row[").size(), 1000U);
    EXPECT_EQ(candidates("name").size(), 1000U);
    EXPECT_THAT(candidates("many['key04999"), ElementsAre("'key04999'"));
}

TEST_F(CompletionTest, NothingOfTheUsersRuns) {
    run(hostileClasses);
    for (const char* const code : {"",
                                   "x = ",
                                   "th",
                                   "thing",
                                   "thing.",
                                   "thing.own",
                                   "thing.own.",
                                   "thing.prop.",
                                   "thing.descriptor.",
                                   "thing.bound(",
                                   "thing.method(",
                                   "Hostile.",
                                   "Hostile(",
                                   "Hostile.bound(",
                                   "Hostile.prop.",
                                   "Meta.",
                                   "Meta(",
                                   "thing(",
                                   "thing[",
                                   "thing['",
                                   "thing[0].",
                                   "mapping[",
                                   "mapping['",
                                   "mapping['key'].",
                                   "mapping.",
                                   "row[",
                                   "row[0].",
                                   "row.",
                                   "text.",
                                   "text[0].",
                                   "inner[",
                                   "inner['",
                                   "inner['key'].",
                                   "inner['key'][0].",
                                   "inner['other'].",
                                   "inner[thing].",
                                   "wrapped(",
                                   "wrapped.",
                                   "shadowed.",
                                   "shadowed.x.",
                                   "shadowed(",
                                   "Shadowed.",
                                   "plain.inside.",
                                   "plain.",
                                   "import th",
                                   "from thing import ",
                                   "'{thing}'.format(",
                                   "thing.own2"}) {
        complete(code);
        EXPECT_EQ(value("list.__repr__(ran)"), "'[]'\n") << code;
        run("ran.clear()");
    }
    EXPECT_THAT(candidates("thing."), IsSupersetOf({"bound", "descriptor", "method", "own", "prop"}));
    EXPECT_THAT(candidates("wrapped(para"), ElementsAre());
}

}  // namespace
}  // namespace qvm_test
