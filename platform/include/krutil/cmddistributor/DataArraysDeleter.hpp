// Releases the arrays of a function call.
#pragma once

#include <vector>

#include "foundation/korveldata/Array.hpp"

namespace krutil::cmddistributor {

/// Deleter of the vector that an EDIDataWrapper owns. Null is ignored.
struct DataArraysDeleter {
    /// Destroys the arrays and frees the vector.
    void operator()(std::vector<foundation::korveldata::Array>* arrays) const noexcept;
};

}  // namespace krutil::cmddistributor
