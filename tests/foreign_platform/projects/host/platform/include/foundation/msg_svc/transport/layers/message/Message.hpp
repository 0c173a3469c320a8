// A received message. Not synchronised.
#pragma once

#include <map>
#include <memory>

#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace foundation::msg_svc::transport::layers::message {

class Message {
  public:
    using Frame = vantor::carrier::framing::Frame;

    void add(unsigned long index, std::unique_ptr<Frame> frame) { frames_[index] = std::move(frame); }

    /// A null pointer where no frame is.
    const std::unique_ptr<Frame>& frame(unsigned long index) const {
        const auto found = frames_.find(index);
        return found == frames_.end() ? none_ : found->second;
    }

    std::unique_ptr<Frame> release(unsigned long index) {
        const auto found = frames_.find(index);
        return found == frames_.end() ? nullptr : std::move(found->second);
    }

  private:
    std::map<unsigned long, std::unique_ptr<Frame>> frames_;
    std::unique_ptr<Frame> none_;
};

}  // namespace foundation::msg_svc::transport::layers::message
