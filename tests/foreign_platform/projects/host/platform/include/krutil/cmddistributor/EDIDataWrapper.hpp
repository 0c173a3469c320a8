// The arrays of a call. Movable.
#pragma once

#include <memory>
#include <vector>

#include "foundation/korveldata/Array.hpp"

namespace krutil::cmddistributor {

struct DataArraysDeleter {
    void operator()(const std::vector<foundation::korveldata::Array>* arrays) const { delete arrays; }
};

class EDIDataWrapper {
  public:
    using Arrays = std::vector<foundation::korveldata::Array>;

    EDIDataWrapper() : EDIDataWrapper(Arrays()) {}
    explicit EDIDataWrapper(Arrays arrays) : list_(new Arrays(std::move(arrays))) {}

    const Arrays& arrays() const { return *list_; }

  private:
    std::unique_ptr<Arrays, DataArraysDeleter> list_;
};

}  // namespace krutil::cmddistributor
