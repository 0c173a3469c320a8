// Code of one session that starts as many processes as it can, where the system lets a test delegate a control group.
#include <gtest/gtest.h>
#include <signal.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <optional>
#include <sstream>
#include <string>

#include "apps/qvm/fixture/EngineFixture.hpp"
#include "programs/support/Program.hpp"
#include "support/Eventually.hpp"
#include "support/FileContent.hpp"
#include "support/TemporaryDirectory.hpp"

namespace qvm_test {
namespace {

// Where control groups of version 2 are, and the group of this process below it.
std::string directoryOfOwnGroup() {
    std::string where;
    std::istringstream mounts(test_support::contentOf("/proc/self/mounts"));
    for (std::string line; std::getline(mounts, line);) {
        std::istringstream fields(line);
        std::string source;
        std::string path;
        std::string type;
        fields >> source >> path >> type;
        where = type == "cgroup2" ? path : where;
    }
    const std::string groups = "\n" + test_support::contentOf("/proc/self/cgroup");
    const std::size_t at = groups.find("\n0::/");
    return where.empty() || at == groups.npos ? "" : where + groups.substr(at + 4, groups.find('\n', at + 1) - at - 4);
}

class ForkBombTest : public testing::Test {
  protected:
    // A group beside that of this process, or below it where that is the first one.
    void SetUp() override {
        const std::filesystem::path own = directoryOfOwnGroup();
        if (own.empty()) {
            GTEST_SKIP() << "the system has no control groups of version 2";
        }
        const bool first = !std::filesystem::exists(own / "cgroup.type");
        const std::filesystem::path above = first ? own : own.parent_path();
        group_ = above / ("krutil-test-" + std::to_string(::getpid()));
        if (::access((above / "cgroup.procs").c_str(), W_OK) != 0) {
            GTEST_SKIP() << "needs to move a process from " << own << " into a group beside it";
        }
        std::error_code error;
        if (!std::filesystem::create_directory(group_, error)) {
            GTEST_SKIP() << "needs to make the control group " << group_ << ": " << error.message();
        }
        const std::string controllers = test_support::contentOf(group_ / "cgroup.controllers");
        if ((" " + controllers).find(" pids") == std::string::npos) {
            GTEST_SKIP() << "processes are not counted in the control group " << group_;
        }
    }

    void TearDown() override {
        if (::testing::Test::IsSkipped()) {
            ::rmdir(group_.c_str());
            return;
        }
        EXPECT_TRUE(test_support::eventually([this] { return ::rmdir(group_.c_str()) == 0; })) << group_;
    }

    // As a service manager does it.
    void serve() {
        engine_.emplace(std::vector<std::string>{"/bin/sh", "-c", "echo 0 > \"$0/cgroup.procs\" && exec \"$@\"", group_,
                                                 KRUTIL_QVM, "--listen", path_, "--limit-processes", "20"});
        ASSERT_TRUE(engine_->waitForErr("krutil-qvm: serving " + path_ + "\n"));
    }

    std::size_t groupsOfSessions() const {
        std::size_t count = 0;
        for (const auto& each : std::filesystem::directory_iterator(group_)) {
            count += each.path().filename().string().rfind("krutil-session-", 0) == 0 ? 1U : 0U;
        }
        return count;
    }

    std::filesystem::path group_;
    const test_support::TemporaryDirectory directory_;
    const std::string path_ = directory_.file("private/socket");
    std::optional<programs_test::Program> engine_;
};

TEST_F(ForkBombTest, OneSessionTakesNoProcessFromAnother) {
    serve();
    EngineClient other(connectTo(path_));
    EngineClient bomb(connectTo(path_));
    EXPECT_EQ(bomb.eval("import os, signal, threading\nchildren = []\n"
                        "while True:\n"
                        "    child = os.fork()\n"
                        "    if child == 0:\n"
                        "        while True: signal.pause()\n"
                        "    children.append(child)")
                  .errorText(),
              "[Errno 11] Resource temporarily unavailable");
    EXPECT_EQ(bomb.eval("threading.Thread(target=print).start()").errorText(), "can't start new thread");
    EXPECT_EQ(other.eval("import subprocess\nprint(subprocess.check_output(['echo', 'started']))").output(),
              "b'started\\n'\n");
    EXPECT_EQ(EngineClient(connectTo(path_)).eval("6 * 7").shown(), "42\n");
    EXPECT_EQ(bomb.eval("n = len(children)\n"
                        "for each in children: os.kill(each, signal.SIGKILL); os.waitpid(each, 0)\n"
                        "print(0 < n < 20)")
                  .output(),
              "True\n");
    EXPECT_EQ(bomb.goodbye().reason, session::SessionEnd::Reason::Finished);
    EXPECT_EQ(other.goodbye().reason, session::SessionEnd::Reason::Finished);
    EXPECT_TRUE(test_support::eventually([this] { return groupsOfSessions() == 0; }));
    engine_->signal(SIGTERM);
    EXPECT_EQ(engine_->finish().exitCode, 0);
}

TEST_F(ForkBombTest, AnEngineThatIsNotAloneInItsGroupSaysSo) {
    programs_test::Program neighbour(
        {"/bin/sh", "-c", "echo 0 > \"$0/cgroup.procs\" && echo there && exec sleep 600", group_});
    ASSERT_TRUE(neighbour.waitForOut("there\n"));
    engine_.emplace(std::vector<std::string>{"/bin/sh", "-c", "echo 0 > \"$0/cgroup.procs\" && exec \"$@\"", group_,
                                             KRUTIL_QVM, "--listen", path_, "--limit-processes", "20"});
    const programs_test::Ran ran = engine_->finish();
    EXPECT_EQ(ran.exitCode, 3);
    EXPECT_EQ(ran.err.substr(0, ran.err.find(". ")), "krutil-qvm: Cannot write \"+pids\" to \"" + group_.string() +
                                                         "/cgroup.subtree_control\": Device or resource busy");
    EXPECT_FALSE(std::filesystem::exists(group_ / "krutil-listener"));
    neighbour.signal(SIGKILL);
    neighbour.finish();
}

}  // namespace
}  // namespace qvm_test
