// Python functions by name, their arguments and their outputs.
#include "qvm/python/FunctionCall.hpp"

#include <gtest/gtest.h>

#include <vector>

#include "apps/qvm/python/EmbeddedPython.hpp"
#include "foundation/korveldata/ArrayFactory.hpp"
#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"

namespace qvm_test {
namespace {

using foundation::korveldata::Array;
using foundation::korveldata::ArrayFactory;
using foundation::korveldata::ElementType;
using foundation::korveldata::MemoryOrder;
using foundation::vantor::carrier::framing::BufferAllocator;
using qvm::ReleaseQueue;

class FunctionCallTest : public PythonTest {
  protected:
    py::object find(const std::string& name) { return qvm::findFunction(name, names, engineModule); }

    std::vector<Array> call(const std::string& name, std::vector<Array> arguments, std::uint64_t wanted) {
        return qvm::outputsOf(qvm::callWithArrays(find(name), name, std::move(arguments), names), name, wanted,
                              releases);
    }

    std::vector<Array> outputs(const std::string& expression, std::uint64_t wanted) {
        return qvm::outputsOf(eval(expression), "f", wanted, releases);
    }

    std::string outputError(const std::string& expression, std::uint64_t wanted) {
        return errorOf([&] { outputs(expression, wanted); });
    }

    static Array doubles(const std::vector<double>& values) {
        return ArrayFactory().createArray(ElementType::Double, {values.size()}, MemoryOrder::RowMajor, values.data());
    }

    static Array integer(std::int64_t value) { return ArrayFactory().createScalar(value); }

    const py::object engineModule = py::module_::import("types").attr("ModuleType")("qvm");
    ReleaseQueue releases;
};

TEST_F(FunctionCallTest, FunctionOfAModuleIsFoundAndImported) {
    run("import sys; sys.modules.pop('colorsys', None)");
    EXPECT_TRUE(find("colorsys.rgb_to_hsv").is(py::module_::import("colorsys").attr("rgb_to_hsv")));
    EXPECT_TRUE(find("numpy.linalg.svd").is(eval("numpy.linalg.svd")));
    EXPECT_EQ(show("'colorsys' in dir()"), "False");
}

TEST_F(FunctionCallTest, SubmoduleThatItsPackageHasNotImportedIsImported) {
    EXPECT_TRUE(
        find("xml.etree.ElementTree.fromstring").is(py::module_::import("xml.etree.ElementTree").attr("fromstring")));
    run("import xml as renamed");
    EXPECT_TRUE(find("renamed.sax.saxutils.escape").is(py::module_::import("xml.sax.saxutils").attr("escape")));
}

TEST_F(FunctionCallTest, BuiltinsMethodsAndClassesAreFound) {
    EXPECT_TRUE(find("len").is(eval("len")));
    EXPECT_TRUE(find("str.upper").is(eval("str.upper")));
    EXPECT_TRUE(find("datetime.datetime.now"));
    EXPECT_TRUE(find("complex").is(eval("complex")));
}

TEST_F(FunctionCallTest, NameOfTheSessionComesFirst) {
    run("def len(x): return 'mine'\n"
        "class math:\n"
        "    sin = staticmethod(lambda x: 'mine')\n");
    EXPECT_EQ(call("len", {integer(1)}, 1)[0].toText(), u"mine");
    EXPECT_EQ(call("math.sin", {integer(1)}, 1)[0].toText(), u"mine");
    run("größe = lambda: 'mine'");
    EXPECT_EQ(call("größe", {}, 1)[0].toText(), u"mine");
}

TEST_F(FunctionCallTest, NameOfTheEnginesModuleIsThatModuleWhateverTheSessionCallsIt) {
    engineModule.attr("kinds") = eval("lambda *values: str([type(value).__name__ for value in values])");
    run("class qvm:\n    kinds = staticmethod(lambda *values: 'mine')\n");
    EXPECT_EQ(call("qvm.kinds", {integer(1), ArrayFactory().createScalar(1.5), doubles({2})}, 1)[0].toText(),
              u"['int', 'float', 'ndarray']");
    EXPECT_EQ(call("qvm", {}, 0).size(), 0U);
    EXPECT_EQ(errorOf([&] { find("qvm.none"); }),
              "AttributeError: Unknown function 'qvm.none': the module 'qvm' has no attribute and no submodule 'none'");
}

TEST_F(FunctionCallTest, UnknownNameSaysWhereTheSearchStopped) {
    const auto error = [&](const std::string& name) { return errorOf([&] { find(name); }); };
    EXPECT_EQ(error("nosuch"),
              "NameError: Unknown function 'nosuch': 'nosuch' is not defined in the session, not a builtin and not a "
              "module");
    EXPECT_EQ(error("nosuch.deep.name"),
              "NameError: Unknown function 'nosuch.deep.name': 'nosuch' is not defined in the session, not a builtin "
              "and not a module");
    EXPECT_EQ(error("numpy.linalg.svdd"),
              "AttributeError: Unknown function 'numpy.linalg.svdd': the module 'numpy.linalg' has no attribute and no "
              "submodule 'svdd'");
    EXPECT_EQ(error("math.tau.x"),
              "AttributeError: Unknown function 'math.tau.x': 'math.tau' (of type float) has no attribute 'x'");
    EXPECT_EQ(error("math.x.y"),
              "AttributeError: Unknown function 'math.x.y': the module 'math' has no attribute and no submodule 'x'");
    EXPECT_EQ(error("math.pi"), "TypeError: 'math.pi' cannot be called: it is of type float");
    EXPECT_EQ(error("numpy"), "TypeError: 'numpy' cannot be called: it is of type module");
    for (const std::string name : {"", ".", "a..b", "a.", ".a", "f()", "a b", "\xFF"}) {
        const std::string shown = name == "\xFF" ? "\xEF\xBF\xBD" : name;
        EXPECT_EQ(error(name), "NameError: Unknown function '" + shown +
                                   "': a function is called by its name, or by names joined by dots as in "
                                   "'numpy.linalg.svd'");
    }
}

TEST_F(FunctionCallTest, ErrorOfAnImportIsItsOwn) {
    run("import sys, importlib.abc, importlib.util\n"
        "class Broken(importlib.abc.MetaPathFinder, importlib.abc.Loader):\n"
        "    def find_spec(self, name, path, target=None):\n"
        "        return importlib.util.spec_from_loader(name, self) if name == 'brokenmodule' else None\n"
        "    def create_module(self, spec): return None\n"
        "    def exec_module(self, module): import notthereeither\n"
        "sys.meta_path.append(Broken())\n");
    EXPECT_EQ(errorOf([&] { find("brokenmodule.f"); }), "ModuleNotFoundError: No module named 'notthereeither'");
    run("sys.meta_path.pop()");
}

TEST_F(FunctionCallTest, ErrorOfAnAttributeIsItsOwn) {
    run("class Sly:\n"
        "    @property\n"
        "    def f(self): raise KeyError('sly')\n"
        "sly = Sly()\n");
    EXPECT_EQ(errorOf([&] { find("sly.f"); }), "KeyError: 'sly'");
}

TEST_F(FunctionCallTest, AddressInsideTheFunctionIsThatOfTheArgument) {
    run("def address(x): return x.ctypes.data");
    Array array = doubles(std::vector<double>(1000, 1.0));
    const auto memory = reinterpret_cast<std::uintptr_t>(array.data());
    std::vector<Array> arguments;
    arguments.push_back(std::move(array));
    EXPECT_EQ(call("address", std::move(arguments), 1)[0], integer(static_cast<std::int64_t>(memory)));
}

TEST_F(FunctionCallTest, ArgumentsComeInOrder) {
    run("def show(*values): return repr([type(each).__name__ for each in values])");
    EXPECT_EQ(call("show", {doubles({1}), ArrayFactory().createText(u"x"), integer(2)}, 1)[0].toText(),
              u"['ndarray', 'str', 'ndarray']");
    EXPECT_EQ(call("show", {}, 1)[0].toText(), u"[]");
}

TEST_F(FunctionCallTest, CallerIsTheSession) {
    run("x = 41");
    EXPECT_EQ(call("eval", {ArrayFactory().createText(u"x + 1")}, 1)[0], integer(42));
    EXPECT_TRUE(call("exec", {ArrayFactory().createText(u"global y; y = 43")}, 0).empty());
    EXPECT_EQ(show("y"), "43");
    EXPECT_TRUE(call("dir", {}, 0).empty());
    EXPECT_TRUE(call("sys._getframe", {}, 0).empty());
}

TEST_F(FunctionCallTest, ShortCallsNeitherCompileNorImport) {
    run("import builtins, sys\n"
        "callers, imported = [], []\n"
        "def look(array): callers.append(sys._getframe(1).f_code)\n"
        "def noting(name, *others, importing=builtins.__import__):\n"
        "    imported.append(name)\n"
        "    return importing(name, *others)\n");
    call("look", {doubles({1})}, 0);
    run("builtins.__import__, kept = noting, builtins.__import__");
    call("look", {doubles({2})}, 0);
    run("builtins.__import__ = kept");
    EXPECT_EQ(show("len(callers), callers[0] is callers[1], imported"), "(2, True, [])");
}

TEST_F(FunctionCallTest, ArgumentsAreReleasedAfterTheCall) {
    const std::size_t before = BufferAllocator::inUse();
    std::vector<Array> arguments;
    arguments.push_back(doubles(std::vector<double>(1000, 2.0)));
    const std::vector<Array> results = call("numpy.sqrt", std::move(arguments), 1);
    EXPECT_EQ(BufferAllocator::inUse(), before);
    EXPECT_EQ(results[0].numberOfElements(), 1000U);
}

TEST_F(FunctionCallTest, ErrorOfTheFunctionIsItsOwnAndReleasesTheArguments) {
    const std::size_t before = BufferAllocator::inUse();
    std::vector<Array> arguments;
    arguments.push_back(doubles({1, 2, 3}));
    EXPECT_EQ(errorOf([&] { call("numpy.linalg.inv", std::move(arguments), 1); }),
              "LinAlgError: 1-dimensional array given. Array must be at least two-dimensional");
    EXPECT_EQ(BufferAllocator::inUse(), before);
}

TEST_F(FunctionCallTest, ArgumentThatPythonCannotHaveIsNamed) {
    EXPECT_EQ(errorOf([&] {
                  call("len", {integer(1), ArrayFactory().createArray(ElementType::ComplexInt8, {2})}, 1);
              }),
              "TypeError: Argument 2 of 'len' has elements of type complex int8, which NumPy does not have");
}

TEST_F(FunctionCallTest, NoOutputIsReturnedWhenNoneIsWanted) {
    EXPECT_TRUE(outputs("None", 0).empty());
    EXPECT_TRUE(outputs("numpy.zeros(3)", 0).empty());
    EXPECT_TRUE(outputs("(1, 2)", 0).empty());
    EXPECT_TRUE(outputs("object()", 0).empty());
}

TEST_F(FunctionCallTest, OneOutputIsTheValueItself) {
    EXPECT_EQ(outputs("numpy.arange(3.0)", 1), std::vector<Array>{doubles({0, 1, 2})});
    EXPECT_EQ(outputs("7", 1), std::vector<Array>{integer(7)});
    EXPECT_EQ(outputs("[0.5, 1.5]", 1), std::vector<Array>{doubles({0.5, 1.5})});
    EXPECT_EQ(outputs("(0.5, 1)", 1), std::vector<Array>{doubles({0.5, 1})});
    EXPECT_EQ(outputs("(numpy.float64(0.5), 1)", 1), std::vector<Array>{doubles({0.5, 1})});
}

TEST_F(FunctionCallTest, OneOutputThatIsNoneIsTooFew) {
    EXPECT_EQ(outputError("None", 1), "ValueError: 1 output was wanted, but 'f' returned none; ask for 0 outputs");
}

TEST_F(FunctionCallTest, TupleOfArraysIsNotOneOutput) {
    EXPECT_EQ(outputError("numpy.linalg.svd(numpy.eye(2))", 1),
              "ValueError: 1 output was wanted, but 'f' returned a tuple of 3, which is not one array; ask for 3 "
              "outputs");
    EXPECT_EQ(outputError("(numpy.array(1), 2)", 1),
              "ValueError: 1 output was wanted, but 'f' returned a tuple of 2, which is not one array; ask for 2 "
              "outputs");
    EXPECT_EQ(outputError("('a', 'b')", 1).substr(0, 10), "ValueError");
}

TEST_F(FunctionCallTest, SeveralOutputsAreTheElementsOfATupleOrList) {
    EXPECT_EQ(outputs("(1, numpy.arange(2.0), 'x')", 3),
              (std::vector<Array>{integer(1), doubles({0, 1}), ArrayFactory().createText(u"x")}));
    EXPECT_EQ(outputs("[1, 2]", 2), (std::vector<Array>{integer(1), integer(2)}));
    run("import collections; Pair = collections.namedtuple('Pair', 'left right')");
    EXPECT_EQ(outputs("Pair(1, 2)", 2), (std::vector<Array>{integer(1), integer(2)}));
}

TEST_F(FunctionCallTest, AnotherNumberOfOutputsTellsBoth) {
    EXPECT_EQ(outputError("(1, 2, 3)", 2), "ValueError: 2 outputs were wanted, but 'f' returned 3; ask for 3 outputs");
    EXPECT_EQ(outputError("(1, 2, 3)", 4), "ValueError: 4 outputs were wanted, but 'f' returned 3; ask for 3 outputs");
    EXPECT_EQ(outputError("()", 2), "ValueError: 2 outputs were wanted, but 'f' returned 0; ask for 0 outputs");
    EXPECT_EQ(outputError("None", 2), "ValueError: 2 outputs were wanted, but 'f' returned none; ask for 0 outputs");
    EXPECT_EQ(outputError("numpy.zeros((2, 2))", 2),
              "ValueError: 2 outputs were wanted, but 'f' returned 1 (of type numpy.ndarray); ask for 1 output");
    EXPECT_EQ(outputError("'ab'", 2),
              "ValueError: 2 outputs were wanted, but 'f' returned 1 (of type str); ask for 1 output");
    EXPECT_EQ(outputError("(1, 2)", ~std::uint64_t{0}),
              "ValueError: 18446744073709551615 outputs were wanted, but 'f' returned 2; ask for 2 outputs");
}

TEST_F(FunctionCallTest, OutputThatCannotBeSentIsNamed) {
    EXPECT_EQ(outputError("(1, None)", 2), "TypeError: Output 2 of 'f' is None, which is no array");
    EXPECT_EQ(outputError("2**64", 1), "TypeError: The output of 'f' is an int that does not fit into 64 bits");
    EXPECT_EQ(outputError("(numpy.zeros(1, 'f2'), 1)", 2).substr(0, 43), "TypeError: Output 1 of 'f' has dtype float1");
}

TEST_F(FunctionCallTest, ListThatShrinksWhileItIsReadIsAnError) {
    run("class Sly:\n"
        "    def __array__(self, *_):\n"
        "        del outputs[:]\n"
        "        return numpy.zeros(1)\n"
        "outputs = [Sly(), 1]\n");
    EXPECT_EQ(outputError("outputs", 2), "IndexError: list index out of range");
}

}  // namespace
}  // namespace qvm_test
