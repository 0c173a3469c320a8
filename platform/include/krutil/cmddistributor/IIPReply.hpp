// The answer to an enqueued request.
#pragma once

#include <memory>

#include "cmddistributor/IIPResult.hpp"
#include "foundation/msg_svc/exchange/IDType.hpp"
#include "foundation/msg_svc/exchange/Reply.hpp"

namespace krutil::cmddistributor {

/// Owns the request's result, if there is one. Immutable.
class IIPReply : public foundation::msg_svc::exchange::Reply {
  public:
    /// Takes over `result`, which may be null: a request without one. `id` is that of the request.
    IIPReply(foundation::msg_svc::exchange::IDType id, std::unique_ptr<::cmddistributor::IIPResult>&& result);
    ~IIPReply() override;

    /// Identifier of the request.
    const foundation::msg_svc::exchange::IDType& getID() const noexcept { return id_; }
    /// May be empty.
    const std::unique_ptr<::cmddistributor::IIPResult>& getResult() const noexcept { return result_; }

  private:
    foundation::msg_svc::exchange::IDType id_;
    std::unique_ptr<::cmddistributor::IIPResult> result_;
};

}  // namespace krutil::cmddistributor
