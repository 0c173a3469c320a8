// Recordings that the programs make, and what they say of sessions.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "programs/support/Program.hpp"
#include "programs/support/Relay.hpp"
#include "support/FileContent.hpp"
#include "support/Pcapng.hpp"
#include "support/TemporaryDirectory.hpp"

namespace programs_test {
namespace {

using test_support::packetsOf;
using test_support::RecordedPacket;
using test_support::recordedStream;
using test_support::TemporaryDirectory;
using ::testing::HasSubstr;

constexpr std::uint32_t inbound = 1;
constexpr std::uint32_t outbound = 2;

class ProgramRecordingTest : public ::testing::Test {
  protected:
    std::vector<RecordedPacket> recorded(const std::string& file) const {
        return packetsOf(test_support::contentOf(file));
    }

    std::string engine(const std::string& options) const {
        return quotedForShell(enginePath()) + " --stdio " + options;
    }

    const TemporaryDirectory directory_{};
    const std::string file_ = directory_.file("client.pcapng");
};

TEST_F(ProgramRecordingTest, BothEndsRecordTheBytesOfTheStream) {
    const std::string socket = directory_.file("engine.sock");
    Program listening({enginePath(), "--listen", socket, "--record", directory_.file("engine.pcapng")});
    ASSERT_TRUE(listening.waitForErr("serving "));
    Relay relay(directory_.file("relay.sock"), socket);
    relay.record();
    // Descriptors do not pass the relay, so there is no shared memory.
    const Ran ran = runClient({"call", "numpy.full", "[400,400]", "7.5", "--connect", relay.path(), "--record", file_});
    EXPECT_EQ(ran.exitCode, 0) << ran.err;
    listening.signal(SIGTERM);
    listening.finish();
    relay.cut();

    const auto client = recorded(file_);
    EXPECT_TRUE(recordedStream(client, outbound) == relay.recorded(Relay::Way::ToEngine));
    EXPECT_TRUE(recordedStream(client, inbound) == relay.recorded(Relay::Way::ToClient));
    EXPECT_GT(recordedStream(client, inbound).size(), 400U * 400U * 8U);
    std::string session;
    for (const auto& entry : std::filesystem::directory_iterator(directory_.path())) {
        if (entry.path().filename().string().starts_with("engine.pcapng.")) {
            session = entry.path();
        }
    }
    const auto engine = recorded(session);
    ASSERT_FALSE(engine.empty());
    EXPECT_EQ(engine[0].interface, "engine " + session.substr(session.rfind('.') + 1));
    EXPECT_TRUE(recordedStream(engine, inbound) == recordedStream(client, outbound));
    EXPECT_TRUE(recordedStream(engine, outbound) == recordedStream(client, inbound));
    struct stat status {};
    for (const std::string& file : {file_, session}) {
        ASSERT_EQ(::stat(file.c_str(), &status), 0);
        EXPECT_EQ(status.st_mode & 07777U, 0600U) << file;
    }
}

TEST_F(ProgramRecordingTest, ContentInSharedMemoryIsRecordedAsBytes) {
    const std::string array = directory_.file("array.npy");
    ASSERT_EQ(runClient({"call", "numpy.full", "150000", "7.5", "-o", array}).exitCode, 0);
    const std::string engineFile = directory_.file("engine.pcapng");
    // Of two arguments of a size, the second one is shared.
    const Ran ran =
        runClient({"call", "numpy.add", array, array, "--engine", engine("--record " + engineFile), "--record", file_});
    EXPECT_EQ(ran.exitCode, 0) << ran.err;
    const auto client = recorded(file_);
    // Header, 24 bytes that say where the content is, and the content.
    EXPECT_EQ(std::count_if(client.begin(), client.end(),
                            [](const RecordedPacket& packet) { return packet.comment == "bytes 0-262127 of 1200048"; }),
              1);
    EXPECT_TRUE(recordedStream(client, outbound) == recordedStream(recorded(engineFile), inbound));
    EXPECT_TRUE(recordedStream(client, inbound) == recordedStream(recorded(engineFile), outbound));
}

TEST_F(ProgramRecordingTest, SnapKeepsBeginnings) {
    const Ran ran = runClient({"call", "numpy.ones", "100000", "--record", file_, "--record-snap", "40"});
    EXPECT_EQ(ran.exitCode, 0) << ran.err;
    std::size_t cut = 0;
    for (const RecordedPacket& packet : recorded(file_)) {
        if (packet.comment == "bytes 0-39 of 800024") {
            ++cut;
            EXPECT_EQ(packet.data.size(), 40U);
            EXPECT_EQ(packet.original, 16U + 800'024U);
        }
    }
    EXPECT_EQ(cut, 1U);
}

TEST_F(ProgramRecordingTest, FileOfBoundedSizeGoesOnInAnother) {
    const std::string engineFile = directory_.file("engine.pcapng");
    const Ran ran =
        runClient({"eval", "for i in range(30): print(str(i) * 50_000, flush=True)", "--record", file_, "--record-size",
                   "1MiB", "--engine", engine("--record " + engineFile + " --record-size 1MiB")});
    EXPECT_EQ(ran.exitCode, 0) << ran.err;
    for (const std::string& file : {file_, engineFile}) {
        const std::uint32_t fromClient = file == file_ ? outbound : inbound;
        EXPECT_LE(std::filesystem::file_size(file), 1'048'576U);
        EXPECT_GT(std::filesystem::file_size(file + ".1"), 900'000U);
        const auto packets = recorded(file);
        // First messages, verdicts, tokens and answers; the request, its message, and that it is running.
        EXPECT_EQ(packets.at(0).section, "continued: repeats 11 packets of an earlier file");
        const std::string sent = recordedStream(packets, fromClient);
        EXPECT_THAT(sent, ::testing::StartsWith("\x89KRUTIL\n"));
        EXPECT_THAT(sent, HasSubstr("for i in range(30)"));
        EXPECT_THAT(packets.at(10).data, HasSubstr("krutil:IIPStartedEvent"));
        EXPECT_THAT(packets.at(11).data, HasSubstr("krutil:TextBaseEvent"));
        EXPECT_THAT(packets.back().data, HasSubstr("krutil:QVMShutdownEvent"));
    }
}

TEST_F(ProgramRecordingTest, RedactedCopyHasNoText) {
    const Ran ran =
        runClient({"eval", "secret = 'word' * 3\nprint(secret)\nraise ValueError(secret)", "--record", file_});
    EXPECT_EQ(ran.exitCode, 1) << ran.err;
    const std::string copy = directory_.file("copy.pcapng");
    const Ran redacted = run(clientCommand({"inspect", file_, "--redact", copy}));
    EXPECT_EQ(redacted.exitCode, 0);
    EXPECT_EQ(redacted.out + redacted.err, "");
    const auto before = recorded(file_);
    const auto now = recorded(copy);
    EXPECT_THAT(recordedStream(before, inbound), HasSubstr("wordword"));
    EXPECT_THAT(recordedStream(now, inbound) + recordedStream(now, outbound), ::testing::Not(HasSubstr("word")));
    EXPECT_THAT(recordedStream(now, outbound), HasSubstr("krutil:EvalIIP"));
    EXPECT_EQ(recordedStream(now, inbound).size(), recordedStream(before, inbound).size());
    EXPECT_EQ(now.size(), before.size());
    const Ran again = run(clientCommand({"inspect", file_, "--redact", copy}));
    EXPECT_EQ(again.err, "krutil: cannot create '" + copy + "': File exists\n");
    EXPECT_EQ(again.exitCode, 2);
}

TEST_F(ProgramRecordingTest, FullDiskIsSaidOnceAndInTheExitCode) {
    const std::string sentence = "cannot write to '/dev/full': No space left on device; the recording ends here\n";
    const Ran client = runClient({"eval", "1 + 1", "--record", "/dev/full"});
    EXPECT_EQ(client.out, "2\n");
    EXPECT_EQ(client.err, "krutil: " + sentence);
    EXPECT_EQ(client.exitCode, 2);

    const std::string status = directory_.file("status");
    const Ran engineRan = runClient(
        {"eval", "1 + 1", "--engine", engine("--record /dev/full") + "; echo $? > " + quotedForShell(status)});
    EXPECT_EQ(engineRan.out, "2\n");
    EXPECT_EQ(engineRan.err, "krutil-qvm: " + sentence);
    std::ifstream in(status);
    int code = 0;
    in >> code;
    EXPECT_EQ(code, 3);
}

TEST_F(ProgramRecordingTest, FileThatCannotBeMadeIsAnErrorBeforeAnythingRuns) {
    const std::string nowhere = directory_.file("no/such/file");
    const Ran client = runClient({"eval", "print('ran')", "--record", nowhere});
    EXPECT_EQ(client.out, "");
    EXPECT_EQ(client.err, "krutil: cannot record to '" + nowhere + "': No such file or directory\n");
    EXPECT_EQ(client.exitCode, 2);
    const Ran engineRan = run({enginePath(), "--stdio", "--record", nowhere});
    EXPECT_EQ(engineRan.err, "krutil-qvm: cannot record to '" + nowhere + "': No such file or directory\n");
    EXPECT_EQ(engineRan.exitCode, 3);
}

TEST_F(ProgramRecordingTest, WhatEndsTheEngineEndsNoRecordingEarly) {
    const std::string engineFile = directory_.file("engine.pcapng");
    const Ran ran = runClient({"eval", "import os\nprint('last words', flush=True)\nos.kill(os.getpid(), 9)",
                               "--engine", "exec " + engine("--record " + engineFile), "--record", file_});
    EXPECT_EQ(ran.exitCode, 3) << ran.err;
    EXPECT_THAT(recordedStream(recorded(engineFile), outbound), HasSubstr("last words"));
    EXPECT_THAT(recordedStream(recorded(file_), inbound), HasSubstr("last words"));
}

}  // namespace
}  // namespace programs_test
