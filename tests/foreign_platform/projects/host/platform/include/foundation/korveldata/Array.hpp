// Arrays: planes of elements, for example the real and the imaginary one. A value; copies share the planes.
#pragma once

#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "foundation/korveldata/Buffer.hpp"

namespace foundation::korveldata {

class Array {
  public:
    /// Memory of newBuffer().
    using Plane = std::shared_ptr<const char>;

    /// Elements of the type with this code; each plane has all of them.
    Array(int code, std::vector<unsigned long> extents, std::vector<Plane> planes)
        : planes_(std::move(planes)), extents_(std::move(extents)), code_(code) {}

    int code() const { return code_; }
    const std::vector<unsigned long>& extents() const { return extents_; }
    const std::vector<Plane>& planes() const { return planes_; }

    /// The bytes of one plane.
    std::string bytes(std::size_t plane) const {
        return std::string(planes_.at(plane).get(), sizeOf(planes_.at(plane).get()));
    }

  private:
    std::vector<Plane> planes_;
    std::vector<unsigned long> extents_;
    int code_;
};

}  // namespace foundation::korveldata
