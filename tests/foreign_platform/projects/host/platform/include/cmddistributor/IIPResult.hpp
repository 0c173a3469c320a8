// How a request went. Immutable.
#pragma once

#include <boost/optional.hpp>

#include "cmddistributor/RuntimeException.hpp"
#include "foundation/msg_svc/exchange/IDType.hpp"

namespace cmddistributor {

class IIPResult {
  public:
    IIPResult(const foundation::msg_svc::exchange::IDType& of, boost::optional<RuntimeException> error)
        : id(of), error_(std::move(error)) {}
    virtual ~IIPResult() = default;

    boost::optional<RuntimeException> getException() const { return error_; }

    foundation::msg_svc::exchange::IDType id;

  private:
    boost::optional<RuntimeException> error_;
};

}  // namespace cmddistributor
