// Messages on their way to a descriptor.
#pragma once

#include <sys/uio.h>

#include <cstddef>
#include <cstdint>
#include <deque>
#include <memory>
#include <string>
#include <vector>

#include "foundation/msg_svc/transport/layers/session/FrameHeader.hpp"
#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace foundation::msg_svc::transport::layers::session {

/// One message, or one frame of the session's own, as pieces of memory. It owns the frames that the pieces lie in, so
/// their buffers live until the message is dropped. Movable; moving leaves the pieces where they are.
class OutgoingPieces {
  public:
    /// All frames of a message, the first with index 1, the last a tagged one.
    OutgoingPieces(std::vector<std::unique_ptr<framing::Frame>> frames, bool answer);

    /// A goodbye, or an abort with its reason.
    OutgoingPieces(FrameKind kind, const std::string& content);

    /// Bytes of the whole message, headers and tags included.
    std::size_t bytes() const noexcept { return bytes_; }
    bool answer() const noexcept { return answer_; }
    bool begun() const noexcept { return begun_; }
    bool done() const noexcept { return next_ == pieces_.size(); }

    /// Appends unwritten pieces to `gathered`, up to `most` bytes and `mostPieces` elements in all.
    void gather(std::vector<iovec>& gathered, std::size_t& room, std::size_t mostPieces) const;

    /// Counts up to `written` bytes as written and takes them off it.
    void consume(std::size_t& written);

    /// Copies what is unwritten of the bytes that their owner may change from now on.
    void detachUnshareable();

  private:
    void add(const void* begin, std::size_t size);

    std::vector<std::unique_ptr<framing::Frame>> frames_;
    std::vector<FrameHeader::Bytes> headers_;
    std::vector<std::unique_ptr<char[]>> copies_;
    std::vector<iovec> pieces_;
    std::size_t next_ = 0;
    std::size_t bytes_ = 0;
    bool begun_ = false;
    bool answer_ = false;
};

/// Messages in the order in which they are written. Not synchronised.
class OutgoingQueue {
  public:
    bool empty() const noexcept { return messages_.empty(); }
    std::size_t size() const noexcept { return messages_.size(); }
    OutgoingPieces& back() noexcept { return messages_.back(); }

    /// Bytes that the descriptor has taken so far.
    std::uint64_t written() const noexcept { return written_; }

    void push(OutgoingPieces message) { messages_.push_back(std::move(message)); }

    /// Does one gathered write to a non-blocking descriptor, moves the messages that are written now to `written`, and
    /// returns 0, or the errno of a write that failed (EAGAIN included).
    int writeOnce(int descriptor, std::vector<OutgoingPieces>& written);

    /// Takes all messages out; with `keepBegun` one that is written in part stays, because the peer needs its end to
    /// understand what follows.
    std::vector<OutgoingPieces> takeAll(bool keepBegun);

  private:
    std::deque<OutgoingPieces> messages_;
    std::vector<iovec> gathered_;
    std::uint64_t written_ = 0;
};

}  // namespace foundation::msg_svc::transport::layers::session
