// The descriptors of a session's stream.
#pragma once

#include <sys/types.h>
#include <sys/uio.h>

#include <span>

#include "foundation/core/posix/OwnedDescriptor.hpp"

namespace foundation::msg_svc::transport::layers::session {

/// Two directions of one stream, each with a descriptor of its own, non-blocking and close-on-exec.
struct StreamDescriptors {
    core::posix::OwnedDescriptor in;
    core::posix::OwnedDescriptor out;

    /// Takes over two descriptors, which may be equal, in every case. Where SIGPIPE has its default handling it is
    /// ignored from now on, in the whole process. Throws StreamLost for what is no descriptor.
    static StreamDescriptors takeOver(int in, int out);
};

/// One gathered read from a non-blocking descriptor. Returns what readv() does, but is never interrupted.
ssize_t readSome(int descriptor, std::span<const iovec> pieces) noexcept;

/// One gathered write to a non-blocking descriptor, in the same way.
ssize_t writeSome(int descriptor, std::span<const iovec> pieces) noexcept;

}  // namespace foundation::msg_svc::transport::layers::session
