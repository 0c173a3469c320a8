#include "qvm/python/PrintFunction.hpp"

#include <pybind11/pybind11.h>

#include <exception>
#include <new>

#include "qvm/python/PythonText.hpp"

namespace py = pybind11;

namespace qvm {
namespace {

// Longer text gains nothing from one piece.
constexpr std::size_t longestPrint = 4096;
// Most lines fit, so that one allocation takes all of their text.
constexpr std::size_t usualPrint = 120;

struct Printing {
    PyObject* original;  // Python's own print()
    PyObject* stream;
    PyObject* writeName;
    PyCFunction streamWrite;
    bool (*isApart)() noexcept;
    PrintedText take;
};
Printing printing{};

bool isEngineStream(PyObject* file) {
    if (file != printing.stream) {
        return false;
    }
    // Code may have given the stream another write().
    const auto method = py::reinterpret_steal<py::object>(PyObject_GetAttr(file, printing.writeName));
    if (!method) {
        PyErr_Clear();
        return false;
    }
    return PyCFunction_Check(method.ptr()) && PyCFunction_GET_FUNCTION(method.ptr()) == printing.streamWrite;
}

// Whether str() of the value runs none of the user's code and cannot fail but for want of memory.
bool isPlain(PyObject* value) {
    if (PyLong_CheckExact(value)) {
        int overflow = 0;
        PyLong_AsLongLongAndOverflow(value, &overflow);
        return overflow == 0;
    }
    return PyUnicode_CheckExact(value) || PyFloat_CheckExact(value) || PyBool_Check(value) || value == Py_None;
}

// Adds the text of a value; false if it is not to be gathered, or with an exception set.
bool add(PyObject* value, std::u16string& units) {
    if (!isPlain(value)) {
        return false;
    }
    const auto text = py::reinterpret_steal<py::object>(PyObject_Str(value));
    if (!text || units.size() + static_cast<std::size_t>(PyUnicode_GET_LENGTH(text.ptr())) > longestPrint) {
        return false;
    }
    appendUtf16(text.ptr(), 0, longestPrint, units);
    return true;
}

// What stands between values, and what after them; null where it is the usual one.
struct Punctuation {
    PyObject* separator = nullptr;
    PyObject* end = nullptr;
};

// False for what Python's own is to judge.
bool readOptions(PyObject* const* values, PyObject* names, Punctuation& found) {
    for (Py_ssize_t i = 0; names != nullptr && i < PyTuple_GET_SIZE(names); ++i) {
        PyObject* const name = PyTuple_GET_ITEM(names, i);
        const bool isSeparator = PyUnicode_CompareWithASCIIString(name, "sep") == 0;
        if (!isSeparator && PyUnicode_CompareWithASCIIString(name, "end") != 0) {
            return false;
        }
        if (values[i] != Py_None) {
            if (!PyUnicode_CheckExact(values[i])) {
                return false;
            }
            (isSeparator ? found.separator : found.end) = values[i];
        }
    }
    return true;
}

// The whole text; false if it is not to be gathered, or with an exception set.
bool gather(PyObject* const* values, Py_ssize_t count, PyObject* names, std::u16string& units) {
    Punctuation punctuation;
    if (printing.isApart() || !isEngineStream(PySys_GetObject("stdout")) ||
        !readOptions(values + count, names, punctuation)) {
        return false;
    }
    units.reserve(usualPrint);
    for (Py_ssize_t i = 0; i < count; ++i) {
        if (i > 0 && punctuation.separator == nullptr) {
            units += u' ';
        } else if (i > 0 && !add(punctuation.separator, units)) {
            return false;
        }
        if (!add(values[i], units)) {
            return false;
        }
    }
    if (punctuation.end == nullptr) {
        units += u'\n';
        return true;
    }
    return add(punctuation.end, units);
}

PyObject* print(PyObject* /*module*/, PyObject* const* values, Py_ssize_t count, PyObject* names) noexcept {
    // Not one for all calls: before it is written, other threads may print.
    std::u16string units;
    try {
        if (!gather(values, count, names, units)) {
            return PyErr_Occurred() != nullptr
                       ? nullptr
                       : PyObject_Vectorcall(printing.original, values, static_cast<std::size_t>(count), names);
        }
    } catch (const std::bad_alloc&) {
        return PyErr_NoMemory();
    } catch (const std::exception& error) {
        PyErr_SetString(PyExc_RuntimeError, error.what());
        return nullptr;
    }
    if (!printing.take(units)) {
        return nullptr;
    }
    Py_RETURN_NONE;
}

}  // namespace

void gatherPrints(PyObject* stream, PyCFunction streamWrite, bool (*isApart)() noexcept, PrintedText take) {
    const py::module_ builtins = py::module_::import("builtins");
    const py::object original = builtins.attr("print");
    // What help() and inspect show of it stays Python's own.
    static PyMethodDef method{"print", reinterpret_cast<PyCFunction>(reinterpret_cast<void (*)()>(&print)),
                              METH_FASTCALL | METH_KEYWORDS,
                              reinterpret_cast<PyCFunctionObject*>(original.ptr())->m_ml->ml_doc};
    const auto function =
        py::reinterpret_steal<py::object>(PyCFunction_NewEx(&method, builtins.ptr(), py::str("builtins").ptr()));
    const auto name = py::reinterpret_steal<py::object>(PyUnicode_InternFromString("write"));
    if (!function || !name) {
        throw py::error_already_set();
    }
    Py_INCREF(stream);
    printing = {original.inc_ref().ptr(), stream, name.inc_ref().ptr(), streamWrite, isApart, take};
    builtins.attr("print") = function;
}

}  // namespace qvm
