// What a session has before its first request: in an engine of its own, and in one that listens, where Python was
// started for all sessions.
#include <gtest/gtest.h>
#include <sys/types.h>

#include <cstdio>
#include <fstream>
#include <memory>
#include <string>

#include "apps/qvm/fixture/EngineFixture.hpp"
#include "support/TemporaryDirectory.hpp"

namespace qvm_test {
namespace {

class FreshSessionTest : public testing::Test {
  protected:
    void serve() {
        listener_ = std::make_unique<EngineProcess>(std::vector<std::string>{"--listen", path_});
        listener_->awaitStderr("krutil-qvm: serving " + path_ + "\n");
    }

    std::unique_ptr<EngineClient> connected() { return std::make_unique<EngineClient>(connectTo(path_)); }

    test_support::TemporaryDirectory directory_;
    std::string path_ = directory_.file("private/socket");
    std::unique_ptr<EngineProcess> listener_;
};

// KiB of a process's memory that no other process shares.
long privateMemory(pid_t process) {
    std::ifstream file("/proc/" + std::to_string(process) + "/smaps_rollup");
    long total = 0;
    for (std::string line; std::getline(file, line);) {
        long kibibytes = 0;
        if (std::sscanf(line.c_str(), "Private_%*[^:]: %ld kB", &kibibytes) == 1) {
            total += kibibytes;
        }
    }
    return total;
}

TEST_F(FreshSessionTest, LittleMoreThanPythonItselfIsLoaded) {
    EngineProcess engine({"--stdio"});
    EngineClient client(engine.connection());
    client.eval("globals().update(loaded=set(__import__('sys').modules))");
    client.eval(
        "import subprocess\n"
        "python = subprocess.run(['/usr/bin/python3', '-I', '-c', 'import sys; print(*sys.modules)'],\n"
        "                        capture_output=True, text=True, check=True).stdout.split()\n");
    EXPECT_EQ(client.eval("'qvm' in loaded and 'site' in python").shown(), "True\n");
    EXPECT_EQ(
        client
            .eval("sorted(loaded.difference(python, ('_operator', '_qvm', 'atexit', 'encodings.ascii', 'gc', 'qvm', "
                  "'qvm_code', 'qvm_prompts', 'qvm_streams', 'qvm_warnings', 'warnings')))")
            .shown(),
        "[]\n");
}

TEST_F(FreshSessionTest, ListenerHasLoadedWhatItsSessionsNeedOften) {
    serve();
    const auto client = connected();
    EXPECT_EQ(client->eval("import sys\n[each for each in ('traceback', 'linecache', 'numpy') if each in sys.modules]")
                  .shown(),
              "['traceback', 'linecache']\n");
}

TEST_F(FreshSessionTest, SessionsOfOneListenerShareTheHashSeedOnly) {
    serve();
    const auto first = connected();
    const auto second = connected();
    EXPECT_EQ(first->eval("hash('text')").shown(), second->eval("hash('text')").shown());
    EXPECT_NE(first->eval("import random\nrandom.random()").shown(),
              second->eval("import random\nrandom.random()").shown());
    first->eval("import os, sys\nos.environ['SIBLING'] = sys.sibling = 'first'\nos.chdir('/')\nos.umask(0o123)");
    EXPECT_EQ(second->eval("import os, sys\n'SIBLING' in os.environ or hasattr(sys, 'sibling')").shown(), "False\n");
    EXPECT_NE(second->eval("os.getcwd()").shown(), "'/'\n");
    EXPECT_NE(second->eval("os.umask(0o123)").shown(), "83\n");
}

TEST_F(FreshSessionTest, ThreadsOfAForkedInterpreterWork) {
    serve();
    const auto client = connected();
    EXPECT_EQ(client
                  ->eval("import threading\n"
                         "def load():\n"
                         "    import colorsys\n"
                         "    print(colorsys.__name__, threading.current_thread() is threading.main_thread())\n"
                         "thread = threading.Thread(target=load)\n"
                         "thread.start()\n"
                         "thread.join()\n"
                         "threading.current_thread() is threading.main_thread()")
                  .shown(),
              "True\n");
    EXPECT_EQ(client->eval("1").shown(), "1\n");
}

TEST_F(FreshSessionTest, IdleSessionHasLessThanHalfOfTheMemoryOfAPython) {
#if defined(KRUTIL_SANITIZED)
    GTEST_SKIP() << "a sanitizer's own memory counts, too";
#endif
    serve();
    const auto client = connected();
    // Looks at all objects that are not kept from it.
    client->eval("__import__('gc').collect()");
    const long session = privateMemory(static_cast<pid_t>(std::stol(client->eval("import os\nos.getpid()").shown())));
    const long python = std::stol(
        client
            ->eval("import subprocess\n"
                   "python = subprocess.Popen(['/usr/bin/python3', '-c', 'import os; print(os.getpid()); input()'],\n"
                   "                          stdin=subprocess.PIPE, stdout=subprocess.PIPE, text=True)\n"
                   "int(python.stdout.readline())")
            .shown());
    const long pythonMemory = privateMemory(static_cast<pid_t>(python));
    client->eval("python.communicate()");
    EXPECT_GT(session, 0);
    EXPECT_LT(2 * session, pythonMemory) << "KiB of the session and of python3";
}

}  // namespace
}  // namespace qvm_test
