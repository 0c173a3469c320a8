// Which files of control groups the listener writes, and what it says where that is not possible. Plain files stand for
// those of the system.
#include "qvm/process/SessionGroups.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <optional>
#include <stdexcept>
#include <string>

#include "support/FileContent.hpp"
#include "support/TemporaryDirectory.hpp"

namespace qvm_test {
namespace {

using qvm::SessionGroups;
using test_support::contentOf;

class SessionGroupsTest : public testing::Test {
  protected:
    SessionGroupsTest() {
        put("self/cgroup", "4:memory:/other\n0::/run/engine\n");
        mounts("/");
        put("mount/run/engine/cgroup.controllers", "cpu pids io\n");
        put("mount/run/engine/cgroup.subtree_control", "\n");
        put("mount/run/engine/cgroup.procs", "");
        put("mount/run/engine/krutil-listener/cgroup.procs", "");
        prepare(::getpid());
    }

    void put(const std::string& name, const std::string& content) const {
        std::filesystem::create_directories(std::filesystem::path(directory_.file(name)).parent_path());
        std::ofstream(directory_.file(name)) << content;
    }

    void mounts(const std::string& root) const {
        put("self/mountinfo", "23 1 0:20 / /proc rw - proc proc rw\n40 31 0:38 " + root + " " +
                                  directory_.file("mount") + " rw,relatime shared:9 - cgroup2 cgroup2 rw\n");
    }

    // The system makes these files with the group.
    void prepare(pid_t session) const {
        put(group(session) + "/pids.max", "");
        put(group(session) + "/cgroup.procs", "");
    }

    static std::string group(pid_t session) { return "mount/run/engine/krutil-session-" + std::to_string(session); }

    std::string in(const std::string& name) const { return contentOf(directory_.file("mount/run/engine/" + name)); }

    bool has(pid_t session) const { return std::filesystem::exists(directory_.file(group(session))); }

    // As if its last process had ended: files of the system go with their group.
    void empty(pid_t session) const {
        std::filesystem::remove(directory_.file(group(session) + "/pids.max"));
        std::filesystem::remove(directory_.file(group(session) + "/cgroup.procs"));
    }

    SessionGroups groups() const { return SessionGroups(20, directory_.file("self")); }

    // What is said, without the advice, and with names as they are below the directory.
    std::string refusal() const {
        try {
            groups();
        } catch (const std::runtime_error& error) {
            std::string said = error.what();
            EXPECT_THAT(said, testing::EndsWith(advice));
            said.resize(said.size() - std::min(said.size(), advice.size()));
            for (std::size_t at = 0; (at = said.find(directory_.path() + "/")) != std::string::npos;) {
                said.erase(at, directory_.path().size() + 1);
            }
            return said;
        }
        return "nothing";
    }

    const std::string advice =
        ". --limit-processes needs a control group (version 2) that is delegated to the engine, and in which there is "
        "no other process: put \"Delegate=pids\" and \"ProtectControlGroups=no\" into the unit of its service, "
        "or start it with \"systemd-run --user --scope -p Delegate=yes krutil-qvm ...\".";
    const test_support::TemporaryDirectory directory_;
};

TEST_F(SessionGroupsTest, TheListenerGetsAGroupOfItsOwn) {
    const SessionGroups made = groups();
    EXPECT_EQ(in("krutil-listener/cgroup.procs"), "0");
    EXPECT_EQ(in("cgroup.subtree_control"), "+pids");
    EXPECT_EQ(in("cgroup.procs"), "");
}

TEST_F(SessionGroupsTest, ASessionIsBoundedBeforeItRuns) {
    const SessionGroups made = groups();
    made.join();
    EXPECT_EQ(contentOf(directory_.file(group(::getpid()) + "/pids.max")), "20");
    EXPECT_EQ(contentOf(directory_.file(group(::getpid()) + "/cgroup.procs")), "0");
}

TEST_F(SessionGroupsTest, AMountMayShowAPartOfTheGroups) {
    mounts("/run");
    put("self/cgroup", "0::/run/run/engine\n");
    const SessionGroups made = groups();
    EXPECT_EQ(in("krutil-listener/cgroup.procs"), "0");
}

TEST_F(SessionGroupsTest, AGroupGoesWithItsLastProcess) {
    SessionGroups made = groups();
    for (const pid_t session : {1, 2, 3}) {
        prepare(session);
        made.begun(session);
    }
    made.ended(1);
    EXPECT_TRUE(has(1));
    empty(1);
    empty(2);
    empty(3);
    made.ended(2);
    EXPECT_FALSE(has(1));
    EXPECT_FALSE(has(2));
    EXPECT_TRUE(has(3)) << "its process may be about to join it";
}

TEST_F(SessionGroupsTest, AGroupIsKeptForANewProcessOfTheSameNumber) {
    SessionGroups made = groups();
    prepare(1);
    made.begun(1);
    made.ended(1);
    made.begun(1);
    empty(1);
    made.ended(2);
    EXPECT_TRUE(has(1));
}

TEST_F(SessionGroupsTest, TheEndMakesAllAsItWas) {
    {
        SessionGroups made = groups();
        prepare(1);
        made.begun(1);
        empty(1);
        std::filesystem::remove(directory_.file("mount/run/engine/krutil-listener/cgroup.procs"));
    }
    EXPECT_FALSE(has(1));
    EXPECT_EQ(in("cgroup.subtree_control"), "-pids");
    EXPECT_EQ(in("cgroup.procs"), "0");
    EXPECT_FALSE(std::filesystem::exists(directory_.file("mount/run/engine/krutil-listener")));
}

TEST_F(SessionGroupsTest, WhatIsLeftOfASessionStaysBounded) {
    {
        SessionGroups made = groups();
        prepare(1);
        made.begun(1);
    }
    EXPECT_TRUE(has(1));
    EXPECT_EQ(in("cgroup.subtree_control"), "+pids");
    EXPECT_EQ(in("cgroup.procs"), "");
}

TEST_F(SessionGroupsTest, AForkedProcessLeavesAllAsItIs) {
    std::optional<SessionGroups> made(std::in_place, 20, directory_.file("self"));
    const pid_t child = ::fork();
    if (child == 0) {
        made.reset();
        ::_exit(0);
    }
    ASSERT_EQ(::waitpid(child, nullptr, 0), child);
    EXPECT_EQ(in("cgroup.subtree_control"), "+pids");
}

TEST_F(SessionGroupsTest, ASessionThatCannotBeBoundedSaysSo) {
    const SessionGroups made = groups();
    const std::string expected =
        "Cannot limit the processes of the session in \"" + directory_.file(group(::getpid())) + "\": ";
    std::filesystem::remove(directory_.file(group(::getpid()) + "/pids.max"));
    EXPECT_THAT([&] { made.join(); },
                testing::ThrowsMessage<std::system_error>(expected + "No such file or directory"));
    EXPECT_EQ(contentOf(directory_.file(group(::getpid()) + "/cgroup.procs")), "") << "it is not bounded yet";
    prepare(::getpid());
    std::filesystem::remove(directory_.file(group(::getpid()) + "/cgroup.procs"));
    EXPECT_THAT([&] { made.join(); },
                testing::ThrowsMessage<std::system_error>(expected + "No such file or directory"));
    std::filesystem::remove_all(directory_.file("mount/run"));
    EXPECT_THAT([&] { made.join(); },
                testing::ThrowsMessage<std::system_error>(expected + "No such file or directory"));
}

TEST_F(SessionGroupsTest, EachStepThatFailsSaysWhereAndWhy) {
    const std::string top = "mount/run/engine/";
    std::filesystem::remove(directory_.file(top + "cgroup.subtree_control"));
    EXPECT_EQ(refusal(), "Cannot read \"" + top + "cgroup.subtree_control\": No such file or directory");
    // Opened to be read only.
    std::filesystem::create_directory(directory_.file(top + "cgroup.subtree_control"));
    EXPECT_EQ(refusal(), "Cannot write \"+pids\" to \"" + top + "cgroup.subtree_control\": Is a directory");
    EXPECT_EQ(in("krutil-listener/cgroup.procs"), "0") << "a group with processes cannot be divided";
    EXPECT_EQ(in("cgroup.procs"), "0") << "the process has been moved back";
    std::filesystem::remove(directory_.file(top + "cgroup.subtree_control"));
    put(top + "cgroup.subtree_control", "memory pids\n");
    EXPECT_EQ(refusal(), "\"" + top +
                             "cgroup.subtree_control\" has \"pids\" already: the group is not for this engine "
                             "alone, or another one was killed in it");
    put(top + "cgroup.subtree_control", "\n");
    std::filesystem::remove(directory_.file(top + "krutil-listener/cgroup.procs"));
    EXPECT_EQ(refusal(),
              "Cannot move the listener into the group \"" + top + "krutil-listener\": No such file or directory");
    put(top + "cgroup.controllers", "cpu rpids\n");
    EXPECT_EQ(refusal(), "\"" + top + "cgroup.controllers\" has \"cpu rpids\", and not \"pids\"");
    std::filesystem::remove_all(directory_.file("mount"));
    EXPECT_EQ(refusal(), "Cannot read \"" + top + "cgroup.controllers\": No such file or directory");
    mounts("/ru");
    EXPECT_EQ(refusal(),
              "\"self/mountinfo\" has no mount of the type \"cgroup2\" that shows the group \"/run/engine\"");
    std::filesystem::remove(directory_.file("self/mountinfo"));
    EXPECT_EQ(refusal(), "Cannot read \"self/mountinfo\": No such file or directory");
    put("self/cgroup", "1:pids:/run/engine\n");
    EXPECT_EQ(refusal(), "\"self/cgroup\" has no line that begins with \"0::/\", the group of version 2");
    std::filesystem::remove(directory_.file("self/cgroup"));
    EXPECT_EQ(refusal(), "Cannot read \"self/cgroup\": No such file or directory");
}

}  // namespace
}  // namespace qvm_test
