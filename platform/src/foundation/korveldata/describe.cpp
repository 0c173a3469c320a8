#include "foundation/korveldata/describe.hpp"

namespace foundation::korveldata {

std::string describe(ElementType type, std::span<const std::uint64_t> dimensions) {
    std::string text;
    for (const std::uint64_t dimension : dimensions) {
        text += (text.empty() ? "" : " x ") + std::to_string(dimension);
    }
    return (text.empty() ? "scalar" : text) + " " + std::string(elementTypeName(type));
}

}  // namespace foundation::korveldata
