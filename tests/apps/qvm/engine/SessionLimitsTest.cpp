// What the process of a session may use of the machine.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/sysinfo.h>

#include <algorithm>
#include <array>
#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "apps/qvm/fixture/EngineFixture.hpp"
#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "support/TemporaryDirectory.hpp"

namespace qvm_test {
namespace {

class SessionLimitsTest : public testing::Test {
  protected:
    void SetUp() override {
#if defined(KRUTIL_SANITIZED)
        GTEST_SKIP() << "sanitizers need memory and descriptors";
#endif
    }

    // What a session has as its limit, as Python names it.
    static std::string limit(EngineClient& client, const std::string& name) {
        return client.eval("import resource\nprint(*resource.getrlimit(resource." + name + "))").output();
    }

    test_support::TemporaryDirectory directory_;
    std::string path_ = directory_.file("private/socket");
};

TEST_F(SessionLimitsTest, TooMuchMemoryIsAnErrorOfTheCode) {
    EngineSession engine({"--limit-memory", "512MiB"});
    EXPECT_EQ(engine.client.eval("a = bytearray(256 << 20)\nlen(a)").shown(), "268435456\n");
    EXPECT_EQ(engine.client.eval("b = bytearray(256 << 20)").errorId(), "MemoryError");
    EXPECT_EQ(engine.client.goodbye().reason, session::SessionEnd::Reason::Finished);
}

TEST_F(SessionLimitsTest, TooManyDescriptorsAreAnErrorOfTheCode) {
    EngineSession engine({"--limit-descriptors", "160"});
    EXPECT_EQ(engine.client.eval("import os\nd = []\nwhile True: d.append(os.dup(0))").errorText(),
              "[Errno 24] Too many open files");
    EXPECT_EQ(engine.client.eval("[os.close(n) for n in d]\nlen(d) > 100").shown(), "True\n");
    EXPECT_EQ(engine.client.goodbye().reason, session::SessionEnd::Reason::Finished);
}

TEST_F(SessionLimitsTest, ByDefaultASessionMayHaveWhatTheMachineHas) {
    struct sysinfo machine {};
    ASSERT_EQ(::sysinfo(&machine), 0);
    rlimit memory{};
    ASSERT_EQ(::getrlimit(RLIMIT_DATA, &memory), 0);
    const auto most = (std::uint64_t{machine.totalram} + machine.totalswap) * machine.mem_unit;
    EngineSession engine;
    EXPECT_EQ(limit(engine.client, "RLIMIT_DATA"), std::to_string(std::min(memory.rlim_cur, most)) + " " +
                                                       std::to_string(std::min(memory.rlim_max, most)) + "\n");
}

TEST_F(SessionLimitsTest, ByDefaultASessionMayHaveManyDescriptors) {
    rlimit descriptors{};
    ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &descriptors), 0);
    EngineSession engine;
    EXPECT_EQ(limit(engine.client, "RLIMIT_NOFILE"),
              std::to_string(std::min<rlim_t>(descriptors.rlim_cur, 65'536)) + " " +
                  std::to_string(std::min<rlim_t>(descriptors.rlim_max, 65'536)) + "\n");
}

TEST_F(SessionLimitsTest, EachSessionOfAListenerHasThem) {
    EngineProcess engine({"--listen", path_, "--limit-memory", "1GiB", "--limit-descriptors", "200"});
    engine.awaitStderr("krutil-qvm: serving " + path_ + "\n");
    for (int i = 0; i < 2; ++i) {
        EngineClient client(connectTo(path_));
        EXPECT_EQ(limit(client, "RLIMIT_DATA"), "1073741824 1073741824\n");
        EXPECT_EQ(limit(client, "RLIMIT_NOFILE"), "200 200\n");
    }
}

TEST_F(SessionLimitsTest, ProcessesAreBoundedByAListenerOnly) {
    EngineProcess engine({"--stdio", "--limit-processes", "20"});
    EXPECT_EQ(engine.wait(), 2);
    EXPECT_EQ(engine.stderrText(),
              "--limit-processes goes with --listen or --listen-fds\nRun with --help for more information.\n");
}

TEST_F(SessionLimitsTest, ProcessesOfAConnectionAreBoundedByItsServiceManager) {
    std::array<int, 2> pair{};
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair.data()), 0);
    const foundation::core::posix::OwnedDescriptor client(pair[0]);
    const foundation::core::posix::OwnedDescriptor connection(pair[1]);
    EngineProcess engine({"--listen-fds", "--limit-processes", "20"}, connection.get());
    EXPECT_EQ(engine.wait(), 3);
    EXPECT_EQ(
        engine.stderrText(),
        "krutil-qvm: --limit-processes goes with a socket that listens, and a connection was handed over. Let the "
        "service manager bound this process, for example with TasksMax=.\n");
}

TEST_F(SessionLimitsTest, AnEngineHasProcessesOfItsOwn) {
    EngineProcess engine({"--listen", path_, "--limit-processes", "15"});
    EXPECT_EQ(engine.wait(), 2);
    EXPECT_EQ(engine.stderrText(),
              "--limit-processes: Value 15 not in range 16 to 4194304\nRun with --help for more information.\n");
}

TEST_F(SessionLimitsTest, AMemoryLimitLeavesMathematicsAlone) {
    EngineSession engine({"--limit-memory", "1GiB"});
    EXPECT_EQ(engine.client.eval("import numpy\na = numpy.ones((500, 500))\nprint((a @ a)[0, 0])").output(), "500.0\n");
}

}  // namespace
}  // namespace qvm_test
