#include "foundation/msg_svc/transport/layers/message/Message.hpp"

#include "foundation/msg_svc/transport/layers/message/MessageStream.hpp"

namespace foundation::msg_svc::transport::layers::message {

MessageStream::~MessageStream() = default;

Message::Message(std::vector<std::unique_ptr<Frame>> frames) : frames_(std::move(frames)) {}

Message::~Message() = default;

const std::unique_ptr<Frame>& Message::frame(unsigned long index) const noexcept {
    static const std::unique_ptr<Frame> none;
    return index < frames_.size() ? frames_[index] : none;
}

std::unique_ptr<Frame> Message::release(unsigned long index) noexcept {
    return index < frames_.size() ? std::move(frames_[index]) : nullptr;
}

}  // namespace foundation::msg_svc::transport::layers::message
