// Requests as a session would have delivered them.
#pragma once

#include <boost/smart_ptr/make_shared.hpp>
#include <string>

#include "capabilities/CapabilityList.hpp"
#include "cmddistributor/EvalIIP.hpp"
#include "cmddistributor/IIPEnqueueMessage.hpp"
#include "qvm/requests/Request.hpp"

namespace qvm_test {

struct RequestParts {
    std::uint64_t number = 1;  ///< the request's identifier, and the stream that it travels on
    krutil::cmddistributor::WhenToDequeue::WhenToDequeue mode = krutil::cmddistributor::WhenToDequeue::DEQUEUE_AT_IDLE;
    std::u16string code = u"1";
    cmddistributor::IqmStreamID streams = cmddistributor::IqmStreamID::ekIqmCmdWinStream;
    krutil::io::SinkTraits out;
    krutil::io::SinkTraits err;
    bool flushSparingly = false;
};

inline qvm::Request makeRequest(const RequestParts& parts = {}) {
    const auto iip = boost::make_shared<const cmddistributor::EvalIIP>(
        "python", parts.streams, nullptr, parts.out, parts.err, parts.code, cmddistributor::CodeType::CodeBlockType);
    return qvm::arrivedRequest(static_cast<qvm::framing::StreamID>(parts.number),
                               boost::make_shared<const cmddistributor::IIPEnqueueMessage>(
                                   iip, foundation::msg_svc::exchange::IDType(0, parts.number), 0, boost::none, nullptr,
                                   parts.mode, u"", capabilities::CapabilityList(), nullptr, parts.flushSparingly));
}

}  // namespace qvm_test
