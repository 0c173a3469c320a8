#include "qvm/process/Seat.hpp"

#include <sys/socket.h>
#include <sys/time.h>

#include <cerrno>
#include <optional>
#include <utility>

namespace qvm {
namespace {

// The next word of the listener; 0 when it has gone, nothing when none has come in time.
std::optional<char> readWord(int line, int flags) {
    for (;;) {
        char word = 0;
        const ssize_t count = ::recv(line, &word, 1, flags);
        if (count >= 0) {
            return count == 1 ? word : '\0';
        }
        if (errno == EAGAIN || errno == EWOULDBLOCK) {
            return std::nullopt;
        }
        if (errno != EINTR) {
            return '\0';
        }
    }
}

}  // namespace

std::string fullOfSessions(std::size_t maxSessions) {
    return "it has " + std::to_string(maxSessions) + (maxSessions == 1 ? " session" : " sessions") +
           " and may have no more (--max-sessions); try again when one has ended";
}

Seat::Seat(foundation::core::posix::OwnedDescriptor line, std::size_t maxSessions, std::size_t maxHandshakes,
           std::chrono::milliseconds patience)
    : line_(std::move(line)), maxSessions_(maxSessions), maxHandshakes_(maxHandshakes) {
    const timeval limit{patience.count() / 1000, (patience.count() % 1000) * 1000};
    ::setsockopt(line_.get(), SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof(limit));
}

foundation::msg_svc::transport::layers::session::Admission Seat::admission() {
    return {[this] { return refusal(); }, line_.get()};
}

std::string Seat::refusal() {
    std::optional<char> word = readWord(line_.get(), MSG_DONTWAIT);
    if (!word) {
        // Nothing has been withdrawn. A listener that has gone is found by reading.
        static_cast<void>(::send(line_.get(), &seat_words::ask, 1, MSG_NOSIGNAL));
        word = readWord(line_.get(), 0);
    }
    if (!word) {
        return refuse("the process that counts its sessions does not answer; try again");
    }
    switch (*word) {
        case seat_words::full:
            return refuse(fullOfSessions(maxSessions_));
        case seat_words::withdraw:
            return refuse("it has " + std::to_string(maxHandshakes_) +
                          " unfinished handshakes, of which this is the oldest; try again");
        default:
            return {};
    }
}

std::string Seat::refuse(std::string why) {
    refused_ = true;
    return why;
}

}  // namespace qvm
