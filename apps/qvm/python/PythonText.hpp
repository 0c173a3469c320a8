// Text between Python and the host. The caller holds the interpreter lock.
#pragma once

#include <Python.h>

#include <cstddef>
#include <string>

namespace qvm {

/// Adds the UTF-16 text of the code points [begin, begin + count) of a str, as far as there are so many. A surrogate,
/// which a str may hold and text may not, becomes U+FFFD.
void appendUtf16(PyObject* text, std::size_t begin, std::size_t count, std::u16string& units);

/// UTF-16 text of the whole str, with the same replacement.
std::u16string utf16Of(PyObject* text);

/// A str of UTF-16 text, an unpaired surrogate as U+FFFD. Null with an exception set when there is no memory.
PyObject* strOf(const std::u16string& text);

/// Code as a person would have typed it at Python's prompts, each line with the prompt before it and a newline behind
/// it.
std::u16string promptedLines(const std::u16string& code);

}  // namespace qvm
