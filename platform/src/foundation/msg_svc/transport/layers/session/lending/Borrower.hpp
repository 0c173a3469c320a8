// What this process reads of the memory of a session's peer.
#pragma once

#include <sys/types.h>
#include <sys/uio.h>

#include <cstdint>
#include <deque>
#include <memory>
#include <span>

#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "foundation/msg_svc/transport/layers/session/lending/LentContents.hpp"
#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace foundation::msg_svc::transport::layers::session {
class Outgoing;
}

namespace foundation::msg_svc::transport::layers::session::lending {

/// Makes buffers of memory that the peer has lent, and tells the peer when they are not used any more. The buffers may
/// outlive this object and the session. One thread, but for members that say otherwise.
///
/// A child that this process forks reads on in what was mapped at that moment, so such memory is given back as kept:
/// the peer does not write to it again.
class Borrower final : public LentContents {
  public:
    /// Contents are given back through `outgoing`, until close().
    explicit Borrower(Outgoing& outgoing);
    ~Borrower();
    Borrower(const Borrower&) = delete;
    Borrower& operator=(const Borrower&) = delete;

    /// One gathered read from a non-blocking Unix socket, as readSome() does it. Keeps the descriptors that come along.
    /// Throws ProtocolViolation when more come than are kept, or some are lost.
    ssize_t read(int socket, std::span<const iovec> pieces);

    /// The content as a buffer of the BufferAllocator. It lies in the memory of the next descriptor, which is closed.
    /// Code may write to the bytes: what is written stays in this process. Throws MemoryRefused for what is not as it
    /// has to be, and std::bad_alloc.
    framing::FrameBuffer borrow(const SharedContent& content) override;

    // Any thread.

    /// Nothing is given back from now on; the end of the session does.
    void close() noexcept;

    /// The same for a forked child, which must not take a lock.
    void abandonInChild() noexcept;

  private:
    class Core;
    struct Borrowed;

    const std::shared_ptr<Core> core_;
    std::deque<core::posix::OwnedDescriptor> descriptors_;  // whose frames have not come
};

}  // namespace foundation::msg_svc::transport::layers::session::lending
