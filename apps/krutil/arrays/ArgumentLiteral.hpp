// Arrays as a person writes them on a command line.
#pragma once

#include <cstddef>
#include <stdexcept>
#include <string>

#include "foundation/korveldata/Array.hpp"

namespace krutil_client {

/// A literal that cannot be read; what() says what was expected and what is there.
class LiteralError : public std::runtime_error {
  public:
    LiteralError(std::size_t offset, const std::string& sentence) : std::runtime_error(sentence), offset_(offset) {}

    /// Where it went wrong, in bytes.
    std::size_t offset() const noexcept { return offset_; }

  private:
    std::size_t offset_;
};

/// Reads a literal:
///
///     7, -7                        int64, no dimensions
///     3.5, 1e3, -.5, inf, nan      double
///     2j, 1+2j                     complex double
///     true, false                  bool
///     "text"                       text, with the escapes of JSON
///     [1, 2, 3], [[1,2],[3,4]]     an array, one dimension for each level; [] has no doubles
///
/// Numbers of different types in one list become the type that holds them all; truth values, texts and numbers do not
/// mix. Throws LiteralError.
foundation::korveldata::Array parseLiteral(const std::string& text);

}  // namespace krutil_client
