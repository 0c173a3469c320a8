// An array's description and its bytes do not fit together.
#pragma once

#include <stdexcept>

namespace foundation::korveldata {

/// The text says what was described, what was expected and what was there.
class ArrayFormatError : public std::runtime_error {
  public:
    using std::runtime_error::runtime_error;
};

}  // namespace foundation::korveldata
