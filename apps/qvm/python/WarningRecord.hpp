// A warning of Python code as the record that the warning events carry.
#pragma once

#include <pybind11/pybind11.h>

#include <string>

#include "korvel/lang/diagnostic/Warning.hpp"

namespace qvm {

/// What Python tells of a warning; `arguments` holds int, float and str objects, `stack` tuples of a file, a function
/// and a line, from the outermost frame to the innermost.
struct PythonWarning {
    pybind11::str identifier;
    pybind11::str format;
    pybind11::list arguments;
    pybind11::str message;
    pybind11::list stack;
    bool wasDisabled = false;
};

/// The record, issued now. An int becomes the first of int, long and unsigned long that holds it, and its digits as
/// text when none does. Throws py::error_already_set or py::cast_error for parts of other types.
korvel::lang::diagnostic::Warning warningRecord(const PythonWarning& warning);

/// Now as a date number: days since year 0, in UTC.
double dateNumber();

}  // namespace qvm
