// Messages on their way to a descriptor.
#pragma once

#include <sys/uio.h>

#include <cstddef>
#include <cstdint>
#include <deque>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "foundation/msg_svc/transport/layers/session/FrameHeader.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionRecorder.hpp"
#include "foundation/msg_svc/transport/layers/session/lending/DescriptorPassing.hpp"
#include "foundation/msg_svc/transport/layers/session/lending/Lender.hpp"
#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace foundation::msg_svc::transport::layers::session {

/// What one write takes from the messages that wait, and how much more it may take.
struct GatheredWrite {
    std::vector<iovec> pieces;
    std::vector<int> descriptors;  ///< that go with them; still their loans'
    std::size_t bytesLeft;
    std::size_t piecesLeft;
    std::size_t lentFramesLeft = lending::mostDescriptorsSent;  ///< those count whose descriptors went before, too

    bool full() const noexcept { return bytesLeft == 0 || piecesLeft == 0; }
};

/// One message, or one frame of the session's own, as pieces of memory. It owns the frames that the pieces lie in, so
/// their buffers live until the message is dropped. Movable; moving leaves the pieces where they are.
class OutgoingPieces {
  public:
    /// All frames of a message, the first with index 1, the last a tagged one. What `lender` lends of them stays where
    /// it is; null when the peer sees no memory of this process.
    OutgoingPieces(std::vector<std::unique_ptr<framing::Frame>> frames, bool answer, lending::Lender* lender = nullptr);

    /// A goodbye, a sign of life, or an abort with its reason.
    OutgoingPieces(FrameKind kind, const std::string& content, bool answer = false);

    /// Gives back what the peer has lent under this number. `kept`: its memory stays mapped here.
    static OutgoingPieces giveBack(std::uint64_t number, bool kept);

    /// Bytes of the whole message, headers and tags included.
    std::size_t bytes() const noexcept { return bytes_; }
    bool answer() const noexcept { return answer_; }
    bool begun() const noexcept { return begun_; }
    bool done() const noexcept { return next_ == pieces_.size(); }

    /// Gives each frame to the recorder, before anything of the message is written.
    void record(SessionRecorder& recorder) const;

    /// Appends unwritten pieces, and the descriptors that go with them, as far as there is room.
    void gather(GatheredWrite& write) const;

    /// Counts up to `written` bytes as written and takes them off it.
    void consume(std::size_t& written);

    /// Counts up to `sent` of the descriptors as sent and takes them off it.
    void consumeDescriptors(std::size_t& sent);

    /// Copies what is unwritten of the bytes that their owner may change from now on.
    void detachUnshareable();

  private:
    // A frame whose content stays where it is.
    struct LentFrame {
        std::size_t header;  // the piece that it is
        lending::Loan loan;
    };

    OutgoingPieces() = default;
    void add(const void* begin, std::size_t size);
    void addCopy(const char* begin, std::size_t size);
    void addFrame(const framing::Frame& frame, bool last, std::optional<lending::Loan> loan);

    std::vector<std::unique_ptr<framing::Frame>> frames_;
    std::vector<FrameHeader::Bytes> headers_;
    std::vector<std::unique_ptr<char[]>> copies_;
    std::vector<LentFrame> lent_;
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

    /// Takes the last message out, begun or not. Takes no memory.
    std::optional<OutgoingPieces> takeLast() noexcept;

  private:
    std::deque<OutgoingPieces> messages_;
    std::vector<iovec> pieces_;     // of a write, kept for the next one
    std::vector<int> descriptors_;  // the same
    std::uint64_t written_ = 0;
};

}  // namespace foundation::msg_svc::transport::layers::session
