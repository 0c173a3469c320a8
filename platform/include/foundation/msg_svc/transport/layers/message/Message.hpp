// A received message: its frames by index.
#pragma once

#include <memory>
#include <vector>

#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace foundation::msg_svc::transport::layers::message {

namespace framing = ::foundation::vantor::carrier::framing;
using framing::Frame;

/// Holds the frames of one received message until serializers take them out. Any index is a valid argument: indexes
/// come from the peer, so one that names nothing is answered with null and never grows the container. Not synchronised.
class Message {
  public:
    /// Element i becomes the frame at index i. A message that a session received has null at element 0.
    explicit Message(std::vector<std::unique_ptr<Frame>> frames);
    ~Message();
    Message(const Message&) = delete;
    Message& operator=(const Message&) = delete;

    /// The frame at `index`, null where none is (any more) and past the end. The reference stays valid as long as the
    /// message, and turns null when the frame is released.
    const std::unique_ptr<Frame>& frame(unsigned long index) const noexcept;

    /// Moves the frame at `index` out and leaves null behind; null where none is.
    std::unique_ptr<Frame> release(unsigned long index) noexcept;

    /// Number of elements, index 0 included.
    std::size_t size() const noexcept { return frames_.size(); }

  private:
    std::vector<std::unique_ptr<Frame>> frames_;
};

}  // namespace foundation::msg_svc::transport::layers::message
