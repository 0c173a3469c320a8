// The arrays of a function call, as one value.
#pragma once

#include <memory>
#include <vector>

#include "foundation/korveldata/Array.hpp"
#include "krutil/cmddistributor/DataArraysDeleter.hpp"

namespace krutil::cmddistributor {

/// Owns its arrays; movable, not copyable. The default one stands for no arrays.
class EDIDataWrapper {
  public:
    EDIDataWrapper() noexcept = default;
    /// Moves the arrays in; their elements stay where they are.
    explicit EDIDataWrapper(std::vector<foundation::korveldata::Array>&& arrays);

    /// The arrays in argument order; empty for a default wrapper. Valid as long as the wrapper keeps them.
    const std::vector<foundation::korveldata::Array>& arrays() const noexcept;

    /// Moves the arrays out; the wrapper is left like a default one.
    std::vector<foundation::korveldata::Array> release() noexcept;

  private:
    std::unique_ptr<std::vector<foundation::korveldata::Array>, DataArraysDeleter> arrays_;
};

}  // namespace krutil::cmddistributor
