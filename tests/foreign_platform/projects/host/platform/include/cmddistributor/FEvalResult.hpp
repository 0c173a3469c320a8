// What a function returned. Immutable.
#pragma once

#include <boost/variant.hpp>
#include <string>
#include <vector>

#include "cmddistributor/IIPResult.hpp"
#include "foundation/korveldata/Array.hpp"

namespace cmddistributor {

class FEvalResult : public IIPResult {
  public:
    using Results = boost::variant<int, std::string, std::vector<foundation::korveldata::Array>, double>;

    FEvalResult(const foundation::msg_svc::exchange::IDType& of, std::vector<foundation::korveldata::Array>&& arrays)
        : IIPResult(of, boost::none), results_(std::move(arrays)) {}

    Results getResults() const { return results_; }

  private:
    Results results_;
};

}  // namespace cmddistributor
