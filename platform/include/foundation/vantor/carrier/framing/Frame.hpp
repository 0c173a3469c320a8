// Frames: the units that a message stream carries.
//
// A frame owns its bytes. It is created by whoever writes it, passes through a std::unique_ptr<Frame> to the stream,
// and on the receiving side out of the Message that holds it. Frames are not copyable. They are not synchronised: one
// thread owns a frame at a time.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <utility>

namespace foundation::vantor::carrier::framing {

/// Names the exchange that a frame belongs to; 0 is the background stream.
using StreamID = std::uint32_t;

/// Position of a frame in its message. The first frame of a message that a session sends has index 1.
using FrameIndex = std::uint64_t;

/// One byte that tells a receiver what a frame's content is for. The kind of a frame (tagged or data) is independent of
/// it: a receiver looks at the dynamic type. Values without a name are legal; serializers compare numbers.
enum class FrameType : std::uint8_t {
    Unspecified = 0,  ///< no type of its own
    Control = 27,     ///< tagged frame of an object that steers the receiver (enqueue, cancel, enabled warnings)
    Object = 29,      ///< tagged frame of any other object
};

/// The bytes of a frame, what releases them, and their length in bytes. A null pointer stands for no bytes.
using FrameBuffer = std::pair<std::unique_ptr<char[], std::function<void(char*)>>, unsigned long>;

/// Base of both kinds of frames.
class Frame {
  public:
    virtual ~Frame();
    Frame(const Frame&) = delete;
    Frame& operator=(const Frame&) = delete;

    /// What the content is for.
    FrameType type() const noexcept { return type_; }
    /// The exchange that the frame belongs to.
    StreamID streamID() const noexcept { return streamID_; }
    /// Position in its message.
    FrameIndex index() const noexcept { return index_; }

    /// First byte of the content; valid until releaseBuffer() or destruction. May be null when size() is 0.
    const char* data() const noexcept { return buffer_.first.get(); }

    /// Length of the content in bytes; 0 for a null buffer, whatever length came with it.
    unsigned long size() const noexcept { return buffer_.first ? buffer_.second : 0; }

    /// Moves the bytes and their deleter out; the frame is left with a null buffer.
    FrameBuffer releaseBuffer() noexcept;

  protected:
    /// Takes over `buffer`, which may be null.
    Frame(FrameType type, StreamID streamID, FrameBuffer&& buffer, FrameIndex index) noexcept;

  private:
    FrameBuffer buffer_;
    FrameIndex index_;
    StreamID streamID_;
    FrameType type_;
};

}  // namespace foundation::vantor::carrier::framing
