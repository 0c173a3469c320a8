// Descriptors that travel beside the bytes of a Unix socket.
//
// The kernel hands descriptors over with the first byte of the write that they came with. A read may begin before that
// byte and ends before the next such byte. So descriptors arrive in the order in which they were sent, each not later
// than the bytes that were written together with it.
#pragma once

#include <sys/types.h>
#include <sys/uio.h>

#include <cstddef>
#include <span>
#include <vector>

#include "foundation/core/posix/OwnedDescriptor.hpp"

namespace foundation::msg_svc::transport::layers::session::lending {

/// A sender lets no more than this many descriptors be ahead of the frames that need them.
inline constexpr std::size_t mostDescriptorsSent = 16;

/// A receiver keeps this many whose frames have not come: those of the bytes that it is about to read, and those of the
/// write that follows.
inline constexpr std::size_t mostDescriptorsKept = 2 * mostDescriptorsSent;

/// Whether descriptors can be sent over this one, and be received from it.
bool passesDescriptors(int descriptor) noexcept;

/// One gathered write to a non-blocking Unix socket, with at most mostDescriptorsSent descriptors, which stay the
/// caller's. Returns what writev() does, but is never interrupted. All descriptors have gone when the result is not
/// negative.
ssize_t sendWithDescriptors(int socket, std::span<const iovec> pieces, std::span<const int> descriptors) noexcept;

/// One gathered read from a non-blocking Unix socket. Returns what readv() does, but is never interrupted. Appends the
/// descriptors that came along, which are close-on-exec. Throws ProtocolViolation when some of them are lost: more came
/// at once than a receiver keeps, or this process may have no more.
ssize_t receiveWithDescriptors(int socket, std::span<const iovec> pieces,
                               std::vector<core::posix::OwnedDescriptor>& descriptors);

}  // namespace foundation::msg_svc::transport::layers::session::lending
