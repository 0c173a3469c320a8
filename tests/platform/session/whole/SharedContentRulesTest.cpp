// Contents in shared memory, with an end that is played byte by byte.
#include <pthread.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <filesystem>
#include <functional>
#include <future>
#include <ostream>
#include <string>
#include <system_error>
#include <utility>

#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"
#include "foundation/vantor/carrier/shared_memory/SegmentPool.hpp"
#include "platform/session/support/TestSessions.hpp"
#include "platform/session/support/WireBytes.hpp"
#include "platform/shared_memory/SharedMemorySupport.hpp"
#include "support/Pipe.hpp"

namespace testing_sessions {
namespace {

using foundation::vantor::carrier::shared_memory::SegmentPool;
using framing::BufferAllocator;
using testing::ElementsAre;
using testing_memory::allSeals;
using testing_memory::anonymousMemory;
using testing_memory::OwnedDescriptor;
using testing_memory::page;

constexpr std::size_t mebi = 1U << 20;

SessionConfig sharingConfig(Role role) {
    SessionConfig config = configOf(role);
    config.sharedMemory = true;
    return config;
}

// What the end that the test plays says in the probe.
struct Probe {
    OwnedDescriptor memory = anonymousMemory(page, page, allSeals);
    std::string token = "mmmmmmmm";
    char answer = '\1';
};

// A session whose stream passes descriptors; the peer is the test.
class SharingWithBytes {
  public:
    explicit SharingWithBytes(SessionConfig config, Probe probe = Probe()) {
        const Ends ends = socketPair();
        peer = std::make_unique<wire::ByteEnd>(ends.otherIn, ends.otherOut);
        auto opening = std::async(std::launch::async, [&] { return Session::open(ends.in, ends.out, config); });
        peer->shakeHands(true);
        std::vector<OwnedDescriptor> probed;
        const std::string token = peer->readWith(8, probed);
        EXPECT_EQ(probed.size(), 1U);
        if (probe.memory) {
            peer->writeWith(probe.token, {probe.memory.get()});
        } else {
            peer->write(probe.token);
        }
        answered = peer->read(1);
        peer->write(std::string(1, probe.answer));
        session = opening.get();
        session->start(saw);
    }

    bool shares() const { return session->features().contains("SHM"); }

    Registered protocol{"test"};
    Recorder saw;
    std::unique_ptr<wire::ByteEnd> peer;
    std::unique_ptr<Session> session;
    std::string answered;
};

// Descriptors of this process that stand for memory as the test makes it; each of them has to be close-on-exec.
std::size_t memoryDescriptors() {
    std::size_t count = 0;
    for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd")) {
        std::error_code gone;
        if (std::filesystem::read_symlink(entry, gone).string().starts_with("/memfd:test")) {
            EXPECT_EQ(::fcntl(std::stoi(entry.path().filename()), F_GETFD), FD_CLOEXEC);
            ++count;
        }
    }
    return count;
}

// Frame 1 on stream 1 in shared memory, and the question that it belongs to.
std::string sharedQuestion(std::uint64_t number, std::uint64_t offset, std::uint64_t size) {
    return wire::sharedData(1, 1, number, offset, size) + wire::tagged(1, 2, true, questionTag, "?");
}

TEST(SharedContentTest, IsReadWhereItIsAndGivenBack) {
    SharingWithBytes pair(sharingConfig(Role::Engine));
    ASSERT_TRUE(pair.shares());
    const auto memory = anonymousMemory(mebi + 3 * page, mebi + 3 * page, allSeals);
    const std::size_t descriptors = memoryDescriptors();
    pair.peer->writeWith(sharedQuestion(77, 2 * page, mebi), {memory.get()});
    EXPECT_THAT(pair.saw.waitForLines(1), ElementsAre("question 1 ?"));
    EXPECT_EQ(memoryDescriptors(), descriptors) << "closed once the memory is mapped";
    auto question = pair.saw.lastQuestion();
    const framing::Frame& frame = *question->received.at(0);
    EXPECT_EQ(frame.size(), mebi);
    EXPECT_EQ(std::string(frame.data(), frame.size()), std::string(mebi, 'm'));
    EXPECT_EQ(BufferAllocator::sizeOf(frame.data()), mebi);
    EXPECT_TRUE(BufferAllocator::isForeign(frame.data()));
    EXPECT_FALSE(BufferAllocator::isAdopted(frame.data())) << "code may write to it";
    question.reset();
    // The recorder keeps the latest question only.
    pair.peer->write(wire::tagged(2, 1, true, questionTag, "next"));
    EXPECT_EQ(pair.peer->read(24), wire::giveBack(77));
}

TEST(SharedContentTest, ReturnLeavesWithWhatIsHeldAndIsNoReasonToReadLess) {
    SessionConfig config = sharingConfig(Role::Engine);
    config.maxPendingAnswers = 1;
    SharingWithBytes pair(std::move(config));
    pair.peer->writeWith(sharedQuestion(77, 0, mebi), {anonymousMemory(mebi, mebi, allSeals).get()});
    pair.saw.waitForLines(1);
    auto question = pair.saw.lastQuestion();
    // The recorder keeps the latest question only.
    pair.peer->write(wire::tagged(2, 1, true, questionTag, "next"));
    pair.saw.waitForLines(2);
    const std::uint64_t before = pair.session->traffic().written;
    pair.session->send(0, notice("held"), Session::Urgency::Held);
    question.reset();
    EXPECT_EQ(pair.session->traffic().written, before);
    pair.peer->write(wire::tagged(3, 1, true, questionTag, "?") + wire::tagged(4, 1, true, questionTag, "still read"));
    EXPECT_EQ(pair.saw.waitForLines(4).back(), "question 4 still read");
    pair.session->sendHeld();
    EXPECT_EQ(pair.peer->read(24 + 11 + 4 + 24), wire::tagged(0, 1, true, noticeTag, "held") + wire::giveBack(77));
}

TEST(SharedContentTest, DescriptorsMayComeBeforeTheirFrames) {
    SharingWithBytes pair(sharingConfig(Role::Engine));
    const auto first = anonymousMemory(mebi, mebi, allSeals);
    const auto second = anonymousMemory(mebi, 1, allSeals);
    const std::string bytes = wire::sharedData(1, 1, 1, 0, mebi) + wire::sharedData(1, 2, 2, 0, mebi) +
                              wire::tagged(1, 3, true, questionTag, "two");
    const auto third = anonymousMemory(mebi, mebi, allSeals);
    const std::size_t descriptors = memoryDescriptors();
    pair.peer->writeWith(bytes.substr(0, 1), {first.get(), third.get(), second.get()});
    pair.peer->write(bytes.substr(1));
    EXPECT_THAT(pair.saw.waitForLines(1), ElementsAre("question 1 two"));
    EXPECT_EQ(pair.saw.lastQuestion()->received.size(), 2U);
    EXPECT_EQ(memoryDescriptors(), descriptors + 1) << "the last one waits for its frame";
}

// Called by the next fork of this process before it happens, if it is set.
std::function<void()> beforeFork;

TEST(SharedContentTest, IsGivenBackAsKeptWhenTheProcessForkedWhileItCame) {
    // Registered before the session's own watch, so that it is called after that.
    ASSERT_EQ(::pthread_atfork(
                  [] {
                      if (beforeFork) {
                          std::exchange(beforeFork, nullptr)();
                      }
                  },
                  nullptr, nullptr),
              0);
    SharingWithBytes pair(sharingConfig(Role::Engine));
    const auto memory = anonymousMemory(mebi, mebi, allSeals);
    beforeFork = [&] {
        pair.peer->writeWith(sharedQuestion(77, 0, mebi), {memory.get()});
        pair.saw.waitForLines(1);
    };
    const pid_t child = ::fork();
    if (child == 0) {
        ::_exit(0);
    }
    EXPECT_EQ(::waitpid(child, nullptr, 0), child);
    pair.saw.lastQuestion().reset();
    // The recorder keeps the latest question only.
    pair.peer->write(wire::tagged(2, 1, true, questionTag, "next"));
    EXPECT_EQ(pair.peer->read(24), wire::giveBack(77, true));
}

TEST(SharedContentTest, OutlivesTheSession) {
    boost::shared_ptr<const Question> question;
    {
        SharingWithBytes pair(sharingConfig(Role::Engine));
        pair.peer->writeWith(sharedQuestion(1, 0, mebi), {anonymousMemory(mebi, mebi, allSeals).get()});
        pair.saw.waitForLines(1);
        question = pair.saw.lastQuestion();
    }
    EXPECT_EQ(question->received.at(0)->data()[mebi - 1], 'm');
}

// What is sent in place of an honest content, and what comes of it.
struct Wrong {
    std::string name;
    std::function<OwnedDescriptor()> memory;
    std::uint64_t offset = 0;
    std::uint64_t size = mebi;
    std::string refusal;
};

std::ostream& operator<<(std::ostream& out, const Wrong& wrong) {
    return out << wrong.name;
}

std::string nameOfWrong(const testing::TestParamInfo<Wrong>& info) {
    std::string name = info.param.name;
    std::replace_if(
        name.begin(), name.end(), [](char c) { return std::isalnum(static_cast<unsigned char>(c)) == 0; }, '_');
    return name;
}

class WrongContentTest : public testing::TestWithParam<Wrong> {};

TEST_P(WrongContentTest, ClosesTheSession) {
    const std::size_t buffers = BufferAllocator::inUse();
    SharingWithBytes pair(sharingConfig(Role::Engine));
    const OwnedDescriptor memory = GetParam().memory();
    const std::string bytes = sharedQuestion(1, GetParam().offset, GetParam().size);
    if (memory) {
        pair.peer->writeWith(bytes, {memory.get()});
    } else {
        pair.peer->write(bytes);
    }
    const SessionEnd end = pair.saw.waitForEnd();
    EXPECT_EQ(end.reason, Reason::Violation);
    EXPECT_EQ(end.text, GetParam().refusal);
    EXPECT_EQ(pair.peer->readAll(), wire::abort(end.text));
    EXPECT_EQ(BufferAllocator::inUse(), buffers);
}

INSTANTIATE_TEST_SUITE_P(
    Memory, WrongContentTest,
    testing::Values(
        Wrong{"none", [] { return OwnedDescriptor(); }, 0, mebi,
              "shared content of frame 1 on stream 1: expected a descriptor, got none"},
        Wrong{"unsealed", [] { return anonymousMemory(mebi, mebi, 0); }, 0, mebi,
              "shared content of frame 1 on stream 1: expected the seals SHRINK, GROW, FUTURE_WRITE, SEAL, got none"},
        Wrong{"may be truncated", [] { return anonymousMemory(mebi, mebi, allSeals & ~F_SEAL_SHRINK); }, 0, mebi,
              "shared content of frame 1 on stream 1: expected the seals SHRINK, GROW, FUTURE_WRITE, SEAL, got GROW, "
              "FUTURE_WRITE, SEAL"},
        Wrong{"too short", [] { return anonymousMemory(mebi - 1, mebi - 1, allSeals); }, 0, mebi,
              "shared content of frame 1 on stream 1: expected 1048576 bytes from 0 on, got memory of 1048575 bytes"},
        Wrong{"sparse", [] { return anonymousMemory(mebi, page, allSeals); }, 0, mebi,
              "shared content of frame 1 on stream 1: expected 1048576 allocated bytes, got 4096"},
        Wrong{"a file", [] { return OwnedDescriptor(::open("/proc/self/exe", O_RDONLY | O_CLOEXEC)); }, 0, mebi,
              "shared content of frame 1 on stream 1: expected a descriptor of anonymous memory, got one of another "
              "kind"},
        Wrong{"a socket", [] { return OwnedDescriptor(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)); }, 0, mebi,
              "shared content of frame 1 on stream 1: expected a descriptor of anonymous memory, got one of another "
              "kind"},
        Wrong{"not readable",
              [] {
                  const auto memory = anonymousMemory(mebi, mebi, 0);
                  OwnedDescriptor writing(
                      ::open(("/proc/self/fd/" + std::to_string(memory.get())).c_str(), O_WRONLY | O_CLOEXEC));
                  EXPECT_EQ(::fcntl(memory.get(), F_ADD_SEALS, allSeals), 0);
                  return writing;
              },
              0, mebi,
              "shared content of frame 1 on stream 1: expected memory that can be mapped, got Permission denied"},
        Wrong{"not at a page", [] { return anonymousMemory(2 * mebi, 2 * mebi, allSeals); }, 64, mebi,
              "shared content of frame 1 on stream 1: expected 1 byte or more from a multiple of 4096 on, got 1048576 "
              "bytes from 64 on"},
        Wrong{"small", [] { return anonymousMemory(2 * mebi, 2 * mebi, allSeals); }, 0, mebi - 1,
              "shared content of frame 1 on stream 1: expected 1048576 bytes or more, got 1048575"}),
    nameOfWrong);

// What an engine refuses for its bytes alone.
std::string refusalOf(const std::string& bytes, SessionConfig config = sharingConfig(Role::Engine)) {
    SharingWithBytes pair(std::move(config));
    pair.peer->writeWith(bytes, {anonymousMemory(4 * mebi, 4 * mebi, allSeals).get()});
    return pair.saw.waitForEnd().text;
}

TEST(SharedContentTest, CountsForTheLimitOfAMessage) {
    SessionConfig config = sharingConfig(Role::Engine);
    config.limits.message = 3 * mebi;
    EXPECT_EQ(refusalOf(sharedQuestion(1, 0, 3 * mebi + 1), config),
              "message with frame 1 on stream 1 exceeds the limit \"message\": expected at most 3145728 bytes, got 0 "
              "bytes and a content of 3145729");
    EXPECT_EQ(refusalOf(sharedQuestion(1, 0, 3 * mebi), config),
              "message with frame 2 on stream 1 exceeds the limit \"message\": expected at most 3145728 bytes, got "
              "3145741 bytes and a content of 1");
}

TEST(SharedContentTest, HeadersAreChecked) {
    EXPECT_EQ(refusalOf(wire::header({5, false, 4, 0, 1, 1, 16})),
              "content of a shared data frame (frame 1 on stream 1): expected 24 bytes, got 16");
    EXPECT_EQ(refusalOf(wire::header({5, false, 4, 3, 1, 1, 24})),
              "tag of a data frame (frame 1 on stream 1): expected none, got 3 bytes");
    EXPECT_EQ(
        refusalOf(wire::header({7, false, 0, 0, 0, 0, 0})),
        "frame kind: expected 1 (tagged), 2 (data), 3 (goodbye), 4 (abort), 5 (shared data) or 6 (return), got 7");
    const std::string fields =
        "return frame: expected frame type 0 or 1, and last bit, tag size, stream ID and content size 0";
    EXPECT_EQ(refusalOf(wire::header({6, true, 0, 0, 0, 1, 0})), fields);
    EXPECT_EQ(refusalOf(wire::header({6, false, 2, 0, 0, 1, 0})), fields);
    EXPECT_EQ(refusalOf(wire::header({6, false, 0, 1, 0, 1, 0})), fields);
    EXPECT_EQ(refusalOf(wire::header({6, false, 0, 0, 1, 1, 0})), fields);
    EXPECT_EQ(refusalOf(wire::header({6, false, 0, 0, 0, 1, 1})), fields);
    EXPECT_EQ(refusalOf(wire::data(1, 1, false, "x") + wire::giveBack(1)),
              "return frame in the middle of a message: expected frame 2");
}

TEST(SharedContentTest, OnlyWhatIsLentIsTakenBack) {
    EXPECT_EQ(refusalOf(wire::giveBack(1)), "return frame: expected the number of a content that is lent, got 1");
    EXPECT_EQ(refusalOf(wire::giveBack(~std::uint64_t{0}, true)),
              "return frame: expected the number of a content that is lent, got 18446744073709551615");
}

TEST(SharedContentTest, DescriptorsAreBounded) {
    const auto memory = anonymousMemory(page, page, allSeals);
    const std::string header = wire::tagged(1, 1, true, questionTag, "?");
    {
        SharingWithBytes pair(sharingConfig(Role::Engine));
        pair.peer->writeWith(header.substr(0, 1), std::vector<int>(32, memory.get()));
        pair.peer->writeWith(header.substr(1), {memory.get()});
        EXPECT_EQ(pair.saw.waitForEnd().text,
                  "expected at most 32 descriptors ahead of the frames that need them, got 33");
    }
    SharingWithBytes pair(sharingConfig(Role::Engine));
    pair.peer->writeWith(header, std::vector<int>(33, memory.get()));
    EXPECT_EQ(pair.saw.waitForEnd().text,
              "expected at most 32 descriptors at once, and as many as this process may still open; some are lost");
}

TEST(SharedContentTest, NothingIsSharedUnlessEachEndHasSeenTheOthersMemory) {
    const auto sharedWith = [](Probe probe, char answer) {
        SharingWithBytes pair(sharingConfig(Role::Engine), std::move(probe));
        EXPECT_EQ(pair.answered, std::string(1, answer));
        if (!pair.shares()) {
            pair.peer->write(wire::sharedData(1, 1, 1, 0, mebi));
            EXPECT_EQ(pair.saw.waitForEnd().text,
                      "frame kind: expected 1 (tagged), 2 (data), 3 (goodbye) or 4 (abort), got 5");
        }
        return pair.shares();
    };
    EXPECT_TRUE(sharedWith(Probe(), '\1'));
    EXPECT_FALSE(sharedWith({OwnedDescriptor(), "mmmmmmmm", '\1'}, '\0')) << "descriptors are dropped on the way";
    EXPECT_FALSE(sharedWith({anonymousMemory(page, page, allSeals), "mmmmmmmn", '\1'}, '\0'));
    EXPECT_FALSE(sharedWith({anonymousMemory(page, page, 0), "mmmmmmmm", '\1'}, '\0'));
    EXPECT_FALSE(sharedWith({anonymousMemory(page, page, allSeals), "mmmmmmmm", '\0'}, '\1'));
}

TEST(SharedContentTest, AnswerToTheProbeIsAByte) {
    const Registered protocol("test");
    const Ends ends = socketPair();
    wire::ByteEnd peer(ends.otherIn, ends.otherOut);
    auto opening =
        std::async(std::launch::async, [&] { return Session::open(ends.in, ends.out, sharingConfig(Role::Engine)); });
    peer.shakeHands(true);
    peer.write("mmmmmmmm\2");
    EXPECT_EQ(textOf<session::ProtocolViolation>([&] { opening.get(); }),
              "the peer's answer to the probe of shared memory: expected 0 or 1, got 2");
}

// An end that lends: the bytes that it sends, and what it does with what comes back.
class LendingTest : public testing::Test {
  protected:
    // A question with a content in shared memory; returns its number.
    std::uint64_t lend(std::size_t size) {
        // What is copied is lent from the second time on.
        for (;;) {
            const auto bulk = std::make_shared<Bulk>();
            bulk->bytes = std::string(size, 'b');
            pair_.session->send(pair_.session->newStreamID(), question("?", {bulk}));
            ++stream_;
            std::vector<OwnedDescriptor> descriptors;
            const std::string header = pair_.peer->readWith(24, descriptors);
            if (header == wire::header({2, false, 4, 0, stream_, 1, size})) {
                pair_.peer->read(size + wire::tagged(stream_, 2, true, questionTag, "?").size());
                continue;
            }
            EXPECT_TRUE(bulk->dropped) << "what was copied is not needed any more";
            EXPECT_EQ(header, wire::header({5, false, 4, 0, stream_, 1, 24}));
            const std::string content = pair_.peer->read(24);
            EXPECT_EQ(content.substr(8), wire::little(0, 8) + wire::little(size, 8));
            EXPECT_EQ(pair_.peer->read(24 + 13 + 1), wire::tagged(stream_, 2, true, questionTag, "?"));
            EXPECT_EQ(descriptors.size(), 1U);
            descriptor_ = std::move(descriptors.at(0));
            std::string seen(size, '\0');
            EXPECT_EQ(::pread(descriptor_.get(), seen.data(), size, 0), static_cast<ssize_t>(size));
            EXPECT_EQ(seen, bulk->bytes);
            return static_cast<unsigned char>(content[0]);
        }
    }

    // Returns once the session has taken what the peer wrote.
    void awaitTaken() {
        pair_.peer->write(wire::tagged(0, 1, true, noticeTag, "taken"));
        pair_.saw.waitForLines(++notices_);
    }

    SegmentPool& pool_ = SegmentPool::ofProcess();
    SharingWithBytes pair_{sharingConfig(Role::Client)};
    OwnedDescriptor descriptor_;
    std::uint64_t stream_ = 0;
    std::size_t notices_ = 0;
};

TEST_F(LendingTest, WhatCameBackIsUsedAgain) {
    const std::uint64_t first = lend(mebi);
    EXPECT_EQ(pool_.inUse(), 1U);
    pair_.peer->write(wire::giveBack(first));
    awaitTaken();
    EXPECT_EQ(pool_.inUse(), 0U);
    const std::size_t segments = pool_.size();
    EXPECT_NE(lend(mebi), first);
    EXPECT_EQ(pool_.size(), segments);
    const std::uint64_t third = lend(mebi);
    EXPECT_EQ(pool_.inUse(), 2U) << "the second has not come back";
    pair_.peer->write(wire::giveBack(third) + wire::giveBack(third));
    EXPECT_EQ(pair_.saw.waitForEnd().text,
              "return frame: expected the number of a content that is lent, got " + std::to_string(third));
    EXPECT_EQ(pool_.inUse(), 0U) << "the end of the session takes all back";
}

TEST_F(LendingTest, WhatIsKeptIsNotUsedAgain) {
    const std::uint64_t number = lend(mebi);
    const std::size_t segments = pool_.size();
    pair_.peer->write(wire::giveBack(number, true));
    awaitTaken();
    EXPECT_EQ(pool_.inUse(), 0U);
    EXPECT_EQ(pool_.size(), segments - 1);
}

TEST_F(LendingTest, WhatNeverComesBackIsBoundedAndTheRestTravelsAsBytes) {
    const SegmentPool::Bounds bounds;
    for (std::size_t i = 0; i < bounds.segments; ++i) {
        lend(mebi);
    }
    EXPECT_EQ(pool_.inUse(), bounds.segments);
    const auto bulk = std::make_shared<Bulk>();
    bulk->bytes = std::string(mebi, 'c');
    pair_.session->send(pair_.session->newStreamID(), question("?", {bulk}));
    EXPECT_EQ(pair_.peer->read(24 + mebi), wire::data(++stream_, 1, false, bulk->bytes));
}

}  // namespace
}  // namespace testing_sessions
