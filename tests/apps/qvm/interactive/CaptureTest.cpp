// What C libraries and child processes write to descriptors 1 and 2.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "apps/qvm/fixture/EngineFixture.hpp"

namespace qvm_test {
namespace {

using testing::HasSubstr;

class CaptureTest : public testing::Test {
  protected:
    EngineClient& client() { return engine_.client; }

    // Background text of one stream type.
    std::string background(StreamTypeEnum type) {
        std::string joined;
        for (const Happening& each : client().background()) {
            EXPECT_EQ(each.kind, "TextBaseEvent");
            EXPECT_EQ(each.id, IDType());
            joined += each.type == type ? each.text : "";
        }
        return joined;
    }
    std::string plainOutput() { return background(StreamTypeEnum::GENERIC_STREAM); }
    std::string plainErrors() { return background(StreamTypeEnum::ERROR_STREAM); }

    EngineSession engine_;
};

TEST_F(CaptureTest, WritesToTheDescriptorsAreBackgroundText) {
    const Evaluation result = client().eval("import os\nos.write(1, b'one')\nos.write(2, b'two')\nNone");
    EXPECT_EQ(result.output(), "");
    EXPECT_EQ(plainOutput(), "one");
    EXPECT_EQ(plainErrors(), "two");
    EXPECT_EQ(engine_.process.stderrText(), "");
}

TEST_F(CaptureTest, ProgramsOutputIsCompleteBeforeTheReply) {
    client().eval("import subprocess\nsubprocess.run('seq 1 20000', shell=True)\nNone");
    const std::string text = plainOutput();
    EXPECT_EQ(text.size(), 108894U);
    EXPECT_THAT(text, HasSubstr("\n19999\n20000\n"));
}

TEST_F(CaptureTest, TextOfTheCLibraryIsCompleteBeforeTheReply) {
    client().eval("import ctypes\nc = ctypes.CDLL(None)\nc.printf(b'a line\\n and a part')\nNone");
    EXPECT_EQ(plainOutput(), "a line\n and a part");
}

TEST_F(CaptureTest, OrderWithPythonsOwnTextIsKept) {
    const IDType id = client().enqueue(
        "import os\nfor i in range(100):\n    print('p', i, end='')\n    os.write(1, f'w{i} '.encode())");
    const Evaluation result = client().await(id);
    std::string all;
    std::string expected;
    client().awaitEvent([&](const Happening& each) {
        all += each.kind == "TextBaseEvent" ? each.text : "";
        return each.kind == "IIPCompletedEvent";
    });
    for (int i = 0; i < 100; ++i) {
        expected += "p " + std::to_string(i) + "w" + std::to_string(i) + " ";
    }
    EXPECT_EQ(all, expected);
}

TEST_F(CaptureTest, SequencesAreKeptTogetherAndBadBytesReplaced) {
    client().eval(
        "import os, time\n"
        "for byte in '\u00e9\u20ac\U0001F600'.encode(): os.write(1, bytes([byte])); print(end='', flush=True)\n"
        "os.write(2, b'a\\xffb\\xe2\\x82')\nNone");
    EXPECT_EQ(plainOutput(), "\u00e9\u20ac\U0001F600");
    EXPECT_EQ(plainErrors(), "a\uFFFDb\uFFFD");
}

TEST_F(CaptureTest, ProcessThatOutlivesItsRequestIsHeard) {
    Gate gate;
    client().eval("import subprocess\np = subprocess.Popen(['sh', '-c', 'cat " +
                  gate.wait().substr(6, gate.wait().find("')") - 6) + "; echo late'])");
    gate.open();
    client().awaitText("late\n");
    client().eval("p.wait()");
}

TEST_F(CaptureTest, WriterWaitsForAClientThatDoesNotRead) {
    // More than any buffer on the way; the engine must not hold it.
    client().slowDown(std::chrono::milliseconds(2));
    const IDType id =
        client().enqueue(usedMemory +
                         "import subprocess, time\n"
                         "before = most = used()\n"
                         "writer = subprocess.Popen('head -c 20000000 /dev/zero | tr \\\\\\\\0 x', shell=True)\n"
                         "while writer.poll() is None:\n"
                         "    most = max(most, used())\n"
                         "    time.sleep(.001)\n"
                         "most - before if most - before > 5_000_000 else 'little'");
    EXPECT_EQ(client().await(id).shown(), "'little'\n");
    client().slowDown(std::chrono::microseconds(0));
    EXPECT_EQ(plainOutput().size(), 20'000'000U);
}

TEST_F(CaptureTest, LastWordsOfTheEngineGoToItsOwnStandardError) {
    engine_.client.session().abort("enough of this");
    engine_.process.awaitStderr("krutil-qvm: ");
}

}  // namespace
}  // namespace qvm_test
