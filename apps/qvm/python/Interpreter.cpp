#include "qvm/python/Interpreter.hpp"

#include <pybind11/embed.h>

#include <frameobject.h>

#include <unistd.h>

#include <atomic>
#include <new>
#include <string>
#include <utility>

#include "msg_svc/protobuf/ustring.hpp"
#include "qvm/process/ForkedChild.hpp"
#include "qvm/python/FunctionCall.hpp"
#include "qvm/python/PythonStart.hpp"
#include "qvm/python/PythonText.hpp"
#include "qvm/python/ReleaseQueue.hpp"

namespace py = pybind11;

#if defined(KRUTIL_SANITIZED)
// Absent in builds with a sanitizer that does not look for leaks. Ends the process when there are any.
extern "C" void __lsan_do_leak_check() __attribute__((weak));
#endif

namespace qvm {
namespace {

using cmddistributor::RuntimeException;
using krutil::cmddistributor::inCOMPILE_ERROR;
using krutil::cmddistributor::inEXECUTION_CTRLC;
using krutil::cmddistributor::inEXECUTION_DBQUIT;
using krutil::cmddistributor::inExecutionStatus;
using krutil::cmddistributor::inRUNTIME_ERROR;

// The exception that is set, as an instance with its traceback; none is set afterwards.
py::object takeException() {
    PyObject* type = nullptr;
    PyObject* value = nullptr;
    PyObject* traceback = nullptr;
    PyErr_Fetch(&type, &value, &traceback);
    PyErr_NormalizeException(&type, &value, &traceback);
    if (traceback != nullptr) {
        PyException_SetTraceback(value, traceback);
    }
    Py_XDECREF(type);
    Py_XDECREF(traceback);
    return py::reinterpret_steal<py::object>(value);
}

bool isA(const py::object& object, PyObject* type) {
    return PyObject_TypeCheck(object.ptr(), reinterpret_cast<PyTypeObject*>(type)) != 0;
}

// As at the end of a Python program: nothing and integers are exit statuses, anything else is a failure.
long exitStatus(const py::object& exitException) {
    PyObject* const code = reinterpret_cast<PySystemExitObject*>(exitException.ptr())->code;
    if (code == nullptr || code == Py_None) {
        return 0;
    }
    if (!PyLong_Check(code)) {
        return 1;
    }
    const long status = PyLong_AsLong(code);
    PyErr_Clear();
    return status;
}

[[noreturn]] void endForkedChild(const py::object& exception) {
    int status = 0;
    if (exception && isA(exception, PyExc_SystemExit)) {
        status = static_cast<int>(exitStatus(exception) & 0xFF);
        PyObject* const code = reinterpret_cast<PySystemExitObject*>(exception.ptr())->code;
        if (code != nullptr && code != Py_None && !PyLong_Check(code)) {
            PyFile_WriteObject(code, PySys_GetObject("stderr"), Py_PRINT_RAW);
            PyFile_WriteString("\n", PySys_GetObject("stderr"));
        }
    } else if (exception) {
        status = 1;
        PyErr_Display(reinterpret_cast<PyObject*>(Py_TYPE(exception.ptr())), exception.ptr(),
                      PyException_GetTraceback(exception.ptr()));
    }
    try {
        py::module_::import("qvm").attr("_finish")();
        py::module_::import("_qvm").attr("flush")();
    } catch (const py::error_already_set&) {
        status = status == 0 ? 1 : status;
    }
    ::_exit(status);
}

// Where code finds its names.
class Namespace {
  public:
    Namespace(const py::dict& globals, const py::object& runToEnd)
        : runToEnd_(runToEnd), globals_(globals), locals_(globals) {}

    // That of a frame that stands still.
    Namespace(PyObject* frame, const py::object& runToEnd)
        : runToEnd_(runToEnd),
          frame_(reinterpret_cast<PyFrameObject*>(frame)),
          globals_(py::reinterpret_steal<py::object>(PyFrame_GetGlobals(frame_))),
          locals_(py::reinterpret_steal<py::object>(PyFrame_GetLocals(frame_))) {}

    // Lets warnings that were shown once be shown again: locations of another evaluation look the same.
    void forgetWarnings() const {
        static PyObject* const name = PyUnicode_InternFromString("__warningregistry__");
        if (PyDict_Contains(globals_.ptr(), name) == 1) {
            PyDict_DelItem(globals_.ptr(), name);
        }
        PyErr_Clear();
    }

    // New reference, or null with an exception set.
    PyObject* run(PyObject* code) const { return assigned(evaluated(code, globals_.ptr())); }

    // The same for an expression. Functions and comprehensions inside it see the frame's variables as global ones,
    // because they see no others.
    PyObject* value(PyObject* code) const {
        if (frame_ == nullptr || globals_.is(locals_) || !holdsCode(code)) {
            return run(code);
        }
        const auto merged = py::reinterpret_steal<py::object>(PyDict_Copy(globals_.ptr()));
        if (!merged || PyDict_Update(merged.ptr(), locals_.ptr()) != 0) {
            return nullptr;
        }
        return assigned(evaluated(code, merged.ptr()));
    }

  private:
    static bool holdsCode(PyObject* code) {
        PyObject* const constants = reinterpret_cast<PyCodeObject*>(code)->co_consts;
        for (Py_ssize_t i = 0; i < PyTuple_GET_SIZE(constants); ++i) {
            if (PyCode_Check(PyTuple_GET_ITEM(constants, i))) {
                return true;
            }
        }
        return false;
    }

    // The value of the code. Code that awaits makes a coroutine, which is run to its end.
    PyObject* evaluated(PyObject* code, PyObject* globals) const {
        PyObject* const value = PyEval_EvalCode(code, globals, locals_.ptr());
        if (value == nullptr || (reinterpret_cast<PyCodeObject*>(code)->co_flags & CO_COROUTINE) == 0) {
            return value;
        }
        PyObject* const result = PyObject_CallOneArg(runToEnd_.ptr(), value);
        Py_DECREF(value);
        return result;
    }

    // Gives the frame its variables back, which code has assigned in a copy.
    PyObject* assigned(PyObject* result) const {
        if (frame_ != nullptr) {
            PyObject* type = nullptr;
            PyObject* error = nullptr;
            PyObject* traceback = nullptr;
            PyErr_Fetch(&type, &error, &traceback);
            PyFrame_LocalsToFast(frame_, 1);
            PyErr_Restore(type, error, traceback);
        }
        return result;
    }

    const py::object& runToEnd_;
    PyFrameObject* frame_ = nullptr;
    py::object globals_;
    py::object locals_;
};

}  // namespace

struct Interpreter::State {
    py::dict globals;
    py::object module;
    py::object compile;
    py::object runToEnd;
    py::object finish;
    py::object formatError;
    py::object debuggerQuit;
    py::list atEnd;  // empty for most sessions
    py::object endRequest;
    ReleaseQueue releases;
};

namespace {

RecordBounds recordBounds(const MessageBounds& bounds) {
    RecordBounds result;
    result.totalBytes = bounds.errorBytes;
    return result;
}

}  // namespace

Interpreter::Interpreter(const PythonConfig& world, const MessageBounds& bounds)
    : bounds_(recordBounds(bounds)), printedCharacters_(bounds.printedCharacters) {
    startPython(world);
    state_ = std::make_unique<State>();
    state_->globals = py::module_::import("__main__").attr("__dict__");
    const auto module = py::module_::import("qvm");
    state_->module = module;
    state_->compile = module.attr("_compile");
    state_->runToEnd = module.attr("_run_to_end");
    state_->finish = module.attr("_finish");
    state_->formatError = module.attr("_format_error");
    state_->debuggerQuit = module.attr("DebuggerQuit");
    state_->atEnd = module.attr("_at_end");
    state_->endRequest = module.attr("_end_request");
}

Interpreter::~Interpreter() {
#if defined(KRUTIL_SANITIZED)
    bool alone = false;
    try {
        alone = py::module_::import("threading").attr("active_count")().cast<int>() == 1;
        // What was prepared is to be freed as well.
        py::module_::import("gc").attr("unfreeze")();
    } catch (const py::error_already_set&) {
        alone = false;
    }
    if (alone) {
        dropReleased();
        state_.reset();
        py::finalize_interpreter();
        if (__lsan_do_leak_check != nullptr) {
            __lsan_do_leak_check();
        }
        return;
    }
#endif
    // Kept reachable: it is left behind on purpose, and no leak.
    static std::atomic<State*> left{nullptr};
    left = state_.release();
}

Interpreter::Ending Interpreter::evaluate(const cmddistributor::EvalIIP& request, const std::string& file,
                                          PyObject* frame) {
    const Namespace names =
        frame == nullptr ? Namespace(state_->globals, state_->runToEnd) : Namespace(frame, state_->runToEnd);
    names.forgetWarnings();
    ++evaluations_;
    const std::string name = file.empty() ? "<eval-" + std::to_string(evaluations_) + ">" : file;
    const int beginsFile = !file.empty() && frame == nullptr ? 1 : 0;
    const auto source = py::reinterpret_steal<py::object>(strOf(request.getCommand()));
    const auto compiled = py::reinterpret_steal<py::object>(
        source ? PyObject_CallFunction(state_->compile.ptr(), "Osii", source.ptr(), name.c_str(),
                                       static_cast<int>(request.getCodeType()), beginsFile)
               : nullptr);
    if (!compiled) {
        return failure(inCOMPILE_ERROR);
    }
    PyObject* const statements = PyTuple_GET_ITEM(compiled.ptr(), 0);
    PyObject* const expression = PyTuple_GET_ITEM(compiled.ptr(), 1);

    py::object done = py::none();
    if (statements != Py_None) {
        done = py::reinterpret_steal<py::object>(names.run(statements));
    }
    if (done && expression != Py_None) {
        const auto value = py::reinterpret_steal<py::object>(names.value(expression));
        PyObject* const hook = PySys_GetObject("displayhook");
        if (value && hook == nullptr) {
            PyErr_SetString(PyExc_RuntimeError, "lost sys.displayhook");
        }
        done = py::reinterpret_steal<py::object>(value && hook != nullptr ? PyObject_CallOneArg(hook, value.ptr())
                                                                          : nullptr);
    }
    if (!done) {
        return failure(inRUNTIME_ERROR);
    }
    if (inForkedChild()) {
        endForkedChild({});
    }
    return {};
}

Interpreter::Ending Interpreter::call(const cmddistributor::FEvalIIP& request, Outputs outputs) {
    Namespace(state_->globals, state_->runToEnd).forgetWarnings();
    try {
        const std::string& name = request.getFunctionName();
        const py::object function = findFunction(name, state_->globals, state_->module);
        const py::object value = callWithArrays(function, name, request.getData()->takeArrays(), state_->globals);
        if (inForkedChild()) {
            endForkedChild({});
        }
        Ending ending;
        ending.outputs = outputsOf(value, name, request.getNlhs(), state_->releases);
        if (outputs == Outputs::Copied) {
            for (foundation::korveldata::Array& array : *ending.outputs) {
                // Gives an array over memory of another owner elements of its own.
                array.mutableData();
            }
        }
        return ending;
    } catch (py::error_already_set& error) {
        error.restore();
    } catch (const std::bad_alloc&) {
        PyErr_NoMemory();
    } catch (const std::exception& error) {
        PyErr_SetString(PyExc_RuntimeError, error.what());
    }
    return failure(inRUNTIME_ERROR);
}

void Interpreter::endRequest(Ending& ending) {
    if (state_->atEnd.empty() || ending.exit ||
        (ending.error && ending.error->getExecutionStatus() == inEXECUTION_CTRLC)) {
        return;
    }
    if (const auto done = py::reinterpret_steal<py::object>(PyObject_CallNoArgs(state_->endRequest.ptr()))) {
        return;
    }
    Ending failed = failure(inRUNTIME_ERROR);
    if (!ending.error) {
        ending = std::move(failed);
    }
}

void Interpreter::dropReleased() noexcept {
    state_->releases.drain();
}

int Interpreter::releasedDescriptor() const noexcept {
    return state_->releases.descriptor();
}

Interpreter::Ending Interpreter::failure(inExecutionStatus status) {
    const py::object exception = takeException();
    if (inForkedChild()) {
        endForkedChild(exception);
    }
    Ending ending;
    if (isA(exception, PyExc_KeyboardInterrupt)) {
        ending.error = errorRecord(exception.ptr(), inEXECUTION_CTRLC, bounds_, ErrorWords::WithoutCode).exception;
        return ending;
    }
    bool interrupted = false;
    if (isA(exception, PyExc_SystemExit)) {
        ending.exit = true;
        if (exitStatus(exception) != 0) {
            const ErrorRecord record = errorRecord(exception.ptr(), inRUNTIME_ERROR, bounds_);
            const RuntimeException& error = record.exception;
            interrupted = record.interrupted;
            ending.error = RuntimeException(inRUNTIME_ERROR, error.GetUnicodeMessageTxt(), "SystemExit",
                                            error.getFunctionName(), error.getStackFrames(), error.getCauses(), false);
        }
    } else {
        const bool quit = isA(exception, state_->debuggerQuit.ptr());
        ErrorRecord record = errorRecord(exception.ptr(), quit ? inEXECUTION_DBQUIT : status, bounds_);
        interrupted = record.interrupted;
        if (!quit && !interrupted) {
            Printed printed = printedText(exception.ptr(), record.exception);
            interrupted = printed.interrupted;
            ending.printed = std::move(printed.text);
        }
        ending.error = std::move(record.exception);
    }
    if (interrupted) {
        ending.error =
            RuntimeException(inEXECUTION_CTRLC, u"The request was interrupted while its error was formatted.",
                             "KeyboardInterrupt", "", {}, {*ending.error}, false);
        ending.printed.clear();
    }
    return ending;
}

Interpreter::Printed Interpreter::printedText(PyObject* exception, const RuntimeException& record) const {
    const auto text = py::reinterpret_steal<py::object>(
        PyObject_CallFunction(state_->formatError.ptr(), "On", exception, static_cast<Py_ssize_t>(printedCharacters_)));
    if (text && PyUnicode_Check(text.ptr())) {
        return {utf16Of(text.ptr())};
    }
    // Types of running code can make formatting fail.
    const bool interrupted = !text && PyErr_ExceptionMatches(PyExc_KeyboardInterrupt) != 0;
    PyErr_Clear();
    std::u16string plain = msg_svc::protobuf::utf8_to_ustring(record.GetID());
    if (!record.GetUnicodeMessageTxt().empty()) {
        plain += u": " + record.GetUnicodeMessageTxt();
    }
    return {plain + u"\n", interrupted};
}

void Interpreter::handleSignals() noexcept {
    while (PyErr_CheckSignals() != 0) {
        if (PyErr_ExceptionMatches(PyExc_KeyboardInterrupt) != 0) {
            PyErr_Clear();
        } else {
            PyErr_WriteUnraisable(nullptr);
        }
    }
}

void Interpreter::unlocked(const std::function<void()>& wait) {
    py::gil_scoped_release unlocked;
    wait();
}

void Interpreter::finish() noexcept {
    PyObject* const done = PyObject_CallNoArgs(state_->finish.ptr());
    if (done == nullptr) {
        PyErr_Clear();
    }
    Py_XDECREF(done);
}

}  // namespace qvm
