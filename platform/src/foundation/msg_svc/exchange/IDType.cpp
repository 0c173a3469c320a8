#include "foundation/msg_svc/exchange/IDType.hpp"

#include <sys/random.h>

#include <array>
#include <cerrno>
#include <cstdio>
#include <ostream>
#include <system_error>

#include "foundation/msg_svc/exchange/Message.hpp"
#include "foundation/msg_svc/exchange/Reply.hpp"

namespace foundation::msg_svc::exchange {

Message::~Message() = default;
Reply::~Reply() = default;

IDType IDType::random() {
    for (;;) {
        std::array<std::uint64_t, 2> halves{};
        // The kernel never returns less than asked for up to 256 bytes, once its source is ready.
        if (::getrandom(halves.data(), sizeof halves, 0) != sizeof halves) {
            if (errno == EINTR) {
                continue;
            }
            throw std::system_error(errno, std::generic_category(), "IDType::random: getrandom");
        }
        const IDType id(halves[0], halves[1]);
        if (id != IDType()) {
            return id;
        }
    }
}

std::string toString(const IDType& id) {
    std::array<char, 33> text{};
    std::snprintf(text.data(), text.size(), "%016lx%016lx", id.hi(), id.lo());
    return std::string(text.data(), 32);
}

std::ostream& operator<<(std::ostream& out, const IDType& id) {
    return out << toString(id);
}

}  // namespace foundation::msg_svc::exchange
