// One request of a client, from its arrival to its reply.
#pragma once

#include <boost/shared_ptr.hpp>
#include <cstddef>

#include "cmddistributor/IIPEnqueueMessage.hpp"
#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace qvm {

namespace framing = foundation::vantor::carrier::framing;

/// A value; copies share the message.
struct Request {
    framing::StreamID stream = 0;  ///< of the enqueue message; the request's events and its reply travel on it too
    boost::shared_ptr<const cmddistributor::IIPEnqueueMessage> message;
    bool requeued = false;  ///< a prompt had taken it and closed before its turn

    const foundation::msg_svc::exchange::IDType& id() const noexcept { return message->getID(); }
};

/// Memory that a waiting request holds, in bytes, roughly: what its peer decides counts, plus a fixed share for the
/// rest.
std::size_t memoryOf(const Request& request);

}  // namespace qvm
