#include "qvm/python/EngineModule.hpp"

#include <pybind11/embed.h>
#include <pybind11/stl.h>

#include <unistd.h>

#include <array>
#include <chrono>
#include <cstring>
#include <exception>
#include <new>
#include <optional>
#include <string>

#include "foundation/core/posix/writeFully.hpp"
#include "msg_svc/protobuf/ustring.hpp"
#include "qvm/process/AppendFile.hpp"
#include "qvm/process/ForkedChild.hpp"
#include "qvm/process/LastWords.hpp"
#include "qvm/python/PrintFunction.hpp"
#include "qvm/python/PythonText.hpp"
#include "qvm/python/WarningRecord.hpp"
#include "qvm/requests/Cancellation.hpp"

namespace py = pybind11;

namespace qvm {
namespace {

using capabilities::Capability;
using krutil::prompt::InputRequester;

TextOutput* output = nullptr;
Announcer* announcer = nullptr;
EngineServices* services = nullptr;

// Whether there is no session for code to use: in a process that is forked by running code, and in one that will be
// forked for sessions.
bool isApart() noexcept {
    return services == nullptr || inForkedChild();
}

// Code points that are taken out of one long text at a time, with a look at the session's room after each.
constexpr std::size_t piecePoints = 16'384;

[[noreturn]] void raise(PyObject* type, const char* text = "") {
    PyErr_SetString(type, text);
    throw py::error_already_set();
}

// Whatever Python code makes the engine send, it waits here before it goes on, and lets other threads run until the
// client has caught up. An interrupt ends the wait.
void waitForRoom() {
    const int interrupt = services->interruptDescriptor();
    bool room = false;
    {
        py::gil_scoped_release unlocked;
        room = announcer->waitForRoom(interrupt);
    }
    if (!room && services->takeInterrupt()) {
        raise(PyExc_KeyboardInterrupt);
    }
}

// Code that is apart writes to the plain descriptors, in whole lines where it can, since others write there too. The
// interpreter lock guards the text.
class PlainStream {
  public:
    explicit PlainStream(int descriptor) : descriptor_(descriptor) {}

    void write(PyObject* text) {
        held_ += msg_svc::protobuf::ustring_to_utf8(utf16Of(text));
        const std::size_t lines = held_.rfind('\n') + 1;
        const std::size_t ready = lines == 0 && held_.size() >= heldBytes ? held_.size() : lines;
        posix::writeFully(descriptor_, std::string_view(held_).substr(0, ready));
        held_.erase(0, ready);
    }

    void flush() {
        posix::writeFully(descriptor_, held_);
        held_.clear();
    }

  private:
    static constexpr std::size_t heldBytes = 8192;

    const int descriptor_;
    std::string held_;
};

PlainStream& plainStream(TextSource source) {
    static PlainStream plainOutput(STDOUT_FILENO);
    static PlainStream plainError(STDERR_FILENO);
    return source == TextSource::Error ? plainError : plainOutput;
}

// What was written to descriptors 1 and 2 before comes before Python's next text.
void drainBeforeText() {
    if (services->drainDescriptors()) {
        waitForRoom();
    }
}

void hand(TextSource source, const std::u16string& units) {
    if (output->write(source, units)) {
        waitForRoom();
    }
}

std::size_t write(TextSource source, PyObject* text) {
    if (!PyUnicode_Check(text)) {
        throw py::type_error(std::string("write() argument must be str, not ") + Py_TYPE(text)->tp_name);
    }
    const auto length = static_cast<std::size_t>(PyUnicode_GET_LENGTH(text));
    if (isApart()) {
        plainStream(source).write(text);
        return length;
    }
    drainBeforeText();
    // Guarded by the interpreter lock, and used up before that is let go.
    static std::u16string units;
    for (std::size_t begin = 0; begin < length; begin += piecePoints) {
        units.clear();
        appendUtf16(text, begin, piecePoints, units);
        hand(source, units);
    }
    return length;
}

// Runs `action`; false if it threw, with Python's exception set.
template <typename Action>
bool succeeds(const Action& action) noexcept {
    try {
        action();
        return true;
    } catch (py::error_already_set& error) {
        error.restore();
    } catch (const py::builtin_exception& error) {
        error.set_error();
    } catch (const std::bad_alloc&) {
        PyErr_NoMemory();
    } catch (const std::exception& error) {
        PyErr_SetString(PyExc_RuntimeError, error.what());
    }
    return false;
}

// Text often comes in small pieces, so these are plain functions of Python's: a call through pybind11 takes longer than
// the rest of a write.
template <TextSource source>
PyObject* writeMethod(PyObject* /*module*/, PyObject* text) noexcept {
    std::size_t length = 0;
    return succeeds([&] { length = write(source, text); }) ? PyLong_FromSize_t(length) : nullptr;
}

bool takePrinted(const std::u16string& text) noexcept {
    return succeeds([&] {
        drainBeforeText();
        hand(TextSource::Output, text);
    });
}

std::array writeMethods{PyMethodDef{"write_output", &writeMethod<TextSource::Output>, METH_O, nullptr},
                        PyMethodDef{"write_error", &writeMethod<TextSource::Error>, METH_O, nullptr},
                        PyMethodDef{"show", &writeMethod<TextSource::ShownOutput>, METH_O, nullptr},
                        PyMethodDef{nullptr, nullptr, 0, nullptr}};

void flush() {
    if (isApart()) {
        plainStream(TextSource::Output).flush();
        plainStream(TextSource::Error).flush();
        return;
    }
    const bool handedOn = output->flush();
    announcer->flush();
    if (handedOn) {
        waitForRoom();
    }
}

// For what ends the process without a word.
void sendAll() {
    if (!isApart()) {
        services->drainDescriptors();
        services->sendAll();
    }
}

// Python's handler of the signal that interrupts.
void onInterruptSignal(const py::object&, const py::object&) {
    if (!isApart() && services->takeInterrupt()) {
        raise(PyExc_KeyboardInterrupt);
    }
}

// sys.unraisablehook. Where Python drops an interrupt, in a finaliser for example, the code around that would never see
// it. No Python code runs between its repetition and the return, or that would take it.
void onUnraisable(const py::object& unraisable) {
    const py::object type = unraisable.attr("exc_type");
    if (!isApart() && type.ptr() == PyExc_KeyboardInterrupt && services->repeatInterrupt()) {
        return;
    }
    if (PyObject* const print = PySys_GetObject("__unraisablehook__")) {
        py::reinterpret_borrow<py::object>(print)(unraisable);
    }
}

bool canUse(Capability capability) {
    return !isApart() && services->canUse(capability);
}

const char* nameOf(PromptEnd end) {
    switch (end) {
        case PromptEnd::Continued:
            return "continue";
        case PromptEnd::Quit:
        case PromptEnd::EndOfInput:
            return "quit";
        case PromptEnd::Exit:
            return "exit";
        case PromptEnd::Withdrawn:
            return "withdrawn";
        case PromptEnd::Raised:
            break;
    }
    throw py::error_already_set();
}

// A prompt that opens and closes by itself sends events all the same. An interrupt must not replace the end of the
// session.
const char* closed(PromptEnd end) {
    const char* const name = nameOf(end);
    if (end != PromptEnd::Exit) {
        waitForRoom();
    }
    return name;
}

void require(Capability capability) {
    if (!canUse(capability)) {
        raise(PyExc_RuntimeError, "the client cannot be asked here");
    }
}

// `stop` has the frame in which commands are evaluated as an attribute, which they may change.
const char* commandPrompt(InputRequester loop, const py::object& stop) {
    require(loop == InputRequester::mnDEBUG_PROMPT ? Capability::Debugging : Capability::InteractiveCommandLine);
    return closed(services->prompt(
        loop, [&stop] { return stop.attr("frame").ptr(); }, std::nullopt));
}

const char* pausePrompt(const std::optional<double>& seconds) {
    require(Capability::InteractiveCommandLine);
    std::optional<std::chrono::steady_clock::time_point> deadline;
    // What lies beyond a lifetime is no deadline, and would not fit either.
    constexpr double forever = 1e9;
    if (seconds && *seconds < forever) {
        deadline = std::chrono::steady_clock::now() + std::chrono::duration_cast<std::chrono::steady_clock::duration>(
                                                          std::chrono::duration<double>(*seconds > 0 ? *seconds : 0));
    }
    return closed(services->prompt(
        InputRequester::mnPAUSE_PROMPT, []() -> PyObject* { return nullptr; }, deadline));
}

// The answer with a newline at its end; empty at the end of input.
py::object readLine() {
    std::u16string text;
    if (!canUse(Capability::InteractiveCommandLine)) {
        return py::str("");
    }
    const PromptEnd end = services->readText(text);
    closed(end);
    if (end != PromptEnd::Continued) {
        return py::str("");
    }
    if (text.empty() || text.back() != u'\n') {
        text += u'\n';
    }
    auto line = py::reinterpret_steal<py::object>(strOf(text));
    if (!line) {
        throw py::error_already_set();
    }
    return line;
}

void leavePrompt(bool quit) {
    if (isApart() || !services->leavePrompt(quit ? PromptEnd::Quit : PromptEnd::Continued)) {
        raise(PyExc_RuntimeError, "no debug, keyboard or pause prompt is open");
    }
}

void issueWarning(const py::str& identifier, const py::str& format, const py::list& arguments, const py::str& message,
                  const py::list& stack, bool wasDisabled) {
    services->issueWarning(warningRecord({identifier, format, arguments, message, stack, wasDisabled}));
    waitForRoom();
}

void setDebugging(bool on) {
    if (!isApart()) {
        services->setDebugging(on);
        waitForRoom();
    }
}

// Code of one expression, as compile() makes it; None for what is none. compile() itself would first make all the types
// of syntax trees, which takes as long as much of Python's own start.
py::object compileExpression(const py::str& source, const py::str& file) {
    Py_ssize_t length = 0;
    const char* const text = PyUnicode_AsUTF8AndSize(source.ptr(), &length);
    if (text == nullptr || std::strlen(text) != static_cast<std::size_t>(length)) {
        PyErr_Clear();
        return py::none();
    }
    PyCompilerFlags flags{PyCF_SOURCE_IS_UTF8 | PyCF_IGNORE_COOKIE | PyCF_ALLOW_TOP_LEVEL_AWAIT, PY_MINOR_VERSION};
    auto code = py::reinterpret_steal<py::object>(Py_CompileStringObject(text, file.ptr(), Py_eval_input, &flags, -1));
    if (code) {
        return code;
    }
    if (PyErr_ExceptionMatches(PyExc_SyntaxError) == 0) {
        throw py::error_already_set();
    }
    PyErr_Clear();
    return py::none();
}

// Those whose type is one of the types or derives from one, whatever they themselves say about it.
py::list instances(const py::list& things, const py::tuple& types) {
    py::list found;
    const PyTypeObject* other = nullptr;  // the type that was seen last, and is none of them
    for (Py_ssize_t i = 0; i < PyList_GET_SIZE(things.ptr()); ++i) {
        PyObject* const thing = PyList_GET_ITEM(things.ptr(), i);
        // Many things of one type often follow each other.
        if (Py_TYPE(thing) == other) {
            continue;
        }
        other = Py_TYPE(thing);
        for (const py::handle type : types) {
            if (PyObject_TypeCheck(thing, reinterpret_cast<PyTypeObject*>(type.ptr())) != 0) {
                found.append(thing);
                other = nullptr;
                break;
            }
        }
    }
    return found;
}

}  // namespace

PYBIND11_EMBEDDED_MODULE(_qvm, module) {
    if (PyModule_AddFunctions(module.ptr(), writeMethods.data()) != 0) {
        throw py::error_already_set();
    }
    module.def("gather_prints", [](const py::object& stream) {
        gatherPrints(stream.ptr(), &writeMethod<TextSource::Output>, &isApart, &takePrinted);
    });
    module.def("flush", &flush);
    module.def("send_all", &sendAll);
    module.def("keep_last_words", &LastWords::keep);
    module.def("formats_values", [] { return !isApart() && output->outputTraits().getNeedsFormattingForDisplay(); });
    module.def("makes_links", [] { return !isApart() && output->outputTraits().getSupportsHotlinks(); });
    module.def("is_apart", &isApart);
    module.attr("interrupt_signal") = Cancellation::signal();
    module.def("on_interrupt_signal", &onInterruptSignal);
    module.def("on_unraisable", &onUnraisable);
    module.def("can_debug", [] { return canUse(Capability::Debugging); });
    module.def("can_show", [] { return canUse(Capability::WebWindow); });
    module.def("can_ask", [] { return canUse(Capability::InteractiveCommandLine); });
    module.def("debug_prompt",
               [](const py::object& stop) { return commandPrompt(InputRequester::mnDEBUG_PROMPT, stop); });
    module.def("keyboard_prompt",
               [](const py::object& stop) { return commandPrompt(InputRequester::mnKEYBOARD_PROMPT, stop); });
    module.def("pause_prompt", &pausePrompt);
    module.def("leave_prompt", &leavePrompt);
    module.def("read_line", &readLine);
    module.def("issue_warning", &issueWarning);
    module.def("set_debugging", &setDebugging);
    module.def("compile_expression", &compileExpression);
    module.def("instances", &instances);
}

void installEngineModule(TextOutput& textOutput, Announcer& engineAnnouncer, EngineServices& engineServices) {
    // The macro above has entered the module into Python's table when the program was loaded.
    output = &textOutput;
    announcer = &engineAnnouncer;
    services = &engineServices;
}

}  // namespace qvm
