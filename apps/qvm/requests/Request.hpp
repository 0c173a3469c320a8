// One request of a client, from its arrival to its reply.
#pragma once

#include <boost/shared_ptr.hpp>
#include <cstddef>
#include <string>
#include <variant>

#include "cmddistributor/EvalIIP.hpp"
#include "cmddistributor/FEvalIIP.hpp"
#include "cmddistributor/IIPEnqueueMessage.hpp"
#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace qvm {

namespace framing = foundation::vantor::carrier::framing;

/// A value; copies share the message.
struct Request {
    /// Code to evaluate, or a function to call. Points into the message.
    using Task = std::variant<const cmddistributor::EvalIIP*, const cmddistributor::FEvalIIP*>;

    framing::StreamID stream = 0;  ///< of the enqueue message; the request's events and its reply travel on it too
    boost::shared_ptr<const cmddistributor::IIPEnqueueMessage> message;
    Task task;
    bool requeued = false;  ///< a prompt had taken it and closed before its turn

    const foundation::msg_svc::exchange::IDType& id() const noexcept { return message->getID(); }
};

/// The request that a message from the client brings. Throws std::invalid_argument when the message asks for something
/// else than an evaluation or a call.
Request arrivedRequest(framing::StreamID stream, boost::shared_ptr<const cmddistributor::IIPEnqueueMessage> message);

/// The absolute path of the file that the request's code comes from, UTF-8. Empty for none: the request's name is a
/// path if it begins with a slash, which no code does.
std::string fileOf(const Request& request);

/// Memory that a waiting request holds, in bytes, roughly: what its peer decides counts, plus a fixed share for the
/// rest.
std::size_t memoryOf(const Request& request);

}  // namespace qvm
