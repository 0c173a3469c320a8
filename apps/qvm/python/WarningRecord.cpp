#include "qvm/python/WarningRecord.hpp"

#include <chrono>
#include <limits>
#include <utility>
#include <vector>

#include "msg_svc/protobuf/ustring.hpp"
#include "qvm/python/PythonText.hpp"

namespace py = pybind11;

namespace qvm {
namespace {

using korvel::lang::PrintfArgument;
using korvel::lang::diagnostic::Warning;

// The first of January 1970.
constexpr double unixEpochDay = 719529.0;

PrintfArgument integerArgument(const py::handle& value) {
    int overflow = 0;
    const long number = PyLong_AsLongAndOverflow(value.ptr(), &overflow);
    if (overflow == 0) {
        if (number >= std::numeric_limits<int>::min() && number <= std::numeric_limits<int>::max()) {
            return PrintfArgument(static_cast<int>(number));
        }
        return PrintfArgument(number);
    }
    const unsigned long positive = PyLong_AsUnsignedLong(value.ptr());
    if (PyErr_Occurred() == nullptr) {
        return PrintfArgument(positive);
    }
    PyErr_Clear();
    return PrintfArgument(utf16Of(py::str(value).ptr()));
}

PrintfArgument argument(const py::handle& value) {
    if (PyLong_Check(value.ptr())) {
        return integerArgument(value);
    }
    if (PyFloat_Check(value.ptr())) {
        return PrintfArgument(PyFloat_AS_DOUBLE(value.ptr()));
    }
    return PrintfArgument(utf16Of(value.cast<py::str>().ptr()));
}

korvel::lang::StackFrame stackFrame(const py::handle& value) {
    const auto parts = value.cast<py::tuple>();
    const py::str file(parts[0]);
    const py::str function(parts[1]);
    return {utf16Of(file.ptr()), utf16Of(function.ptr()), parts[2].cast<unsigned int>()};
}

}  // namespace

double dateNumber() {
    using Days = std::chrono::duration<double, std::ratio<86'400>>;
    return unixEpochDay + Days(std::chrono::system_clock::now().time_since_epoch()).count();
}

Warning warningRecord(const PythonWarning& warning) {
    std::vector<PrintfArgument> arguments;
    for (const py::handle& each : warning.arguments) {
        arguments.push_back(argument(each));
    }
    std::vector<korvel::lang::StackFrame> stack;
    for (const py::handle& each : warning.stack) {
        stack.push_back(stackFrame(each));
    }
    // The identifier's field takes any bytes; a client shows them as UTF-8.
    return {msg_svc::protobuf::ustring_to_utf8(utf16Of(warning.identifier.ptr())),
            utf16Of(warning.format.ptr()),
            std::move(arguments),
            utf16Of(warning.message.ptr()),
            std::move(stack),
            warning.wasDisabled,
            dateNumber()};
}

}  // namespace qvm
