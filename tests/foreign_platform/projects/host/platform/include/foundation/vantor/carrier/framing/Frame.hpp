// Frames. One owner at a time; not synchronised.
#pragma once

#include <functional>
#include <memory>
#include <utility>

namespace foundation::vantor::carrier::framing {

using StreamID = unsigned int;
using FrameIndex = unsigned long long;

/// Numbers only: this platform names none of them.
enum class FrameType : unsigned char {};

class Frame {
  public:
    using Bytes = std::unique_ptr<char[], std::function<void(char*)>>;

    virtual ~Frame() = default;

    FrameType type() const { return content_.type; }
    FrameIndex position() const { return content_.position; }
    const char* begin() const { return content_.buffer.first.get(); }
    const char* end() const { return begin() + content_.buffer.second; }

    /// The bytes and their number; the frame keeps none.
    std::pair<Bytes, unsigned long> releaseBuffer() { return std::move(content_.buffer); }

  protected:
    Frame(FrameType type, StreamID stream, std::pair<Bytes, unsigned long>&& buffer, FrameIndex position)
        : content_{stream, type, position, std::move(buffer)} {}

  private:
    struct Content {
        StreamID stream;
        FrameType type;
        FrameIndex position;
        std::pair<Bytes, unsigned long> buffer;
    };

    Content content_;
};

}  // namespace foundation::vantor::carrier::framing
