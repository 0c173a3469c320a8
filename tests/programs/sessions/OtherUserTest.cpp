// What another user of the machine finds of a session: nothing that can be read, changed or connected to, wherever its
// files are and whatever the mask says.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <csignal>
#include <filesystem>
#include <map>
#include <set>
#include <string>
#include <vector>

#include "programs/support/Program.hpp"
#include "support/AnotherUser.hpp"
#include "support/TemporaryDirectory.hpp"

namespace programs_test {
namespace {

class OtherUserTest : public ::testing::Test {
  protected:
    void SetUp() override {
        if (!test_support::AnotherUser::isPossible()) {
            GTEST_SKIP() << "needs to become another user";
        }
        ::chmod(directory_.path().c_str(), 0777);
    }
    void TearDown() override { ::umask(mask_); }

    static Ran asNobody(std::vector<std::string> command) {
        command.insert(command.begin(), {"/usr/bin/setpriv", "--reuid=65534", "--regid=65534", "--clear-groups"});
        return run(command);
    }

    std::string file(const std::string& name) const { return directory_.file(name); }

    const mode_t mask_ = ::umask(0);
    const test_support::TemporaryDirectory directory_;
};

TEST_F(OtherUserTest, NothingOfASessionIsTheirs) {
    const std::string socket = file("private/engine");
    Program engine({enginePath(), "--listen", socket, "--diary", file("diary"), "--log", file("log"), "--record",
                    file("engine.pcapng")});
    ASSERT_TRUE(engine.waitForErr("krutil-qvm: serving " + socket + "\n"));
    EXPECT_EQ(runClient({"eval", "--connect", socket, "--diary", "--log", "--record", file("client.pcapng"),
                         "--trace-to", file("trace"), "print('a secret')"})
                  .out,
              "a secret\n");
    Program::Options atTerminal;
    atTerminal.terminal = true;
    atTerminal.environment = {"TERM=xterm", "NO_COLOR=1", "XDG_STATE_HOME=" + directory_.path()};
    Program client(clientCommand({"repl", "--connect", socket}), atTerminal);
    EXPECT_TRUE(client.waitForOut(">>> "));
    client.type("6 * 7\r");
    EXPECT_TRUE(client.waitForOut("42\r\n"));
    EXPECT_TRUE(client.waitForOut(">>> "));
    client.type("\x04");
    EXPECT_EQ(client.finish().exitCode, 0);

    std::multiset<std::string> names;
    for (const auto& entry : std::filesystem::recursive_directory_iterator(directory_.path())) {
        if (entry.is_regular_file()) {
            EXPECT_GT(entry.file_size(), 0U) << entry.path();
            const std::string name = entry.path().filename();
            names.insert(name.starts_with("engine.pcapng.") ? "engine.pcapng" : name);
        }
    }
    EXPECT_THAT(names, ::testing::ElementsAre("client.pcapng", "diary", "engine.pcapng", "engine.pcapng", "history",
                                              "log", "trace"));
    EXPECT_EQ(asNobody({"/usr/bin/find", directory_.path(), "-mindepth", "1", "(", "-writable", "-o", "-type", "f",
                        "-readable", ")"})
                  .out,
              "");
    const Ran refused = asNobody({"/usr/bin/python3", "-c",
                                  "import socket, sys\n"
                                  "socket.socket(socket.AF_UNIX).connect(sys.argv[1])",
                                  socket});
    EXPECT_THAT(refused.err, ::testing::EndsWith("PermissionError: [Errno 13] Permission denied\n"));
    EXPECT_EQ(refused.exitCode, 1);
    engine.signal(SIGTERM);
    EXPECT_EQ(engine.finish().exitCode, 0);
}

// As if both ends had been put into a place of everybody's, where another user has been before.
TEST_F(OtherUserTest, WhatTheyHavePutThereIsRefused) {
    asNobody({"/usr/bin/touch", file("theirs")});
    const std::string why = ": it belongs to user 65534; name a file of your own\n";
    const std::map<std::string, std::string> ofClient{
        {"--record", "krutil: cannot record to '" + file("theirs") + "'"},
        {"--trace-to", "krutil: cannot open '" + file("theirs") + "' for the trace"}};
    for (const auto& [option, cannot] : ofClient) {
        const Ran ran = runClient({"eval", option, file("theirs"), "--engine", "echo started >&2; exit 1", "1"});
        EXPECT_EQ(ran.err, cannot + why);
        EXPECT_EQ(ran.exitCode, 2);
    }
    for (const std::string option : {"--diary", "--log"}) {
        const Ran ran = run({enginePath(), "--listen", file("private/engine"), option, file("theirs")});
        EXPECT_EQ(ran.err, "krutil-qvm: Cannot append to \"" + file("theirs") + "\"" + why);
        EXPECT_EQ(ran.exitCode, 3);
    }
    EXPECT_EQ(std::filesystem::file_size(file("theirs")), 0U);
}

}  // namespace
}  // namespace programs_test
