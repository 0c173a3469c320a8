#include "cmddistributor/IIPResult.hpp"

#include "krutil/cmddistributor/IIPReply.hpp"

namespace cmddistributor {

RuntimeException::RuntimeException(krutil::cmddistributor::inExecutionStatus status, std::u16string msgText,
                                   std::string msgID, std::string functionName, std::vector<StackFrame> frames,
                                   std::vector<RuntimeException> causes, bool shown)
    : status_(status),
      msgText_(std::move(msgText)),
      msgID_(std::move(msgID)),
      functionName_(std::move(functionName)),
      frames_(std::move(frames)),
      causes_(std::move(causes)),
      shown_(shown) {}

IIPResult::IIPResult(const foundation::msg_svc::exchange::IDType& requestId,
                     boost::optional<RuntimeException> exception)
    : id(requestId), exception_(std::move(exception)) {}

IIPResult::~IIPResult() = default;

}  // namespace cmddistributor

namespace krutil::cmddistributor {

IIPReply::IIPReply(foundation::msg_svc::exchange::IDType id, std::unique_ptr<::cmddistributor::IIPResult>&& result)
    : id_(id), result_(std::move(result)) {}

IIPReply::~IIPReply() = default;

}  // namespace krutil::cmddistributor
