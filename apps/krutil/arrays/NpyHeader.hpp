// The beginning of a .npy file, which says what its elements are. Values and functions without state.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace krutil_client {

/// What a file says about its elements.
struct NpyHeader {
    std::string descr;  ///< their type, as NumPy names it
    bool columnMajor = false;
    std::vector<std::uint64_t> shape;
    std::size_t end = 0;  ///< offset in bytes of the first element

    /// `descr` for the sentence of an error: in quotes, and cut when it is long.
    std::string quotedDescr() const;
};

/// Reads the header of a file (format 1.0, 2.0 or 3.0), whose bytes are `bytes`. Throws Failure (Usage), whose sentence
/// calls the file `name`.
NpyHeader readNpyHeader(std::string_view bytes, const std::string& name);

/// All bytes of a file before its elements (format 1.0), which follow at a multiple of 64 bytes.
std::string npyHeaderText(const std::string& descr, bool columnMajor, std::span<const std::uint64_t> shape);

}  // namespace krutil_client
