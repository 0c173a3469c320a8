// The outcome of a request.
#pragma once

#include <boost/optional.hpp>

#include "cmddistributor/RuntimeException.hpp"
#include "foundation/msg_svc/exchange/IDType.hpp"

namespace cmddistributor {

/// Whose outcome it is and, if the request failed, the error. Base of the results that carry more. Immutable.
class IIPResult {
  public:
    /// `id` is that of the request; `exception` is empty when it succeeded.
    IIPResult(const foundation::msg_svc::exchange::IDType& id, boost::optional<RuntimeException> exception);
    virtual ~IIPResult();

    /// Empty when the request succeeded.
    const boost::optional<RuntimeException>& getException() const noexcept { return exception_; }

    /// Identifier of the request.
    const foundation::msg_svc::exchange::IDType id;

  private:
    boost::optional<RuntimeException> exception_;
};

}  // namespace cmddistributor
