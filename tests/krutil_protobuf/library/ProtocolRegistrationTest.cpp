// init() against the process-wide registry. It works once per process, so each check runs in a process of its own.

#include <gtest/gtest.h>

#include <atomic>
#include <barrier>
#include <cstdlib>
#include <stdexcept>
#include <thread>
#include <vector>

#include "KrutilProtocol.hpp"
#include "foundation/msg_svc/transport/layers/session/ProtocolRegistry.hpp"

namespace {

using foundation::msg_svc::transport::layers::serialization::Registry;
using foundation::msg_svc::transport::layers::session::ProtocolRegistry;
using krutil::protobuf::KrutilProtocol;
using Version = std::pair<unsigned int, unsigned int>;

// Ends the checking process with the line of the first check that fails.
#define CHECK_IN_CHILD(condition) \
    if (!(condition)) {           \
        return __LINE__ % 256;    \
    }

bool isRegistered() {
    try {
        ProtocolRegistry::getRegistry()->find("krutil");
        return true;
    } catch (const std::out_of_range&) {
        return false;
    }
}

int checkNothingIsRegisteredByLoading() {
    CHECK_IN_CHILD(!isRegistered());
    return 0;
}

int checkRegisteredFunctions() {
    KrutilProtocol::init();
    const auto protocol = ProtocolRegistry::getRegistry()->find("krutil");
    CHECK_IN_CHILD(protocol.configuration() == KrutilProtocol::getConfiguration());
    const auto registry = std::make_shared<Registry>();
    CHECK_IN_CHILD(protocol.initialize(registry, {1, 1}, {}) == Version(0xFFFF, 0xFFFF));
    CHECK_IN_CHILD(registry->serializers().empty());
    CHECK_IN_CHILD(protocol.initialize(registry, {1, 0}, {{"ZEROCOPY", "enable"}}) == Version(1, 0));
    CHECK_IN_CHILD(registry->serializers().front()->name() == "krutil:QVMShutdownEvent");
    return 0;
}

int checkTwoCallsRegisterOnce() {
    KrutilProtocol::init();
    // A second registration would throw, because the name is taken.
    KrutilProtocol::init();
    CHECK_IN_CHILD(isRegistered());
    // And would be seen when the name is free again.
    CHECK_IN_CHILD(ProtocolRegistry::getRegistry()->unregister("krutil"));
    KrutilProtocol::init();
    CHECK_IN_CHILD(!isRegistered());
    return 0;
}

int checkManyThreadsRegisterOnce() {
    constexpr int count = 16;
    std::barrier start(count);
    std::atomic<int> failures{0};
    std::vector<std::thread> threads;
    for (int i = 0; i < count; ++i) {
        threads.emplace_back([&] {
            start.arrive_and_wait();
            try {
                KrutilProtocol::init();
                failures += isRegistered() ? 0 : 1;
            } catch (...) {
                ++failures;
            }
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    CHECK_IN_CHILD(failures == 0);
    return 0;
}

int checkARefusalLetsTheNextCallTryAgain() {
    const auto registry = ProtocolRegistry::getRegistry();
    registry->registerProtocolInitializer("krutil", nullptr, nullptr);
    for (int i = 0; i < 2; ++i) {
        bool thrown = false;
        try {
            KrutilProtocol::init();
        } catch (const std::invalid_argument&) {
            thrown = true;
        }
        CHECK_IN_CHILD(thrown);
    }
    CHECK_IN_CHILD(registry->unregister("krutil"));
    KrutilProtocol::init();
    CHECK_IN_CHILD(registry->find("krutil").configuration().size() == 2);
    KrutilProtocol::init();
    return 0;
}

class ProtocolRegistrationDeathTest : public testing::Test {
  protected:
    ProtocolRegistrationDeathTest() { testing::FLAGS_gtest_death_test_style = "threadsafe"; }
};

#define EXPECT_PASSES_IN_FRESH_PROCESS(check) EXPECT_EXIT(std::_Exit(check), testing::ExitedWithCode(0), "")

TEST_F(ProtocolRegistrationDeathTest, LoadingAloneRegistersNothing) {
    EXPECT_PASSES_IN_FRESH_PROCESS(checkNothingIsRegisteredByLoading());
}

TEST_F(ProtocolRegistrationDeathTest, InitRegistersInitializerAndConfigurationUnderTheName) {
    EXPECT_PASSES_IN_FRESH_PROCESS(checkRegisteredFunctions());
}

TEST_F(ProtocolRegistrationDeathTest, InitTwiceRegistersOnce) {
    EXPECT_PASSES_IN_FRESH_PROCESS(checkTwoCallsRegisterOnce());
}

TEST_F(ProtocolRegistrationDeathTest, InitFromManyThreadsRegistersOnce) {
    EXPECT_PASSES_IN_FRESH_PROCESS(checkManyThreadsRegisterOnce());
}

TEST_F(ProtocolRegistrationDeathTest, AThrowingRegistryLetsTheNextInitTryAgain) {
#ifdef __SANITIZE_THREAD__
    GTEST_SKIP() << "under the thread sanitizer an exception through std::call_once hangs";
#endif
    EXPECT_PASSES_IN_FRESH_PROCESS(checkARefusalLetsTheNextCallTryAgain());
}

}  // namespace
