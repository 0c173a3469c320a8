// Turns the bytes of a session into messages, without doing any input itself.
#pragma once

#include <sys/uio.h>

#include <array>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <variant>
#include <vector>

#include "foundation/msg_svc/transport/layers/session/FrameHeader.hpp"
#include "foundation/msg_svc/transport/layers/session/Limits.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionRecorder.hpp"
#include "foundation/msg_svc/transport/layers/session/lending/LentContents.hpp"
#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace foundation::msg_svc::transport::layers::session {

/// The caller reads from its stream into buffers(), tells commit() how many bytes came, and takes what is complete from
/// next() until nothing is:
///
///     n = readv(descriptor, reader.buffers());  reader.commit(n);
///     while (auto item = reader.next()) { ... }
///
/// One read takes all that is there of small frames: bytes whose place is not known yet go to a buffer of the reader's,
/// and are copied from there once. What is missing of a content whose size is known is read straight to where it stays:
/// of a data frame into its own buffer from BufferAllocator. How far a read goes beyond that follows what arrives, so
/// that hardly anything of a large content takes the way of the small frames. A header's claims are checked before
/// memory is asked for, and pages of a large content are touched only as its bytes arrive.
///
/// Not synchronised. After next() has thrown, the reader must not be used again.
class MessageReader {
  public:
    /// All frames of one message, in order: the element at position i has index i + 1. Never empty.
    struct Frames {
        std::vector<std::unique_ptr<framing::Frame>> frames;
    };
    struct Goodbye {};
    struct KeepAlive {};
    struct Abort {
        std::string reason;
    };
    /// The peer is done with a content that it was lent. `kept`: its memory stays mapped there.
    struct Returned {
        std::uint64_t number;
        bool kept;
    };
    using Item = std::variant<Frames, Goodbye, KeepAlive, Abort, Returned>;

    /// Longest reason of an abort, in bytes.
    static constexpr std::uint64_t longestReason = 4096;

    /// Bytes of a read beyond those whose place is known: usually, and when as many as these were there.
    static constexpr std::size_t usualAhead = 4096;
    static constexpr std::size_t mostAhead = 65'536;

    /// `arrayTag` is the tag to which Limits::arrayMessage applies instead of Limits::taggedFrame. `borrower` has the
    /// contents that stay in the peer's memory; null when there are none. `recorder` is given each frame that is
    /// complete; null for none. `keepAlive`: whether both ends have settled on frames of that kind.
    MessageReader(const Limits& limits, std::string arrayTag, lending::LentContents* borrower = nullptr,
                  SessionRecorder* recorder = nullptr, bool keepAlive = false);

    /// Where the next bytes of the stream belong, in order; never empty. Valid until the next call of next(). To be
    /// called when next() has returned nothing.
    std::span<const iovec> buffers() noexcept;

    /// `count` bytes, at most the buffers' total, have been put there. Then next() is to be called until it returns
    /// nothing.
    void commit(std::size_t count) noexcept;

    /// What is complete, in the order of arrival; empty when more bytes are needed. Throws ProtocolViolation for a
    /// header that is not allowed, with what was expected and what came.
    std::optional<Item> next();

    /// Whether the stream may end here: no part of a message has arrived.
    bool atBoundary() const noexcept;

    /// Bytes of the content of the frame that is arriving, as soon as its size is accepted, and how many are there; 0
    /// between frames.
    std::uint64_t contentSize() const noexcept { return content_.first ? content_.second : 0; }
    std::uint64_t contentArrived() const noexcept { return contentHave_; }

    /// What is there of the message that is arriving, for the report of a lost stream.
    std::string position() const;

    /// Gives the recorder what is there of a frame that is not complete, or was refused. Nothing more will arrive.
    void recordUnfinished() const;

  private:
    void take(char* target, std::size_t& have, std::size_t size) noexcept;
    bool straight() const noexcept {
        return content_.first && contentHave_ < content_.second && tagHave_ == tag_.size();
    }
    void acceptHeader();
    std::string expectedKinds() const;
    void checkControlHeader() const;
    void checkReturnHeader() const;
    void checkMessageHeader() const;
    void checkMessageSize(std::uint64_t contentSize) const;
    void allocateContent();
    void borrowContent();
    void recordFrame(iovec lent) const;
    std::unique_ptr<framing::Frame> takeFrame();
    std::optional<Item> completeFrame();

    Limits limits_;
    std::string arrayTag_;
    lending::LentContents* borrower_;
    SessionRecorder* recorder_;
    bool keepAlive_;

    // Bytes that have arrived and are not taken yet.
    std::unique_ptr<char[]> ahead_;
    std::size_t aheadBegin_ = 0;
    std::size_t aheadEnd_ = 0;
    std::size_t aheadWanted_ = usualAhead;
    std::array<iovec, 2> buffers_{};

    // The parts of the frame that is arriving, each with how many of its bytes are there.
    FrameHeader::Bytes headerBytes_{};
    std::size_t headerHave_ = 0;
    std::optional<FrameHeader> header_;  // once it is complete and accepted
    std::string tag_;
    std::size_t tagHave_ = 0;
    framing::FrameBuffer content_;  // null until its size is accepted
    std::size_t contentHave_ = 0;

    std::vector<std::unique_ptr<framing::Frame>> frames_;
    std::uint64_t messageBytes_ = 0;
};

}  // namespace foundation::msg_svc::transport::layers::session
