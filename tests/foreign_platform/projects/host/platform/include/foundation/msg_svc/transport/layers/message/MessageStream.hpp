// A message that is being written. Not synchronised.
#pragma once

#include <list>
#include <memory>

#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace foundation::msg_svc::transport::layers::message {

/// Keeps the frames until they are taken.
class MessageStream {
  public:
    using Frame = vantor::carrier::framing::Frame;

    virtual ~MessageStream() = default;

    virtual void append(std::unique_ptr<Frame>& frame) { frames_.push_back(std::move(frame)); }

    std::list<std::unique_ptr<Frame>> take() { return std::move(frames_); }

  private:
    std::list<std::unique_ptr<Frame>> frames_;
};

}  // namespace foundation::msg_svc::transport::layers::message
