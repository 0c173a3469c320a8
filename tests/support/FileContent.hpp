// What is in a file that a test looks at.
#pragma once

#include <fstream>
#include <iterator>
#include <string>

namespace test_support {

/// All bytes of a file; empty for one that is not there.
inline std::string contentOf(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
}

}  // namespace test_support
