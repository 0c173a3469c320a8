// Python of a process that was forked from a prepared one.
#include "qvm/python/PythonStart.hpp"

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cstdio>
#include <stdexcept>
#include <string>

#include "apps/qvm/python/EmbeddedPython.hpp"

namespace qvm_test {
namespace {

class PythonStartTest : public PythonTest {
  protected:
    // What `expression` is in a forked process.
    std::string inFork(const std::string& expression) {
        std::array<int, 2> ends{};
        if (::pipe(ends.data()) != 0) {
            throw std::runtime_error("no pipe");
        }
        const pid_t child = qvm::forkPrepared();
        if (child == 0) {
            const std::string text = show(expression);
            ::_exit(::write(ends[1], text.data(), text.size()) == static_cast<ssize_t>(text.size()) ? 0 : 1);
        }
        ::close(ends[1]);
        std::string text(200, '\0');
        const ssize_t count = ::read(ends[0], text.data(), text.size());
        ::close(ends[0]);
        int status = -1;
        EXPECT_EQ(::waitpid(child, &status, 0), child);
        EXPECT_EQ(status, 0);
        text.resize(count > 0 ? static_cast<std::size_t>(count) : 0);
        return text;
    }
};

TEST_F(PythonStartTest, ForkedProcessesDrawRandomNumbersOfTheirOwn) {
    run("import random");
    const std::string first = inFork("random.random()");
    EXPECT_FALSE(first.empty());
    EXPECT_NE(first, inFork("random.random()"));
    EXPECT_NE(first, show("random.random()"));
}

TEST_F(PythonStartTest, ForkedProcessesHaveTheSameHashSeed) {
    EXPECT_EQ(inFork("hash('text')"), show("hash('text')"));
}

TEST_F(PythonStartTest, ThisProcessGoesOnAfterAFork) {
    run("import os, threading");
    EXPECT_EQ(inFork("os.getppid()"), std::to_string(::getpid()));
    run("import sys\nsys.modules.pop('colorsys', None)\n"
        "def load():\n    import colorsys\n"
        "thread = threading.Thread(target=load)\nthread.start()\nthread.join()");
    EXPECT_EQ(show("thread.is_alive()"), "False");
}

}  // namespace
}  // namespace qvm_test
