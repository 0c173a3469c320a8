#include "foundation/msg_svc/transport/layers/message/Message.hpp"

#include "foundation/msg_svc/transport/layers/message/LastAsked.hpp"
#include "foundation/msg_svc/transport/layers/message/MessageStream.hpp"

namespace foundation::msg_svc::transport::layers::message {

LastAsked& lastAsked() noexcept {
    thread_local constinit LastAsked note;
    return note;
}

MessageStream::~MessageStream() = default;

Message::Message(std::vector<std::unique_ptr<Frame>> frames) : frames_(std::move(frames)) {}

Message::~Message() = default;

const std::unique_ptr<Frame>& Message::frame(unsigned long index) const noexcept {
    static const std::unique_ptr<Frame> none;
    const std::unique_ptr<Frame>& found = index < frames_.size() ? frames_[index] : none;
    LastAsked& note = lastAsked();
    note.index = index;
    note.found = found != nullptr;
    return found;
}

std::unique_ptr<Frame> Message::release(unsigned long index) noexcept {
    std::unique_ptr<Frame> found = index < frames_.size() ? std::move(frames_[index]) : nullptr;
    LastAsked& note = lastAsked();
    note = {index, found != nullptr, found ? index : note.released};
    return found;
}

}  // namespace foundation::msg_svc::transport::layers::message
