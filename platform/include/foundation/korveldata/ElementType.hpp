// What the elements of an array are.
#pragma once

#include <complex>
#include <cstddef>
#include <cstdint>
#include <string_view>
#include <type_traits>

namespace foundation::korveldata {

/// The numbers are those of the wire. Elements are little-endian; complex ones are the real part followed by the
/// imaginary part.
///
///     code   element                                   bytes
///     1      bool, one byte that is 0 or 1             1
///     2      UTF-16 code unit                          2
///     3      container of other arrays                 none: described by number only, not built by this library
///     4, 5   IEEE 754 single, double                   4, 8
///     6-13   int8, uint8, int16, ... int64, uint64     1, 1, 2, 2, 4, 4, 8, 8
///     14, 15 complex single, double                    8, 16
///     16-23  complex of 6-13, in the same order        2, 2, 4, 4, 8, 8, 16, 16
enum class ElementType : int {
    Bool = 1,
    Char16 = 2,
    Container = 3,
    Single = 4,
    Double = 5,
    Int8 = 6,
    UInt8 = 7,
    Int16 = 8,
    UInt16 = 9,
    Int32 = 10,
    UInt32 = 11,
    Int64 = 12,
    UInt64 = 13,
    ComplexSingle = 14,
    ComplexDouble = 15,
    ComplexInt8 = 16,
    ComplexUInt8 = 17,
    ComplexInt16 = 18,
    ComplexUInt16 = 19,
    ComplexInt32 = 20,
    ComplexUInt32 = 21,
    ComplexInt64 = 22,
    ComplexUInt64 = 23,
};

/// Bytes of one element; 0 for a type that no array is built of (Container, numbers outside the table).
std::size_t elementSize(ElementType type) noexcept;

/// A word for diagnostics, for example "complex double"; "unknown" for numbers outside the table.
std::string_view elementTypeName(ElementType type) noexcept;

/// The element type that stands for the C++ type T.
template <typename T>
struct ElementTypeOf;

/// An element type as a C++ type, from which ElementTypeOf derives.
template <ElementType type>
using ElementTypeConstant = std::integral_constant<ElementType, type>;

// clang-format off
template <> struct ElementTypeOf<bool> : ElementTypeConstant<ElementType::Bool> {};
template <> struct ElementTypeOf<char16_t> : ElementTypeConstant<ElementType::Char16> {};
template <> struct ElementTypeOf<float> : ElementTypeConstant<ElementType::Single> {};
template <> struct ElementTypeOf<double> : ElementTypeConstant<ElementType::Double> {};
template <> struct ElementTypeOf<std::int8_t> : ElementTypeConstant<ElementType::Int8> {};
template <> struct ElementTypeOf<std::uint8_t> : ElementTypeConstant<ElementType::UInt8> {};
template <> struct ElementTypeOf<std::int16_t> : ElementTypeConstant<ElementType::Int16> {};
template <> struct ElementTypeOf<std::uint16_t> : ElementTypeConstant<ElementType::UInt16> {};
template <> struct ElementTypeOf<std::int32_t> : ElementTypeConstant<ElementType::Int32> {};
template <> struct ElementTypeOf<std::uint32_t> : ElementTypeConstant<ElementType::UInt32> {};
template <> struct ElementTypeOf<std::int64_t> : ElementTypeConstant<ElementType::Int64> {};
template <> struct ElementTypeOf<std::uint64_t> : ElementTypeConstant<ElementType::UInt64> {};
template <> struct ElementTypeOf<std::complex<float>> : ElementTypeConstant<ElementType::ComplexSingle> {};
template <> struct ElementTypeOf<std::complex<double>> : ElementTypeConstant<ElementType::ComplexDouble> {};
// clang-format on

}  // namespace foundation::korveldata
