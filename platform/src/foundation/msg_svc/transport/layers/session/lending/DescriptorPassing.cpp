#include "foundation/msg_svc/transport/layers/session/lending/DescriptorPassing.hpp"

#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <string>

#include "foundation/msg_svc/transport/layers/session/SessionError.hpp"

namespace foundation::msg_svc::transport::layers::session::lending {
namespace {

msghdr headerFor(std::span<const iovec> pieces) noexcept {
    msghdr header{};
    header.msg_iov = const_cast<iovec*>(pieces.data());
    header.msg_iovlen = pieces.size();
    return header;
}

}  // namespace

bool passesDescriptors(int descriptor) noexcept {
    int domain = 0;
    int type = 0;
    socklen_t size = sizeof(int);
    return ::getsockopt(descriptor, SOL_SOCKET, SO_DOMAIN, &domain, &size) == 0 && domain == AF_UNIX &&
           ::getsockopt(descriptor, SOL_SOCKET, SO_TYPE, &type, &size) == 0 && type == SOCK_STREAM;
}

ssize_t sendWithDescriptors(int socket, std::span<const iovec> pieces, std::span<const int> descriptors) noexcept {
    alignas(cmsghdr) std::array<char, CMSG_SPACE(mostDescriptorsSent * sizeof(int))> room{};
    msghdr header = headerFor(pieces);
    if (!descriptors.empty()) {
        header.msg_control = room.data();
        header.msg_controllen = CMSG_SPACE(descriptors.size_bytes());
        cmsghdr* const control = CMSG_FIRSTHDR(&header);
        control->cmsg_level = SOL_SOCKET;
        control->cmsg_type = SCM_RIGHTS;
        control->cmsg_len = CMSG_LEN(descriptors.size_bytes());
        std::memcpy(CMSG_DATA(control), descriptors.data(), descriptors.size_bytes());
    }
    ssize_t count = 0;
    do {
        count = ::sendmsg(socket, &header, MSG_NOSIGNAL);
    } while (count < 0 && errno == EINTR);
    return count;
}

ssize_t receiveWithDescriptors(int socket, std::span<const iovec> pieces,
                               std::vector<core::posix::OwnedDescriptor>& descriptors) {
    alignas(cmsghdr) std::array<char, CMSG_SPACE(mostDescriptorsKept * sizeof(int))> room{};
    msghdr header = headerFor(pieces);
    ssize_t count = 0;
    do {
        header.msg_control = room.data();
        header.msg_controllen = room.size();
        count = ::recvmsg(socket, &header, MSG_CMSG_CLOEXEC);
    } while (count < 0 && errno == EINTR);
    if (count < 0) {
        return count;
    }
    std::array<int, mostDescriptorsKept> numbers{};
    std::size_t came = 0;
    for (cmsghdr* control = CMSG_FIRSTHDR(&header); control != nullptr; control = CMSG_NXTHDR(&header, control)) {
        if (control->cmsg_level == SOL_SOCKET && control->cmsg_type == SCM_RIGHTS) {
            came = (control->cmsg_len - CMSG_LEN(0)) / sizeof(int);
            std::memcpy(numbers.data(), CMSG_DATA(control), came * sizeof(int));
        }
    }
    std::for_each_n(numbers.begin(), came, [&](int number) { descriptors.emplace_back(number); });
    if ((header.msg_flags & MSG_CTRUNC) != 0) {
        throw ProtocolViolation("expected at most " + std::to_string(mostDescriptorsKept) +
                                " descriptors at once, and as many as this process may still open; some are lost");
    }
    return count;
}

}  // namespace foundation::msg_svc::transport::layers::session::lending
