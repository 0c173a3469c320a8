// The descriptors of a session's stream.
#pragma once

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

}  // namespace foundation::msg_svc::transport::layers::session
