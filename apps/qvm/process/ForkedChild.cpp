#include "qvm/process/ForkedChild.hpp"

#include <pthread.h>

#include <atomic>
#include <system_error>

namespace qvm {
namespace {

using foundation::msg_svc::transport::layers::session::Session;

std::atomic<Session*> guarded{nullptr};
std::atomic<bool> forked{false};

void leaveSession() noexcept {
    if (Session* session = guarded.exchange(nullptr)) {
        forked = true;
        session->abandonInChild();
    }
}

}  // namespace

ForkGuard::ForkGuard(Session& session) {
    // A handler cannot be taken back, so it is installed once and looks at `guarded`.
    static const int error = ::pthread_atfork(nullptr, nullptr, [] { leaveSession(); });
    if (error != 0) {
        throw std::system_error(error, std::generic_category(), "Cannot watch for forks of running code");
    }
    guarded = &session;
}

ForkGuard::~ForkGuard() {
    guarded = nullptr;
}

bool inForkedChild() noexcept {
    return forked.load(std::memory_order_relaxed);
}

}  // namespace qvm
