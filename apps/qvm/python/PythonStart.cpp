#include "qvm/python/PythonStart.hpp"

#include <pybind11/embed.h>

#include <unistd.h>

#include <cerrno>
#include <functional>
#include <stdexcept>
#include <string>

#include "qvm/python/EngineModules.hpp"

namespace py = pybind11;

namespace qvm {
namespace {

void check(const PyStatus& status) {
    if (PyStatus_Exception(status) != 0) {
        throw std::runtime_error(std::string("Python cannot be started: ") +
                                 (status.err_msg != nullptr ? status.err_msg : "unknown reason"));
    }
}

void initialize(const PythonConfig& world) {
    PyPreConfig preConfig;
    if (world.isolated) {
        PyPreConfig_InitIsolatedConfig(&preConfig);
    } else {
        PyPreConfig_InitPythonConfig(&preConfig);
        preConfig.parse_argv = 0;
    }
    // Whatever the locale.
    preConfig.utf8_mode = 1;
#if defined(KRUTIL_SANITIZED)
    preConfig.allocator = PYMEM_ALLOCATOR_MALLOC;
#endif
    check(Py_PreInitialize(&preConfig));

    PyConfig config;
    if (world.isolated) {
        PyConfig_InitIsolatedConfig(&config);
    } else {
        PyConfig_InitPythonConfig(&config);
        config.parse_argv = 0;
        // Those of the process are not Python's to change.
        config.configure_c_stdio = 0;
    }
    config.install_signal_handlers = 1;
    PyImport_FrozenModules = engineModules();
    PyStatus status = PyConfig_SetBytesString(&config, &config.program_name, world.program.c_str());
    if (PyStatus_Exception(status) == 0) {
        status = Py_InitializeFromConfig(&config);
    }
    PyConfig_Clear(&config);
    check(status);
}

// Calls `act`, whose Python errors become the reason why the engine cannot be used.
void loading(const std::function<void()>& act) {
    try {
        act();
    } catch (const py::error_already_set& error) {
        throw std::runtime_error(std::string("The engine's Python code cannot be loaded: ") + error.what());
    }
}

// The modules that `qvm` imports, each behind those that it imports itself. Where they are is known, so nothing is
// searched: a search takes longer than all else of the import.
void importParts() {
    for (const char* const part : {"qvm_warnings", "qvm_streams", "qvm_prompts", "qvm_code"}) {
        if (PyImport_ImportFrozenModule(part) != 1) {
            throw py::error_already_set();
        }
    }
}

}  // namespace

void startPython(const PythonConfig& world) {
    if (Py_IsInitialized() == 0) {
        initialize(world);
        loading([] {
            const int collects = PyGC_Disable();
            importParts();
            py::module_::import("qvm");
            // All of it stays. It goes to the oldest generation at once, without a search for what could be freed.
            const py::module_ collector = py::module_::import("gc");
            collector.attr("freeze")();
            collector.attr("unfreeze")();
            if (collects != 0) {
                PyGC_Enable();
            }
        });
    }
}

void preparePython(const PythonConfig& world) {
    startPython(world);
    loading([] { py::module_::import("qvm").attr("_prepare")(); });
}

pid_t forkPrepared() noexcept {
    PyOS_BeforeFork();
    const pid_t child = ::fork();
    const int error = errno;
    if (child == 0) {
        PyOS_AfterFork_Child();
    } else {
        PyOS_AfterFork_Parent();
    }
    errno = error;
    return child;
}

}  // namespace qvm
