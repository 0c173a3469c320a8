// Requests as a session would have delivered them.
#pragma once

#include <boost/smart_ptr/make_shared.hpp>
#include <string>

#include "capabilities/CapabilityList.hpp"
#include "cmddistributor/EvalIIP.hpp"
#include "cmddistributor/FEvalIIP.hpp"
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
    capabilities::CapabilityList needs;
    std::string function;  ///< a call of this function, without arguments, instead of the code
};

inline boost::shared_ptr<const cmddistributor::IIP> makeTask(const RequestParts& parts) {
    using cmddistributor::FEvalIIP;
    if (parts.function.empty()) {
        return boost::make_shared<const cmddistributor::EvalIIP>("python", parts.streams, nullptr, parts.out, parts.err,
                                                                 parts.code, cmddistributor::CodeType::CodeBlockType);
    }
    return boost::make_shared<const FEvalIIP>(
        "python", parts.function, 0UL, FEvalIIP::Data::makeClientSideData(krutil::cmddistributor::EDIDataWrapper()),
        parts.streams, parts.out, parts.err, 1U, 1U, true);
}

inline qvm::Request makeRequest(const RequestParts& parts = {}) {
    return qvm::arrivedRequest(static_cast<qvm::framing::StreamID>(parts.number),
                               boost::make_shared<const cmddistributor::IIPEnqueueMessage>(
                                   makeTask(parts), foundation::msg_svc::exchange::IDType(0, parts.number), 0,
                                   boost::none, nullptr, parts.mode, u"", parts.needs, nullptr, parts.flushSparingly));
}

}  // namespace qvm_test
