// The arrays of a call on their way to an engine of the test's own, which returns them.

#include <gtest/gtest.h>
#include <sys/socket.h>

#include <boost/make_shared.hpp>
#include <cstring>
#include <filesystem>
#include <future>
#include <numeric>
#include <vector>

#include "cmddistributor/FEvalIIP.hpp"
#include "cmddistributor/FEvalResult.hpp"
#include "cmddistributor/IIPEnqueueMessage.hpp"
#include "common/KrutilSession.hpp"
#include "foundation/korveldata/ArrayFactory.hpp"
#include "foundation/vantor/carrier/framing/DataFrame.hpp"
#include "krutil/arrays/NpyFile.hpp"
#include "krutil/base/Interrupt.hpp"
#include "krutil/cmddistributor/IIPReply.hpp"
#include "krutil/eventmgr/QVMShutdownEvent.hpp"
#include "krutil/session/Conversation.hpp"

namespace krutil_client {
namespace {

namespace session = foundation::msg_svc::transport::layers::session;
namespace framing = foundation::vantor::carrier::framing;
using cmddistributor::FEvalIIP;
using foundation::korveldata::Array;
using foundation::korveldata::ArrayFactory;
using foundation::korveldata::ElementType;
using foundation::korveldata::MemoryOrder;

// Answers each call with its arguments.
class EchoingEngine : public session::SessionHandler {
  public:
    explicit EchoingEngine(int stream)
        : session_(session::Session::open(stream, stream, apps::krutilSession(session::Role::Engine))) {
        session_->start(*this);
    }

  private:
    void onMessage(framing::StreamID stream,
                   const boost::shared_ptr<const foundation::msg_svc::exchange::Message>& message) override {
        const auto enqueue = boost::dynamic_pointer_cast<const cmddistributor::IIPEnqueueMessage>(message);
        const auto call = boost::dynamic_pointer_cast<const FEvalIIP>(enqueue->getIIP());
        session_->send(stream, boost::make_shared<const krutil::cmddistributor::IIPReply>(
                                   enqueue->getID(), std::make_unique<cmddistributor::FEvalResult>(
                                                         enqueue->getID(), call->getData()->takeArrays())));
    }
    void onGoodbye() override { session_->send(0, boost::make_shared<const krutil::eventmgr::QVMShutdownEvent>()); }
    void onEnd(const session::SessionEnd&) override {}

    std::unique_ptr<session::Session> session_;
};

class CallTransferTest : public ::testing::Test {
  protected:
    CallTransferTest() {
        int ends[2];
        if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) != 0) {
            throw std::runtime_error("socketpair");
        }
        auto engine = std::async(std::launch::async, [end = ends[1]] { return std::make_unique<EchoingEngine>(end); });
        auto config = apps::krutilSession(session::Role::Client);
        config.trace = [this](const session::FrameTrace& trace) {
            if (trace.outgoing && dynamic_cast<const framing::DataFrame*>(&trace.frame) != nullptr) {
                sent.push_back(trace.frame.data());
            }
        };
        conversation.emplace(ends[0], std::move(config), events, interrupt);
        engine_ = engine.get();
    }

    std::vector<Array> echo(std::vector<Array> arrays) {
        const auto id = foundation::msg_svc::exchange::IDType::random();
        const krutil::io::SinkTraits traits(false, false, false, false, false, false);
        FEvalIIP::Arguments arguments = krutil::cmddistributor::EDIDataWrapper(std::move(arrays));
        const auto iip = boost::make_shared<const FEvalIIP>(
            "python", std::string("echo"), 1, FEvalIIP::Data::makeClientSideData(std::move(arguments)),
            cmddistributor::IqmStreamID::ekIqmCmdWinStream, traits, traits, 1, 1, true);
        const auto reply = boost::dynamic_pointer_cast<const krutil::cmddistributor::IIPReply>(
            conversation->ask(boost::make_shared<const cmddistributor::IIPEnqueueMessage>(
                iip, id, krutil::contextmgr::QcrID{0}, boost::none, nullptr,
                krutil::cmddistributor::WhenToDequeue::DEQUEUE_AT_IDLE, u"echo", capabilities::CapabilityList{},
                nullptr, false)));
        return boost::get<std::vector<Array>>(
            dynamic_cast<const cmddistributor::FEvalResult&>(*reply->getResult()).getResults());
    }

    Interrupt interrupt;
    foundation::msg_svc::eventmgr::EventMgr events;
    std::vector<const char*> sent;  ///< bytes of the data frames that went to the engine
    std::unique_ptr<EchoingEngine> engine_;
    std::optional<Conversation> conversation;
};

Array counted(const std::vector<std::uint64_t>& dimensions) {
    Array array = ArrayFactory().createArray(ElementType::Double, dimensions, MemoryOrder::ColumnMajor);
    std::vector<double> values(array.numberOfElements());
    std::iota(values.begin(), values.end(), 1.0);
    std::memcpy(array.mutableData(), values.data(), array.sizeInBytes());
    return array;
}

TEST_F(CallTransferTest, AFileIsSentFromItsMapping) {
    const std::string path =
        (std::filesystem::temp_directory_path() / ("krutil-call-" + std::to_string(::getpid()) + ".npy")).string();
    const Array original = counted({1000, 512});
    NpyOutput(path).write(original);
    const Array mapped = readNpy(path);
    std::filesystem::remove(path);
    const auto returned = echo({mapped});
    ASSERT_EQ(returned.size(), 1U);
    EXPECT_EQ(returned[0], original);
    EXPECT_EQ(returned[0].order(), MemoryOrder::ColumnMajor);
    EXPECT_EQ(sent, std::vector<const char*>{mapped.data()});
}

TEST_F(CallTransferTest, TheSessionTellsHowFarTheBytesHaveCome) {
    EXPECT_EQ(conversation->session().traffic().written, 0U);
    const Array array = counted({1000, 512});
    echo({array});
    const auto traffic = conversation->session().traffic();
    EXPECT_GT(traffic.written, array.sizeInBytes());
    EXPECT_LT(traffic.written, array.sizeInBytes() + 2000);
    EXPECT_EQ(traffic.arriving, 0U);
    EXPECT_EQ(traffic.arrived, 0U);
}

TEST_F(CallTransferTest, APastimeStartsWithEachWaitTicksMeanwhileAndStopsBeforeADelivery) {
    std::vector<std::string> calls;
    int ticks = 0;
    conversation->setPastime({std::chrono::milliseconds(1),
                              [&] {
                                  calls.emplace_back("tick");
                                  ++ticks;
                              },
                              [&] { calls.emplace_back("stop"); }, [&] { calls.emplace_back("start"); }});
    conversation->run([&] { return ticks == 2; });
    EXPECT_EQ(calls, (std::vector<std::string>{"start", "tick", "start", "tick"}));
    echo({counted({2})});
    ASSERT_FALSE(calls.empty());
    EXPECT_EQ(calls.back(), "stop");
    calls.clear();
    conversation->setPastime({});
    EXPECT_FALSE(
        conversation->runUntil(Conversation::Clock::now() + std::chrono::milliseconds(5), [] { return false; }));
    EXPECT_TRUE(calls.empty());
}

}  // namespace
}  // namespace krutil_client
