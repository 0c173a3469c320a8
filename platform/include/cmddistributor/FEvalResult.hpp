// The outcome of a function call.
#pragma once

#include <boost/blank.hpp>
#include <boost/variant.hpp>
#include <string>
#include <vector>

#include "cmddistributor/IIPResult.hpp"
#include "foundation/korveldata/Array.hpp"
#include "krutil/cmddistributor/EDIDataWrapper.hpp"

namespace cmddistributor {

/// Immutable.
class FEvalResult : public IIPResult {
  public:
    /// Nothing, outputs as text, outputs as data, or outputs that the process keeps wrapped. Only the third form, data,
    /// can be sent.
    using Results = boost::variant<boost::blank, std::vector<std::u16string>,
                                   std::vector<foundation::korveldata::Array>, krutil::cmddistributor::EDIDataWrapper>;

    /// A call that succeeded.
    FEvalResult(const foundation::msg_svc::exchange::IDType& id, std::vector<foundation::korveldata::Array>&& outputs);

    /// Outputs in any form, with or without an error. The error is sent, but a result that is read back never has one:
    /// whoever answers a failed call sends a plain IIPResult.
    FEvalResult(const foundation::msg_svc::exchange::IDType& id, Results&& results,
                boost::optional<RuntimeException> exception);
    ~FEvalResult() override;

    /// The outputs, in the form in which they were given. Valid as long as the result.
    const Results& getResults() const noexcept { return results_; }

  private:
    Results results_;
};

}  // namespace cmddistributor
