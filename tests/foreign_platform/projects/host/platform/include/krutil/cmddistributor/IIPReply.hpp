// The answer to a request. Immutable.
#pragma once

#include <memory>

#include "cmddistributor/IIPResult.hpp"
#include "foundation/msg_svc/exchange/IDType.hpp"
#include "foundation/msg_svc/exchange/Reply.hpp"

namespace krutil::cmddistributor {

class IIPReply : public foundation::msg_svc::exchange::Reply {
  public:
    using Result = std::unique_ptr<::cmddistributor::IIPResult>;

    IIPReply(foundation::msg_svc::exchange::IDType id, Result&& result) : outcome_(std::move(result)), id_(id) {}

    foundation::msg_svc::exchange::IDType getID() const { return id_; }
    const Result& getResult() const { return outcome_; }

  private:
    Result outcome_;
    foundation::msg_svc::exchange::IDType id_;
};

}  // namespace krutil::cmddistributor
