// Files of the engine that find no room: a person is told, and the exit code tells programs.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>

#include "apps/qvm/fixture/EngineFixture.hpp"
#include "support/TemporaryDirectory.hpp"

namespace qvm_test {
namespace {

using testing::ContainsRegex;
using testing::HasSubstr;

constexpr char noRoom[] =
    "krutil-qvm: cannot write to '/dev/full': No space left on device; text for it is lost until there is room\n";

EvalOptions withOut(bool diary, bool log) {
    EvalOptions options;
    options.out = krutil::io::SinkTraits(false, false, false, diary, false, log);
    return options;
}

TEST(FullDiskTest, ADiaryThatLosesTextSaysSoOnceAndInTheExitCode) {
    EngineSession engine({"--diary", "/dev/full"});
    EXPECT_EQ(engine.client.eval("print('one')", withOut(true, false)).output(), "one\n");
    EXPECT_EQ(engine.client.eval("print('three')", withOut(true, false)).output(), "three\n");
    engine.client.goodbye();
    EXPECT_EQ(engine.process.wait(), 3);
    EXPECT_EQ(engine.process.stderrText(),
              std::string(noRoom) + "krutil-qvm: '/dev/full' is not complete: 10 bytes are lost\n");
}

TEST(FullDiskTest, ADiaryThatGetsNoTextIsComplete) {
    EngineSession engine({"--diary", "/dev/full"});
    engine.client.eval("print('not for the diary')");
    engine.client.goodbye();
    EXPECT_EQ(engine.process.wait(), 0);
    EXPECT_EQ(engine.process.stderrText(), "");
}

TEST(FullDiskTest, ALogThatLosesTextSaysSoOnceAndInTheExitCode) {
    EngineSession engine({"--log", "/dev/full"});
    EXPECT_EQ(engine.client.eval("print('on')", withOut(false, true)).output(), "on\n");
    engine.client.goodbye();
    EXPECT_EQ(engine.process.wait(), 3);
    const std::string said = engine.process.stderrText();
    EXPECT_EQ(said.find(noRoom), 0U) << said;
    EXPECT_EQ(said.find(noRoom, 1), std::string::npos) << said;
    EXPECT_THAT(said, ContainsRegex("krutil-qvm: '/dev/full' is not complete: [0-9]+ bytes are lost\n$"));
}

TEST(FullDiskTest, ASessionThatIsBrokenOffWhileCodeRunsCountsItToo) {
    EngineSession engine({"--diary", "/dev/full"});
    engine.client.enqueue("print('lost')\nwhile True: pass", withOut(true, false));
    engine.client.awaitText("lost");
    engine.client.session().abort("enough");
    // What went wrong before counts.
    EXPECT_EQ(engine.process.wait(), 4);
    EXPECT_THAT(engine.process.stderrText(), HasSubstr("krutil-qvm: '/dev/full' is not complete: 5 bytes are lost\n"));
}

TEST(FullDiskTest, AListeningEngineAndItsSessionsCountApart) {
    const test_support::TemporaryDirectory directory;
    const std::string path = directory.file("private/socket");
    EngineProcess engine({"--listen", path, "--log", "/dev/full"});
    engine.awaitStderr("serving " + path + "\n");
    {
        EngineClient client(connectTo(path));
        client.eval("1");
        client.goodbye();
    }
    engine.awaitStderr("is not complete: ");
    engine.signal(SIGTERM);
    EXPECT_EQ(engine.wait(), 3);
    const std::string said = engine.stderrText();
    // The listener's own line, and the session's two.
    std::size_t notes = 0;
    std::size_t counts = 0;
    for (std::size_t at = 0; (at = said.find("krutil-qvm: cannot write to", at)) != std::string::npos; ++at) {
        ++notes;
    }
    for (std::size_t at = 0; (at = said.find("krutil-qvm: '/dev/full' is not complete", at)) != std::string::npos;
         ++at) {
        ++counts;
    }
    EXPECT_EQ(notes, 2U) << said;
    EXPECT_EQ(counts, 2U) << said;
}

}  // namespace
}  // namespace qvm_test
