// The frames of one message between its serializers and the stream.
#pragma once

#include <memory>
#include <vector>

#include "foundation/msg_svc/transport/layers/message/MessageStream.hpp"

namespace foundation::msg_svc::transport::layers::session {

/// Collects what serializers append, so that nothing is sent of a message whose serializer throws: the collection is
/// then dropped whole. Not synchronised.
class OutgoingMessage final : public message::MessageStream {
  public:
    /// Takes any frame; whether the frames make up a message is checked when it is complete.
    void append(std::unique_ptr<message::Frame>& frame) override { frames_.push_back(std::move(frame)); }

    std::vector<std::unique_ptr<message::Frame>> takeFrames() noexcept { return std::move(frames_); }

  private:
    std::vector<std::unique_ptr<message::Frame>> frames_;
};

}  // namespace foundation::msg_svc::transport::layers::session
