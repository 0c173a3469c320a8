// Builds arrays.
#pragma once

#include <cstring>
#include <string>
#include <vector>

#include "foundation/korveldata/Array.hpp"

namespace foundation::korveldata {

class ArrayFactory {
  public:
    Array::Plane plane(const std::string& bytes) {
        char* buffer = newBuffer(bytes.size());
        std::memcpy(buffer, bytes.data(), bytes.size());
        return Array::Plane(buffer, [](const char* last) { deleteBuffer(const_cast<char*>(last)); });
    }
};

}  // namespace foundation::korveldata
