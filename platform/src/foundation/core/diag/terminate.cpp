#include "foundation/core/diag/terminate.hpp"

#include <fcntl.h>
#include <sys/uio.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "foundation/core/diag/AssertionSwitch.hpp"
#include "foundation/core/diag/assertions.hpp"

namespace foundation::core::diag {
namespace {

// Programs redirect descriptor 2 and run code that closes it; what ends the process must be seen all the same. Numbers
// from 100 up stay clear of the low ones that code dups onto.
int duplicateStderr() noexcept {
    return ::fcntl(STDERR_FILENO, F_DUPFD_CLOEXEC, 100);
}

const int originalStderr = duplicateStderr();

std::atomic<bool> assertions{false};

iovec piece(const char* text) noexcept {
    return {const_cast<char*>(text), std::strlen(text)};
}

// Writes all of `pieces`, which are few and short. A peer that does not read must not keep a dying process alive, so a
// descriptor that would block is given up.
void writeAll(int descriptor, iovec* pieces, int count) noexcept {
    while (count > 0) {
        ssize_t written = ::writev(descriptor, pieces, count);
        if (written < 0) {
            if (errno == EINTR) {
                continue;
            }
            return;
        }
        while (count > 0 && static_cast<std::size_t>(written) >= pieces->iov_len) {
            written -= static_cast<ssize_t>(pieces->iov_len);
            ++pieces;
            --count;
        }
        if (count > 0) {
            pieces->iov_base = static_cast<char*>(pieces->iov_base) + written;
            pieces->iov_len -= static_cast<std::size_t>(written);
        }
    }
}

// Decimal text of `number` at the end of `digits`.
const char* decimal(int number, std::array<char, 16>& digits) noexcept {
    char* position = digits.data() + digits.size() - 1;
    *position = '\0';
    // Negated towards the negative side, where every int has room.
    int rest = number > 0 ? -number : number;
    do {
        *--position = static_cast<char>('0' - rest % 10);
        rest /= 10;
    } while (rest != 0);
    if (number < 0) {
        *--position = '-';
    }
    return position;
}

}  // namespace

void terminate(const char* message, const char* file, int line, const char* function) {
    const auto shown = [](const char* text) { return text != nullptr ? text : "(null)"; };
    std::array<char, 16> digits{};
    std::array<iovec, 9> pieces{piece("fatal: "), piece(shown(message)),        piece(" ("), piece(shown(file)),
                                piece(":"),       piece(decimal(line, digits)), piece(", "), piece(shown(function)),
                                piece(")\n")};
    writeAll(originalStderr >= 0 ? originalStderr : STDERR_FILENO, pieces.data(), static_cast<int>(pieces.size()));
    std::abort();
}

bool assertionsEnabled() noexcept {
    return assertions.load(std::memory_order_relaxed);
}

bool enableAssertions(bool enabled) noexcept {
    return assertions.exchange(enabled, std::memory_order_relaxed);
}

}  // namespace foundation::core::diag
