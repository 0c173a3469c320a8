#include "qvm/python/FunctionCall.hpp"

#include <algorithm>
#include <utility>

#include "qvm/python/ErrorRecord.hpp"
#include "qvm/python/NumpyBridge.hpp"

namespace py = pybind11;

namespace qvm {
namespace {

using foundation::korveldata::Array;

[[noreturn]] void raise(PyObject* type, const std::string& text) {
    // Names come from the peer, so they may be anything.
    const auto message = py::reinterpret_steal<py::object>(
        PyUnicode_DecodeUTF8(text.data(), static_cast<Py_ssize_t>(text.size()), "replace"));
    if (message) {
        PyErr_SetObject(type, message.ptr());
    }
    throw py::error_already_set();
}

// Takes over what a function of Python's C interface returned.
py::object owned(PyObject* object) {
    if (object == nullptr) {
        throw py::error_already_set();
    }
    return py::reinterpret_steal<py::object>(object);
}

// A Python function that makes the call, with the session's names as its globals. Without a Python frame below it, much
// code that looks at its caller fails.
py::object callerIn(const py::dict& session) {
    // Compiled once: that takes as long as a third of all else that a short call costs.
    static PyObject* const code =
        owned(Py_CompileString("lambda function, arguments: function(*arguments)", engineFile, Py_eval_input))
            .release()
            .ptr();
    return owned(PyEval_EvalCode(code, session.ptr(), session.ptr()));
}

std::string quoted(const std::string& name) {
    return "'" + name + "'";
}

std::string typeNameOf(const py::handle& value) {
    return Py_TYPE(value.ptr())->tp_name;
}

// Functions of the engine's own module are asked for by clients, so they need neither NumPy nor the session's consent.
bool isEngineFunction(const std::string& name) {
    return name.starts_with("qvm.");
}

std::vector<py::str> partsOf(const std::string& name) {
    std::vector<py::str> parts;
    for (std::size_t begin = 0; begin <= name.size();) {
        const std::size_t end = std::min(name.find('.', begin), name.size());
        py::object part =
            owned(PyUnicode_DecodeUTF8(name.data() + begin, static_cast<Py_ssize_t>(end - begin), "replace"));
        if (PyUnicode_IsIdentifier(part.ptr()) != 1) {
            raise(PyExc_NameError, "Unknown function " + quoted(name) +
                                       ": a function is called by its name, or by names joined by dots as in "
                                       "'numpy.linalg.svd'");
        }
        parts.emplace_back(std::move(part));
        begin = end + 1;
    }
    return parts;
}

// The module of this name, imported if need be; null when there is none.
py::object importIfThere(const py::str& moduleName) {
    if (auto module = py::reinterpret_steal<py::object>(PyImport_Import(moduleName.ptr()))) {
        return module;
    }
    py::error_already_set error;
    if (!error.matches(PyExc_ModuleNotFoundError) || !moduleName.equal(error.value().attr("name"))) {
        // The module is there, and its own code failed.
        throw error;
    }
    return {};
}

// An attribute, or null when there is none.
py::object attributeIfThere(const py::handle& object, const py::str& attribute) {
    auto found = py::reinterpret_steal<py::object>(PyObject_GetAttr(object.ptr(), attribute.ptr()));
    if (!found) {
        if (PyErr_ExceptionMatches(PyExc_AttributeError) == 0) {
            throw py::error_already_set();
        }
        PyErr_Clear();
    }
    return found;
}

py::object first(const py::str& part, const std::string& name, const py::dict& session) {
    if (session.contains(part)) {
        return session[part];
    }
    if (py::object builtin = attributeIfThere(py::module_::import("builtins"), part)) {
        return builtin;
    }
    if (py::object module = importIfThere(part)) {
        return module;
    }
    const std::string partName = part;
    raise(PyExc_NameError, "Unknown function " + quoted(name) + ": " + quoted(partName) +
                               " is not defined in the session, not a builtin and not a module");
}

py::object further(const py::object& container, const std::string& path, const py::str& part, const std::string& name) {
    if (py::object attribute = attributeIfThere(container, part)) {
        return attribute;
    }
    const std::string partName = part;
    if (!PyModule_Check(container.ptr())) {
        raise(PyExc_AttributeError, "Unknown function " + quoted(name) + ": " + quoted(path) + " (of type " +
                                        typeNameOf(container) + ") has no attribute " + quoted(partName));
    }
    const py::object package = attributeIfThere(container, py::str("__name__"));
    if (package && PyUnicode_Check(package.ptr()) && attributeIfThere(container, py::str("__path__"))) {
        if (py::object module = importIfThere(py::str(package) + py::str(".") + part)) {
            return module;
        }
    }
    raise(PyExc_AttributeError, "Unknown function " + quoted(name) + ": the module " + quoted(path) +
                                    " has no attribute and no submodule " + quoted(partName));
}

Array toOutput(const py::handle& value, const std::string& what, ReleaseQueue& releases) {
    try {
        return toArray(value, releases);
    } catch (const NotConvertible& error) {
        raise(PyExc_TypeError, what + " " + error.what());
    }
}

bool isNumber(const py::handle& value) {
    return PyNumber_Check(value.ptr()) != 0 && !attributeIfThere(value, py::str("__len__"));
}

std::string outputs(std::uint64_t count) {
    return count == 1 ? "1 output" : std::to_string(count) + " outputs";
}

}  // namespace

py::object findFunction(const std::string& name, const py::dict& session, const py::object& engineModule) {
    const std::vector<py::str> parts = partsOf(name);
    py::object found = isEngineFunction(name) ? engineModule : first(parts.front(), name, session);
    std::string path = parts.front();
    for (std::size_t i = 1; i < parts.size(); ++i) {
        found = further(found, path, parts[i], name);
        path += "." + std::string(parts[i]);
    }
    if (PyCallable_Check(found.ptr()) == 0) {
        raise(PyExc_TypeError, quoted(name) + " cannot be called: it is of type " + typeNameOf(found));
    }
    return found;
}

py::object callWithArrays(const py::object& function, const std::string& name, std::vector<Array> arguments,
                          const py::dict& session) {
    py::tuple values(arguments.size());
    for (std::size_t i = 0; i < arguments.size(); ++i) {
        try {
            py::object number = isEngineFunction(name) ? toNumber(arguments[i]) : py::object();
            values[i] = number ? std::move(number) : toPython(std::move(arguments[i]));
        } catch (const NotConvertible& error) {
            raise(PyExc_TypeError, "Argument " + std::to_string(i + 1) + " of " + quoted(name) + " " + error.what());
        }
    }
    const py::object caller = callerIn(session);
    return owned(PyObject_CallFunctionObjArgs(caller.ptr(), function.ptr(), values.ptr(), nullptr));
}

std::vector<Array> outputsOf(const py::object& value, const std::string& name, std::uint64_t wanted,
                             ReleaseQueue& releases) {
    std::vector<Array> results;
    if (wanted == 0) {
        return results;
    }
    if (isEngineFunction(name) && PyTuple_CheckExact(value.ptr()) &&
        wanted < static_cast<std::uint64_t>(PyTuple_GET_SIZE(value.ptr()))) {
        const auto count = static_cast<Py_ssize_t>(wanted);
        const py::object fewer =
            owned(count == 1 ? PySequence_GetItem(value.ptr(), 0) : PyTuple_GetSlice(value.ptr(), 0, count));
        return outputsOf(fewer, name, wanted, releases);
    }
    const bool several = PyTuple_Check(value.ptr()) || PyList_Check(value.ptr());
    const auto given = several ? static_cast<std::uint64_t>(PySequence_Fast_GET_SIZE(value.ptr())) : 1;
    if (wanted == 1) {
        if (value.is_none()) {
            raise(PyExc_ValueError, "1 output was wanted, but " + quoted(name) + " returned none; ask for 0 outputs");
        }
        if (PyTuple_Check(value.ptr()) && !std::all_of(value.begin(), value.end(), isNumber)) {
            raise(PyExc_ValueError, "1 output was wanted, but " + quoted(name) + " returned a tuple of " +
                                        std::to_string(given) + ", which is not one array; ask for " + outputs(given));
        }
        results.push_back(toOutput(value, "The output of " + quoted(name), releases));
        return results;
    }
    if (!several || given != wanted) {
        raise(PyExc_ValueError, outputs(wanted) + " were wanted, but " + quoted(name) + " returned " +
                                    (value.is_none() ? std::string("none")
                                     : several       ? std::to_string(given)
                                                     : "1 (of type " + typeNameOf(value) + ")") +
                                    "; ask for " + outputs(value.is_none() ? 0 : given));
    }
    results.reserve(given);
    for (std::uint64_t i = 0; i < given; ++i) {
        // Looked up each time, because a conversion may run code that changes a list.
        const py::object item = owned(PySequence_GetItem(value.ptr(), static_cast<Py_ssize_t>(i)));
        results.push_back(toOutput(item, "Output " + std::to_string(i + 1) + " of " + quoted(name), releases));
    }
    return results;
}

}  // namespace qvm
