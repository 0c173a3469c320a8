#include "qvm/process/LastWords.hpp"

#include <signal.h>

#include <array>
#include <atomic>
#include <cerrno>

#include "qvm/process/ForkedChild.hpp"

namespace qvm {
namespace {

// By default each of these ends the process.
constexpr std::array endings{SIGHUP,  SIGINT,  SIGQUIT, SIGILL,  SIGTRAP, SIGABRT,  SIGBUS,
                             SIGFPE,  SIGUSR1, SIGSEGV, SIGUSR2, SIGALRM, SIGTERM,  SIGSTKFLT,
                             SIGXCPU, SIGPROF, SIGPOLL, SIGPWR,  SIGSYS,  SIGVTALRM};

std::atomic<FlushTimer*> sender{nullptr};

// Its action is the default one again. A fault repeats itself when this returns; any other signal comes once more.
void sendAndEnd(int number) {
    const int before = errno;
    if (!inForkedChild()) {
        if (FlushTimer* const timer = sender.exchange(nullptr)) {
            timer->flushAll();
        }
    }
    ::raise(number);
    errno = before;
}

}  // namespace

LastWords::LastWords(FlushTimer& timer) {
    // A stack that has overflowed cannot be used by the handler.
    static std::array<char, 1U << 15> spare;
    stack_t stack{};
    if (::sigaltstack(nullptr, &stack) == 0 && (stack.ss_flags & SS_DISABLE) != 0) {
        stack = {spare.data(), 0, spare.size()};
        ::sigaltstack(&stack, nullptr);
    }
    sender = &timer;
    keep();
}

LastWords::~LastWords() {
    sender = nullptr;
}

void LastWords::keep() noexcept {
    if (sender.load() == nullptr) {
        return;
    }
    struct sigaction action {};
    action.sa_handler = &sendAndEnd;
    action.sa_flags = static_cast<int>(SA_RESETHAND) | SA_ONSTACK;
    ::sigfillset(&action.sa_mask);
    for (const int number : endings) {
        struct sigaction before {};
        if (::sigaction(number, nullptr, &before) == 0 && before.sa_handler == SIG_DFL) {
            ::sigaction(number, &action, nullptr);
        }
    }
}

}  // namespace qvm
