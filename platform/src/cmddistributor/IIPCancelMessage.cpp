#include "cmddistributor/IIPCancelMessage.hpp"

#include "cmddistributor/IIPCancelReply.hpp"

namespace cmddistributor {

IIPCancelMessage::IIPCancelMessage(const foundation::msg_svc::exchange::IDType& id, bool evenIfRunning)
    : id_(id), evenIfRunning_(evenIfRunning) {}

IIPCancelMessage::~IIPCancelMessage() = default;

IIPCancelReply::IIPCancelReply(CancelStatus status) : status_(status) {}

IIPCancelReply::~IIPCancelReply() = default;

}  // namespace cmddistributor
