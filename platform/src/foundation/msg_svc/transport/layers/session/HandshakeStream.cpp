#include "foundation/msg_svc/transport/layers/session/HandshakeStream.hpp"

#include <poll.h>
#include <sys/uio.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <span>
#include <system_error>
#include <utility>

#include "foundation/msg_svc/transport/layers/session/lending/DescriptorPassing.hpp"

namespace foundation::msg_svc::transport::layers::session {
namespace {

// How long a peer to which nothing can be written may take to say why.
constexpr std::chrono::milliseconds timeToSayWhy{1'000};

std::string errorText(int error) {
    return std::generic_category().message(error);
}

}  // namespace

HandshakeStream::HandshakeStream(int in, int out, std::chrono::milliseconds timeout, SessionRecorder* recorder)
    : in_(in), out_(out), timeout_(timeout), deadline_(Clock::now() + timeout), recorder_(recorder) {}

void HandshakeStream::send(const std::string& bytes) {
    if (recorder_ != nullptr) {
        const iovec unit{const_cast<char*>(bytes.data()), bytes.size()};
        recorder_->record(SessionRecorder::Direction::Sent, SessionRecorder::Part::Handshake, std::span(&unit, 1));
    }
    unsent_ += bytes;
}

void HandshakeStream::keep(const char* bytes, std::size_t size) {
    if (recorder_ != nullptr) {
        received_.append(bytes, size);
    }
}

void HandshakeStream::endUnit() {
    if (!received_.empty()) {
        const iovec unit{received_.data(), received_.size()};
        recorder_->record(SessionRecorder::Direction::Received, SessionRecorder::Part::Handshake, std::span(&unit, 1));
        received_.clear();
    }
}

void HandshakeStream::sendWith(const std::string& bytes, int descriptor) {
    flush();
    send(bytes);
    unsentDescriptor_ = descriptor;
}

void HandshakeStream::watch(int descriptor, std::function<void()> onReadable) {
    watched_ = descriptor;
    onReadable_ = std::move(onReadable);
}

void HandshakeStream::sendNow(const std::string& bytes) {
    send(bytes);
    if (writeError_ == 0) {
        writeSome();
    }
}

void HandshakeStream::limitTo(std::chrono::milliseconds patience) {
    deadline_ = std::min(deadline_, Clock::now() + patience);
}

void HandshakeStream::receive(char* target, std::size_t size, const std::string& what,
                              const std::function<void(std::size_t)>& check,
                              std::vector<core::posix::OwnedDescriptor>* descriptors) {
    for (std::size_t have = 0; have < size;) {
        const std::string progress =
            std::to_string(have) + " of " + std::to_string(size) + " bytes of " + what + " had arrived";
        wait(true, progress);
        char* const rest = target + have;
        const iovec piece{rest, size - have};
        const ssize_t count = descriptors == nullptr
                                  ? ::readv(in_, &piece, 1)
                                  : lending::receiveWithDescriptors(in_, std::span(&piece, 1), *descriptors);
        if (count > 0) {
            keep(rest, static_cast<std::size_t>(count));
            heard_ = true;
            have += static_cast<std::size_t>(count);
            if (check) {
                check(have);
            }
        } else if (count == 0 || errno == ECONNRESET) {
            const std::string text = "the peer closed the stream during the handshake: " + progress;
            if (!heard_) {
                throw PeerSilent(text);
            }
            throw StreamLost(text);
        } else if (errno != EINTR && errno != EAGAIN && errno != EWOULDBLOCK) {
            throw StreamLost("cannot read from the stream during the handshake: " + errorText(errno) + "; " + progress);
        }
    }
}

std::string HandshakeStream::takeAvailable(std::size_t most) {
    std::string bytes(most, '\0');
    const ssize_t count = ::read(in_, bytes.data(), bytes.size());
    bytes.resize(count > 0 ? static_cast<std::size_t>(count) : 0);
    keep(bytes.data(), bytes.size());
    return bytes;
}

void HandshakeStream::flush() {
    while (!unsent_.empty() && writeError_ == 0) {
        wait(false, std::to_string(unsent_.size()) + " bytes are unwritten");
    }
    throwIfUnwritable();
}

void HandshakeStream::throwIfUnwritable() const {
    if (writeError_ != 0) {
        throw StreamLost("cannot write to the stream during the handshake: " + errorText(writeError_));
    }
}

// Waits for something to read (or, without `reading`, to write) and writes what can be written meanwhile.
void HandshakeStream::wait(bool reading, const std::string& progress) {
    for (;;) {
        const bool writing = !unsent_.empty() && writeError_ == 0;
        std::array<pollfd, 3> polled{pollfd{reading ? in_ : -1, POLLIN, 0}, pollfd{writing ? out_ : -1, POLLOUT, 0},
                                     pollfd{watched_, POLLIN, 0}};
        const auto left =
            std::max<Clock::rep>(0, std::chrono::ceil<std::chrono::milliseconds>(deadline_ - Clock::now()).count());
        const int ready = ::poll(polled.data(), polled.size(), static_cast<int>(std::min<Clock::rep>(left, 60'000)));
        if (ready < 0 && errno != EINTR) {
            throw StreamLost("cannot wait for the stream during the handshake: " + errorText(errno));
        }
        if (ready == 0 && Clock::now() >= deadline_) {
            throwIfUnwritable();
            throw TimedOut("the handshake timed out after " + std::to_string(timeout_.count()) +
                           " milliseconds: " + progress);
        }
        if (ready > 0 && polled[2].revents != 0) {
            watched_ = -1;
            onReadable_();
        }
        if (ready > 0 && polled[1].revents != 0) {
            writeSome();
        }
        if (ready > 0 && (!reading || polled[0].revents != 0)) {
            return;
        }
    }
}

void HandshakeStream::writeSome() {
    const iovec piece{unsent_.data(), unsent_.size()};
    const ssize_t count = unsentDescriptor_ < 0 ? ::writev(out_, &piece, 1)
                                                : lending::sendWithDescriptors(out_, std::span(&piece, 1),
                                                                               std::span(&unsentDescriptor_, 1));
    if (count >= 0) {
        unsentDescriptor_ = -1;
        unsent_.erase(0, static_cast<std::size_t>(count));
    } else if (errno != EINTR && errno != EAGAIN && errno != EWOULDBLOCK) {
        // The peer may have said why before it closed its end, so reading goes on.
        writeError_ = errno;
        limitTo(timeToSayWhy);
    }
}

}  // namespace foundation::msg_svc::transport::layers::session
