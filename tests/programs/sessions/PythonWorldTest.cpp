// The Python that code runs in: whose packages it finds, what counts of the environment, and what a file's code finds.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "programs/support/Program.hpp"
#include "support/TemporaryDirectory.hpp"

namespace programs_test {
namespace {

using ::testing::HasSubstr;

class PythonWorldTest : public ::testing::Test {
  protected:
    PythonWorldTest() {
        // What `python3 -m venv` makes, without pip.
        std::filesystem::create_directories(directory_.file("venv/bin"));
        std::filesystem::create_directories(packages());
        std::filesystem::create_symlink("/usr/bin/python3", interpreter());
        setVersion("3.11.2");
        write(packages() + "/of_venv.py", "name = 'of the environment'\n");
        std::filesystem::create_directories(directory_.file("scripts"));
    }

    std::string file(const std::string& name) const { return directory_.file(name); }
    std::string script(const std::string& name) const { return file("scripts/" + name); }
    std::string interpreter() const { return file("venv/bin/python3"); }
    std::string packages() const { return file("venv/lib/python3.11/site-packages"); }

    void setVersion(const std::string& version) const {
        write(file("venv/pyvenv.cfg"),
              "home = /usr/bin\ninclude-system-site-packages = false\nversion = " + version + "\n");
    }

    static void write(const std::string& path, const std::string& content) { std::ofstream(path) << content; }

    // Evaluates with an engine that is started with these arguments.
    static Ran evalWith(const std::string& engineArguments, const std::string& code,
                        const std::vector<std::string>& environment = {}) {
        return runClient({"eval", "--engine", quotedForShell(enginePath()) + " --stdio " + engineArguments, code},
                         {.environment = environment});
    }

    static void expectRefusal(const Ran& ran, const std::string& sentence) {
        EXPECT_EQ(ran.out, "");
        EXPECT_EQ(ran.err, "krutil-qvm: " + sentence +
                               "; choose a Python 3.11, such as --python /usr/bin/python3\n"
                               "krutil: the engine exited with code 3 before the session began\n");
        EXPECT_EQ(ran.exitCode, 3);
    }

    test_support::TemporaryDirectory directory_;
};

TEST_F(PythonWorldTest, PackagesAreThoseOfTheInterpreterThatIsNamed) {
    const std::string code = "import of_venv, sys\nprint(of_venv.name, sys.prefix, sys.executable)";
    const std::string expected = "of the environment " + file("venv") + " " + interpreter() + "\n";
    EXPECT_EQ(evalWith("--python " + quotedForShell(interpreter()), code).out, expected);
}

TEST_F(PythonWorldTest, InterpreterThatIsNamedCountsForAnIsolatedEngineToo) {
    write(script("sibling.py"), "");
    const std::string code =
        "import importlib.util, sys\n"
        "print(sys.prefix, [importlib.util.find_spec(name) is not None for name in ('of_venv', 'sibling')])";
    const std::vector<std::string> environment{"PYTHONPATH=" + file("scripts"), "VIRTUAL_ENV=" + file("other")};
    const std::string python = "--python " + quotedForShell(interpreter());
    EXPECT_EQ(evalWith(python, code, environment).out, file("venv") + " [True, True]\n");
    EXPECT_EQ(evalWith(python + " --isolated", code, environment).out, file("venv") + " [True, False]\n");
}

TEST_F(PythonWorldTest, WithoutOneTheActiveVirtualEnvironmentCounts) {
    const std::string code = "import sys\nprint(sys.prefix)";
    const std::string active = "VIRTUAL_ENV=" + file("venv");
    EXPECT_EQ(evalWith("", code, {active}).out, file("venv") + "\n");
    EXPECT_EQ(evalWith("--isolated", code, {active}).out, "/usr\n");
    EXPECT_EQ(evalWith("--python /usr/bin/python3", code, {active}).out, "/usr\n");
    EXPECT_EQ(evalWith("", code, {"VIRTUAL_ENV="}).out, "/usr\n");
}

TEST_F(PythonWorldTest, InterpreterThatDoesNotFitIsRefused) {
    const std::string other = file("other/bin/python3");
    expectRefusal(evalWith("--python " + quotedForShell(other), "1"),
                  "--python names \"" + other + "\", which is not there");
    expectRefusal(evalWith("--python ''", "1"), "--python names \"\", which is not there");
    expectRefusal(evalWith("", "1", {"VIRTUAL_ENV=" + file("other")}),
                  "VIRTUAL_ENV names \"" + other + "\", which is not there");
    expectRefusal(evalWith("--python " + quotedForShell(file("venv/pyvenv.cfg")), "1"),
                  "--python names \"" + file("venv/pyvenv.cfg") + "\", which is no program");
    expectRefusal(evalWith("--python /usr/bin/env", "1"),
                  "--python names \"/usr/bin/env\", whose version \"/usr/bin/env\" does not tell");
    setVersion("3.12.1");
    expectRefusal(evalWith("--python " + quotedForShell(interpreter()), "1"),
                  "--python names \"" + interpreter() + "\", which is Python 3.12 (by \"" + file("venv/pyvenv.cfg") +
                      "\"), and this engine runs 3.11");
}

TEST_F(PythonWorldTest, PythonPathCountsUnlessTheEngineIsIsolated) {
    write(script("sibling.py"), "");
    const std::string code = "import importlib.util\nprint(importlib.util.find_spec('sibling') is not None)";
    const std::string path = "PYTHONPATH=" + file("scripts");
    EXPECT_EQ(evalWith("", code, {path}).out, "True\n");
    EXPECT_EQ(evalWith("--isolated", code, {path}).out, "False\n");
}

TEST_F(PythonWorldTest, CodeFindsModulesOfTheCurrentDirectory) {
    write(script("sibling.py"), "");
    const std::string code =
        "import importlib.util, sys\nprint(importlib.util.find_spec('sibling') is not None, sys.path[:1])";
    EXPECT_EQ(runClient({"eval", code}, {.directory = file("scripts")}).out, "True ['']\n");
    EXPECT_EQ(runClient({"eval", code}, {.environment = {"PYTHONSAFEPATH=1"}, .directory = file("scripts")}).out,
              "False ['/usr/lib/python311.zip']\n");
}

// Files.

TEST_F(PythonWorldTest, FileRunsAsPythonRunsIt) {
    write(script("sibling.py"), "name = __name__\n");
    write(script("main.py"), "import sys, sibling\nprint(__name__, __file__, sys.argv, sys.path[0], sibling.name)\n");
    const Ran ran = runClient({"run", "scripts/main.py", "--", "-a", "b"}, {.directory = file("")});
    EXPECT_EQ(ran.err, "");
    EXPECT_EQ(ran.out,
              "__main__ " + script("main.py") + " ['scripts/main.py', '-a', 'b'] " + file("scripts") + " sibling\n");
    EXPECT_EQ(ran.exitCode, 0);
    const Ran evaluated = runClient({"eval", "-f", "main.py", "--", "c"}, {.directory = file("scripts")});
    EXPECT_EQ(evaluated.out, "__main__ " + script("main.py") + " ['main.py', 'c'] " + file("scripts") + " sibling\n");
}

TEST_F(PythonWorldTest, TracebackNamesTheFileAndShowsTheLinesThatWereSent) {
    write(script("main.py"), "def divide():\n    return 1 / 0\ndivide()\n");
    // The file is gone when the error is put into words, as it is on another machine.
    const Ran ran =
        runClient({"eval", "--engine",
                   "rm " + quotedForShell(script("main.py")) + "; exec " + quotedForShell(enginePath()) + " --stdio",
                   "-f", script("main.py")});
    EXPECT_EQ(ran.err,
              "Traceback (most recent call last):\n"
              "  File \"" +
                  script("main.py") +
                  "\", line 3, in <module>\n"
                  "    divide()\n"
                  "  File \"" +
                  script("main.py") +
                  "\", line 2, in divide\n"
                  "    return 1 / 0\n"
                  "           ~~^~~\n"
                  "ZeroDivisionError: division by zero\n");
    EXPECT_EQ(ran.exitCode, 1);
}

TEST_F(PythonWorldTest, SyntaxErrorNamesTheFile) {
    write(script("main.py"), "x = (\n");
    EXPECT_THAT(runClient({"run", script("main.py")}).err, HasSubstr("  File \"" + script("main.py") + "\", line 1\n"));
}

// NumPy.

TEST_F(PythonWorldTest, WithoutNumpyCodeRunsAndArraysAreRefused) {
    const std::string active = "VIRTUAL_ENV=" + file("venv");
    EXPECT_EQ(evalWith("", "6 * 7", {active}).out, "42\n");
    const Ran refused = runClient({"call", "len", "[1,2]"}, {.environment = {active}});
    EXPECT_THAT(refused.err, HasSubstr("ImportError: Arrays need NumPy, which this Python (" + interpreter() +
                                       ") cannot import: No module named 'numpy'\n"));
    EXPECT_EQ(refused.exitCode, 1);
    EXPECT_EQ(runClient({"call", "abs", "-3"}, {.environment = {active}}).exitCode, 1);
    EXPECT_EQ(runClient({"call", "len", "\"text\""}, {.environment = {active}}).exitCode, 0);
}

TEST_F(PythonWorldTest, NumpyOfAnotherMajorVersionIsRefused) {
    write(packages() + "/numpy.py", "__version__ = '2.1.0'\n");
    const Ran refused = runClient({"call", "len", "[1,2]"}, {.environment = {"VIRTUAL_ENV=" + file("venv")}});
    EXPECT_THAT(refused.err,
                HasSubstr("ImportError: Arrays need NumPy 1; this Python (" + interpreter() + ") has 2.1.0\n"));
    EXPECT_EQ(refused.exitCode, 1);
}

}  // namespace
}  // namespace programs_test
