// Python's print(), for its usual arguments in one piece.
//
// Python's own print() calls the stream for each value, separator and end, so a line would pass through the engine four
// times. This one passes on the whole text where nobody can tell the difference: values, separator and end are exactly
// str, bool, float, None or an int of 64 bits, the stream is the engine's, and so is its write(). Everything else is
// left to Python's own, a value whose __str__ may write something itself for example.
#pragma once

#include <Python.h>

#include <string>

namespace qvm {

/// Takes the text of one print(). Returns false with a Python exception set. Called with the interpreter lock.
using PrintedText = bool (*)(const std::u16string& text) noexcept;

/// Puts the function in the place of builtins.print; to be called once in a process, with the interpreter lock.
/// `stream` is the engine's sys.stdout, and `streamWrite` the function behind its write(). `isApart` tells whether the
/// engine takes no text now. Throws pybind11::error_already_set.
void gatherPrints(PyObject* stream, PyCFunction streamWrite, bool (*isApart)() noexcept, PrintedText take);

}  // namespace qvm
