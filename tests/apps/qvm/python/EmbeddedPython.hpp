// Python inside a test program, for classes of the engine that work on Python objects.
#pragma once

#include <pybind11/embed.h>
#include <pybind11/numpy.h>

#include <gtest/gtest.h>

#include <stdexcept>
#include <string>

namespace qvm_test {

namespace py = pybind11;

/// Python with a namespace of the test's own, in which `numpy` is imported. The test's thread holds the interpreter
/// lock. Python starts with the program's first such test and is not ended, because NumPy cannot be loaded twice.
class PythonTest : public ::testing::Test {
  protected:
    static void SetUpTestSuite() {
        static const bool started = start();
        static_cast<void>(started);
    }

    PythonTest() {
        names["__builtins__"] = py::module_::import("builtins");
        names["numpy"] = py::module_::import("numpy");
    }

    void run(const std::string& code) { py::exec(code, names); }
    py::object eval(const std::string& expression) { return py::eval(expression, names); }
    std::string show(const std::string& expression) { return py::str(eval(expression)); }

    /// "Type: text" of the Python error that `act` raises; empty when it raises none.
    template <class Act>
    static std::string errorOf(Act act) {
        try {
            act();
        } catch (py::error_already_set& error) {
            const std::string type = py::str(error.type().attr("__name__"));
            return type + ": " + std::string(py::str(error.value()));
        }
        return "";
    }

    py::dict names;

  private:
    static bool start() {
        PyPreConfig before;
        PyPreConfig_InitIsolatedConfig(&before);
        before.utf8_mode = 1;
#if defined(KRUTIL_SANITIZED)
        before.allocator = PYMEM_ALLOCATOR_MALLOC;
#endif
        PyConfig config;
        PyConfig_InitIsolatedConfig(&config);
        PyStatus status = Py_PreInitialize(&before);
        if (PyStatus_Exception(status) == 0) {
            status = PyConfig_SetBytesString(&config, &config.program_name, TEST_PYTHON_EXECUTABLE);
        }
        if (PyStatus_Exception(status) == 0) {
            status = Py_InitializeFromConfig(&config);
        }
        PyConfig_Clear(&config);
        if (PyStatus_Exception(status) != 0) {
            throw std::runtime_error("Python cannot be started");
        }
        return true;
    }
};

}  // namespace qvm_test
