#include "foundation/korveldata/ElementType.hpp"

#include <array>

namespace foundation::korveldata {

namespace {

struct Row {
    std::string_view name;
    std::size_t size;
};

/// Indexed by code.
constexpr std::array<Row, 24> rows{{
    {"unknown", 0},
    {"bool", 1},
    {"UTF-16 code unit", 2},
    {"container", 0},
    {"single", 4},
    {"double", 8},
    {"int8", 1},
    {"uint8", 1},
    {"int16", 2},
    {"uint16", 2},
    {"int32", 4},
    {"uint32", 4},
    {"int64", 8},
    {"uint64", 8},
    {"complex single", 8},
    {"complex double", 16},
    {"complex int8", 2},
    {"complex uint8", 2},
    {"complex int16", 4},
    {"complex uint16", 4},
    {"complex int32", 8},
    {"complex uint32", 8},
    {"complex int64", 16},
    {"complex uint64", 16},
}};

const Row& row(ElementType type) noexcept {
    const auto code = static_cast<std::size_t>(type);
    return code < rows.size() ? rows[code] : rows[0];
}

}  // namespace

std::size_t elementSize(ElementType type) noexcept {
    return row(type).size;
}

std::string_view elementTypeName(ElementType type) noexcept {
    return row(type).name;
}

}  // namespace foundation::korveldata
