// What the peer of a session may read of this process's memory.
#pragma once

#include <sys/uio.h>

#include <cstdint>
#include <functional>
#include <mutex>
#include <optional>
#include <unordered_map>

#include "foundation/msg_svc/transport/layers/session/SessionConfig.hpp"
#include "foundation/msg_svc/transport/layers/session/lending/SharedContent.hpp"
#include "foundation/vantor/carrier/framing/DataFrame.hpp"
#include "foundation/vantor/carrier/shared_memory/SegmentPool.hpp"

namespace foundation::msg_svc::transport::layers::session::lending {

class Lender;

/// One content on its way to the peer. Movable. Unless its descriptor was sent, the content is lent no more when this
/// goes. Must not outlive its lender.
class Loan {
  public:
    using Descriptor = vantor::carrier::shared_memory::Segment::Descriptor;

    Loan(Lender& lender, const SharedContent& content, Descriptor descriptor) noexcept;
    ~Loan();
    Loan(Loan&& other) noexcept = default;
    Loan& operator=(Loan&&) = delete;

    const SharedContent& content() const noexcept { return content_; }

    /// Calls `use` with the bytes of the content, which stay where they are meanwhile. False, without a call, when a
    /// peer has given back what it has not got yet.
    bool read(const std::function<void(iovec)>& use) const;

    /// -1 when it has been sent.
    int descriptor() const noexcept { return descriptor_ ? descriptor_->get() : -1; }

    /// The peer has the descriptor, or will have it: the content is lent until it gives it back.
    void sent() noexcept { descriptor_.reset(); }

  private:
    Lender* lender_;
    SharedContent content_;
    Descriptor descriptor_;
};

/// Keeps the bytes that are lent unchanged until the peer gives them back: it holds the buffers of their frames, as a
/// write to the stream would. Any thread. Buffers are dropped without a lock.
class Lender {
  public:
    /// A client's arrays are born in shared memory as long as the lender is open. An engine's are not: the code that it
    /// runs may fork, and would share them with the child.
    explicit Lender(Role role);
    ~Lender();
    Lender(const Lender&) = delete;
    Lender& operator=(const Lender&) = delete;

    /// Lends a frame's content, and takes its buffer: where it is in shared memory without a copy, else copied if that
    /// pays. Empty, the frame unchanged, for what has to travel as bytes. Throws std::bad_alloc.
    std::optional<Loan> lend(framing::DataFrame& frame);

    /// The peer is done with a content. `kept`: but its memory stays mapped there, so it must not be written to again.
    /// False for a number that is not lent.
    bool takeBack(std::uint64_t number, bool kept);

    /// See Loan::read().
    bool read(std::uint64_t number, const std::function<void(iovec)>& use);

    /// The session is over. The peer may go on reading what it has mapped, and sees no further change.
    void close();

  private:
    vantor::carrier::shared_memory::SegmentPool& pool_;
    const vantor::carrier::shared_memory::SegmentPool::Viewer viewer_;

    std::mutex mutex_;
    bool open_ = true;
    std::uint64_t lastNumber_ = 0;
    std::unordered_map<std::uint64_t, framing::FrameBuffer> lent_;
};

}  // namespace foundation::msg_svc::transport::layers::session::lending
