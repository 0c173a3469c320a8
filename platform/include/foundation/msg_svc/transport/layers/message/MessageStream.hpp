// Where serializers put the frames of a message that is being written.
#pragma once

#include <memory>

#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace foundation::msg_svc::transport::layers::message {

namespace framing = ::foundation::vantor::carrier::framing;
using framing::Frame;

/// Sink of frames. One message is written by one thread; implementations need not be synchronised.
class MessageStream {
  public:
    virtual ~MessageStream();

    /// Hands one frame to the stream. The stream takes ownership by moving from `frame`; a frame that it leaves in the
    /// pointer is refused and stays the caller's. May throw; what happens to `frame` then is the stream's choice.
    virtual void append(std::unique_ptr<framing::Frame>& frame) = 0;
};

}  // namespace foundation::msg_svc::transport::layers::message
