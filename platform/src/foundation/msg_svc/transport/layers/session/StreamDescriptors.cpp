#include "foundation/msg_svc/transport/layers/session/StreamDescriptors.hpp"

#include <fcntl.h>
#include <signal.h>

#include <cerrno>
#include <string>
#include <system_error>

#include "foundation/msg_svc/transport/layers/session/SessionError.hpp"

namespace foundation::msg_svc::transport::layers::session {
namespace {

[[noreturn]] void failToUse(int descriptor) {
    throw StreamLost("cannot use descriptor " + std::to_string(descriptor) +
                     " for a session: " + std::generic_category().message(errno));
}

int another(int descriptor) {
    const int made = ::fcntl(descriptor, F_DUPFD_CLOEXEC, 0);
    if (made < 0) {
        failToUse(descriptor);
    }
    return made;
}

void prepare(int descriptor) {
    const int flags = ::fcntl(descriptor, F_GETFL);
    if (flags < 0 || ::fcntl(descriptor, F_SETFL, flags | O_NONBLOCK) < 0 ||
        ::fcntl(descriptor, F_SETFD, FD_CLOEXEC) < 0) {
        failToUse(descriptor);
    }
}

// A write to a stream whose reader has gone must fail, not end the process. writev has no flag for that.
void ignoreBrokenPipes() {
    struct sigaction action {};
    if (::sigaction(SIGPIPE, nullptr, &action) == 0 && action.sa_handler == SIG_DFL) {
        ::signal(SIGPIPE, SIG_IGN);
    }
}

}  // namespace

StreamDescriptors StreamDescriptors::takeOver(int in, int out) {
    StreamDescriptors stream;
    stream.in.reset(in);
    // The two directions are watched independently, and one descriptor can be watched only once.
    stream.out.reset(in == out ? another(in) : out);
    prepare(stream.in.get());
    prepare(stream.out.get());
    ignoreBrokenPipes();
    return stream;
}

ssize_t readSome(int descriptor, std::span<const iovec> pieces) noexcept {
    ssize_t count = 0;
    do {
        count = ::readv(descriptor, pieces.data(), static_cast<int>(pieces.size()));
    } while (count < 0 && errno == EINTR);
    return count;
}

ssize_t writeSome(int descriptor, std::span<const iovec> pieces) noexcept {
    ssize_t count = 0;
    do {
        count = ::writev(descriptor, pieces.data(), static_cast<int>(pieces.size()));
    } while (count < 0 && errno == EINTR);
    return count;
}

}  // namespace foundation::msg_svc::transport::layers::session
