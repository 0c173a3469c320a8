// One session of a listening engine does all the harm that it can. The others are answered meanwhile, and the listener
// keeps nothing of it.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>

#include <cstddef>
#include <filesystem>
#include <memory>
#include <random>
#include <stdexcept>
#include <string>
#include <vector>

#include "apps/qvm/bytes/ByteClient.hpp"
#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "platform/session/support/WireBytes.hpp"
#include "programs/lifecycle/Processes.hpp"
#include "support/Eventually.hpp"
#include "support/TemporaryDirectory.hpp"

namespace qvm_test {
namespace {

using foundation::core::posix::OwnedDescriptor;
using programs_test::childrenOf;
using programs_test::descriptorsOf;

// Sanitizers need several times the memory and the time for each.
#if defined(KRUTIL_SANITIZED)
constexpr std::size_t neighbours = 7;
#else
constexpr std::size_t neighbours = 31;
#endif

// A session that asks for its next number again and again, and has more requests waiting than it has answers to.
class Neighbour {
  public:
    explicit Neighbour(const std::string& path) : client_(connectTo(path)) {
        asked_.push_back(client_.enqueue("count = 1\nprint(count)"));
    }

    // `first` is what the first of these requests does before it answers.
    void ask(std::size_t requests, const std::string& first) {
        for (std::size_t i = 0; i < requests; ++i) {
            asked_.push_back(client_.enqueue((i == 0 ? first : std::string()) + "count += 1\nprint(count)"));
        }
    }

    // Each request was answered, and the requests ended in their order.
    void expectAnswers() {
        for (; answered_ < asked_.size(); ++answered_) {
            const Evaluation answer = client_.await(asked_[answered_]);
            ASSERT_EQ(answer.output() + answer.errorText(), std::to_string(answered_ + 1) + "\n");
        }
        // All have come, so each is looked at once, but for the last one.
        std::vector<IDType> ended;
        client_.awaitEvent([&](const Happening& each) {
            if (each.kind == "LastIIPEvent" && (ended.empty() || ended.back() != each.id)) {
                ended.push_back(each.id);
            }
            return each.id == asked_.back() && each.kind == "LastIIPEvent";
        });
        EXPECT_TRUE(ended == asked_);
    }

    session::SessionEnd goodbye() { return client_.goodbye(); }

  private:
    EngineClient client_;
    std::vector<IDType> asked_;
    std::size_t answered_ = 0;
};

class HostileNeighbourTest : public testing::Test {
  protected:
    HostileNeighbourTest() {
        programs_test::adoptOrphans();
        EXPECT_EQ(::mkfifo(gate_.c_str(), 0600), 0);
        std::vector<std::string> arguments{"--listen", path_};
#if !defined(KRUTIL_SANITIZED)
        arguments.insert(arguments.end(), {"--limit-memory", "256MiB", "--limit-descriptors", "200"});
#endif
        engine_ = std::make_unique<EngineProcess>(arguments);
        engine_->awaitStderr("krutil-qvm: serving " + path_ + "\n");
        atFirst_ = descriptorsOf(engine_->pid());
        for (std::size_t i = 0; i < neighbours; ++i) {
            others_.push_back(std::make_unique<Neighbour>(path_));
        }
        // The listener has a line to each handshake, which it closes when it sees that the other end has.
        EXPECT_TRUE(hasOnly(neighbours));
    }

    void TearDown() override {
        const OwnedDescriptor open = openGate();
        EngineClient last(connectTo(path_));
        EXPECT_EQ(last.eval("6 * 7").shown(), "42\n");
        EXPECT_EQ(last.goodbye().reason, session::SessionEnd::Reason::Finished);
        for (const auto& other : others_) {
            EXPECT_EQ(other->goodbye().reason, session::SessionEnd::Reason::Finished);
        }
        EXPECT_TRUE(hasOnly(0)) << childrenOf(engine_->pid()).size() << " processes are left";
        engine_->signal(SIGTERM);
        EXPECT_EQ(engine_->wait(), 0);
        EXPECT_TRUE(std::filesystem::is_empty(directory_.file("private")));
        engine_.reset();
        programs_test::expectNoDescendants();
    }

    // The listener comes to have so many sessions, and no descriptor that it did not have before the first one.
    bool hasOnly(std::size_t sessions) {
        return test_support::eventually([this, sessions] {
            return childrenOf(engine_->pid()).size() == sessions && descriptorsOf(engine_->pid()) == atFirst_;
        });
    }

    // Who comes to the gate while it is held open passes.
    OwnedDescriptor openGate() const {
        return OwnedDescriptor(::open(gate_.c_str(), O_RDWR | O_CLOEXEC));
    }

    // Half of the others are in the middle of a request meanwhile, and the other half is busy.
    template <class Harm>
    void expectOthersServedDuring(const std::string& name, const Harm& harm) {
        SCOPED_TRACE(name);
        constexpr std::size_t requests = 10;
        for (std::size_t i = 0; i < others_.size(); ++i) {
            others_[i]->ask(requests, i % 2 == 0 ? "open('" + gate_ + "').close()\n" : "");
        }
        harm();
        const OwnedDescriptor open = openGate();
        for (const auto& other : others_) {
            other->expectAnswers();
        }
        EXPECT_TRUE(hasOnly(neighbours)) << childrenOf(engine_->pid()).size() << " processes are left";
    }

    // A client without the handshake.
    std::unique_ptr<wire::ByteEnd> stranger() const {
        const int connection = connectTo(path_);
        return std::make_unique<wire::ByteEnd>(connection, connection);
    }

    // A client that writes its bytes itself.
    std::unique_ptr<wire::ByteEnd> client() const {
        auto end = stranger();
        end->shakeHands();
        return end;
    }

    // The code ends its process.
    void expectEndedBy(const std::string& code) const {
        EngineClient client(connectTo(path_));
        const IDType id = client.enqueue("import ctypes, os, signal, threading, time\n" + code);
        EXPECT_THROW(ADD_FAILURE() << code << ": " << client.await(id).errorText(), std::runtime_error);
        EXPECT_EQ(client.awaitEnd().reason, session::SessionEnd::Reason::Lost) << code;
    }

    const test_support::TemporaryDirectory directory_;
    const std::string path_ = directory_.file("private/socket");
    const std::string gate_ = directory_.file("gate");
    std::unique_ptr<EngineProcess> engine_;
    std::map<int, std::string> atFirst_;
    std::vector<std::unique_ptr<Neighbour>> others_;
};

TEST_F(HostileNeighbourTest, BytesOfOneReachNoOther) {
    expectOthersServedDuring("no session", [this] {
        std::mt19937 numbers(1);
        std::string noise(std::size_t{1} << 16, '\0');
        for (char& each : noise) {
            each = static_cast<char>(numbers());
        }
        for (const std::string& bytes : {std::string("GET / HTTP/1.1\r\n\r\n"), std::string("\x89KRUTIL\n"), noise}) {
            const auto end = stranger();
            // All of it may find no reader any more.
            end->writeSome(bytes);
        }
    });
    expectOthersServedDuring("handshakes without an end", [this] {
        std::vector<std::unique_ptr<wire::ByteEnd>> silent;
        for (int i = 0; i < 100; ++i) {
            silent.push_back(stranger());
        }
    });
    expectOthersServedDuring("huge claims", [this] {
        constexpr std::uint64_t all = ~std::uint64_t{0};
        for (const wire::Header& claim :
             {wire::Header{.contentSize = all}, wire::Header{.tagSize = 0xFFFF}, wire::Header{.index = all},
              wire::Header{.kind = 2, .contentSize = all}, wire::Header{.kind = 5, .contentSize = all}}) {
            const auto end = client();
            end->write(wire::header(claim));
            EXPECT_NE(end->readAll(), "");
        }
        // Within the limits, so that it waits for the rest of it.
        client()->write(wire::header({.kind = 2, .last = false, .contentSize = std::uint64_t{4'000'000'000}}) + "few");
    });
    expectOthersServedDuring("a flood", [this] {
        std::string requests;
        for (std::uint32_t stream = 1; stream <= 20'000; ++stream) {
            requests += evaluation(stream, "print('text')", enqueueing(1, stream));
        }
        const auto end = client();
        EXPECT_LT(end->writeSome(requests), requests.size()) << "nobody has read what was answered";
    });
    expectOthersServedDuring("leaving in the middle of a frame", [this] {
        const std::string request = evaluation(1, "while True: pass", enqueueing(1, 1));
        client()->write(request + request.substr(0, request.size() / 2));
    });
}

TEST_F(HostileNeighbourTest, CodeOfOneReachesNoOther) {
    expectOthersServedDuring("leaving while code runs that nothing interrupts", [this] {
        client()->write(evaluation(1, "import itertools\nall(itertools.repeat(1))", enqueueing(1, 1)));
        client()->write(evaluation(1, "while True: print('on')", enqueueing(1, 1)));
    });
    expectOthersServedDuring("the end of its process", [this] {
        expectEndedBy("os._exit(0)");
        expectEndedBy("os.abort()");
        expectEndedBy("os.kill(os.getpid(), signal.SIGKILL)");
        expectEndedBy("os.closerange(3, 1000)");
#if !defined(KRUTIL_SANITIZED)
        expectEndedBy("ctypes.string_at(0)");
#endif
    });
    expectOthersServedDuring("the end of its process group", [this] {
        EngineClient client(connectTo(path_));
        ASSERT_EQ(client.eval("import os, signal\nprint(os.getpgrp() == os.getpid())").output(), "True\n")
            << "it would be the group of this test";
        client.enqueue("os.kill(0, signal.SIGKILL)");
        EXPECT_EQ(client.awaitEnd().reason, session::SessionEnd::Reason::Lost);
    });
    expectOthersServedDuring("forks", [this] {
        expectEndedBy(
            "me = os.getpid()\n"
            "for _ in range(30):\n"
            "    if os.fork() == 0:\n"
            "        while os.getppid() == me: time.sleep(0.01)\n"
            "        os._exit(0)\n"
            "os._exit(0)");
    });
    expectOthersServedDuring("threads", [this] {
        expectEndedBy(
            "threading.stack_size(1 << 18)\n"
            "for _ in range(100): threading.Thread(target=time.sleep, args=(1000,), daemon=True).start()\n"
            "os._exit(0)");
    });
#if !defined(KRUTIL_SANITIZED)
    expectOthersServedDuring("all memory and all descriptors", [this] {
        EngineClient client(connectTo(path_));
        EXPECT_EQ(client.eval("a = []\nwhile True: a.append(bytearray(1 << 20))").errorId(), "MemoryError");
        EXPECT_EQ(client.eval("a = None\nimport os\nd = []\nwhile True: d.append(os.dup(0))").errorText(),
                  "[Errno 24] Too many open files");
    });
#endif
}

}  // namespace
}  // namespace qvm_test
