// Arrays between the host and Python.
//
//     element type                          NumPy
//     bool                                  bool
//     8- to 64-bit integers                 int8 ... uint64
//     single, double                        float32, float64
//     complex single, complex double        complex64, complex128
//     UTF-16 code units                     str, not an array
//
// Numeric arrays cross in both directions without a byte being copied: an argument is a NumPy array on the memory that
// the transport received into, a result is sent from NumPy's own memory. The exceptions, one copy each:
//
// - text, which Python stores in another form;
// - results that are neither C- nor Fortran-contiguous, are misaligned, or are in the other byte order;
// - results of dtype bool in which a byte is neither 0 nor 1;
// - results that are no arrays yet: numbers, and lists of numbers.
//
// The caller holds the interpreter lock. NumPy is imported when it is first needed. Without one that fits, text and
// numbers still cross, and everything else raises ImportError.
#pragma once

#include <pybind11/pybind11.h>

#include <stdexcept>

#include "foundation/korveldata/Array.hpp"
#include "qvm/python/ReleaseQueue.hpp"

namespace qvm {

/// A value has no counterpart on the other side. The text continues a sentence that begins with the value's name.
class NotConvertible : public std::runtime_error {
  public:
    using std::runtime_error::runtime_error;
};

/// What running code sees of `array`: a NumPy array on the same memory, which keeps `array` until its last view is
/// gone. It is writable if `array` is the sole owner of its elements. Memory order is expressed in the strides. UTF-16
/// text (at most one dimension may differ from 1) is a str, an unpaired surrogate in it U+FFFD.
///
/// Throws NotConvertible for complex integers and for text in several rows, py::error_already_set when NumPy refuses.
pybind11::object toPython(foundation::korveldata::Array array);

/// Python's own number for an int64 or double without dimensions, which needs no NumPy; null for any other array.
pybind11::object toNumber(const foundation::korveldata::Array& array);

/// The array that `value` is or stands for; a str becomes a row of UTF-16 code units, a number a scalar, anything else
/// what numpy.asarray makes of it. NumPy's memory is shared and `value` kept until the last share is gone; nobody
/// should write to it until then. Contiguous memory keeps its order; row-major where both hold.
///
/// Throws NotConvertible for masked arrays and for dtypes that are not in the table above, py::error_already_set when
/// NumPy refuses.
foundation::korveldata::Array toArray(pybind11::handle value, ReleaseQueue& releases);

}  // namespace qvm
