#include "qvm/python/ErrorRecord.hpp"

#include <pybind11/pybind11.h>

#include <frameobject.h>

#include <algorithm>
#include <string>
#include <unordered_set>
#include <utility>
#include <vector>

#include "msg_svc/protobuf/ustring.hpp"
#include "qvm/python/PythonText.hpp"

namespace qvm {
namespace {

namespace py = pybind11;

using cmddistributor::RuntimeException;
using cmddistributor::StackFrame;
using krutil::cmddistributor::inExecutionStatus;

// Bytes that a record or a frame costs besides its texts.
constexpr std::size_t recordBytes = 32;
constexpr std::size_t nameBytes = 1024;

// Takes over what a function of Python's C interface returned, which can be nothing.
py::object ownedOrNull(PyObject* object) {
    return py::reinterpret_steal<py::object>(object);
}

// Bytes of a code point in UTF-8; a surrogate counts as the U+FFFD that replaces it.
std::size_t utf8Length(Py_UCS4 point) noexcept {
    return point < 0x80 ? 1U : point < 0x800 ? 2U : point < 0x10000 ? 3U : 4U;
}

// Builds one record and its causes. The members are what all levels share.
class Builder {
  public:
    Builder(const RecordBounds& bounds, ErrorWords words) : bounds_(bounds), left_(bounds.totalBytes), words_(words) {}

    bool interrupted() const noexcept { return interrupted_; }

    RuntimeException build(PyObject* exception, inExecutionStatus status, std::size_t depth) {
        seen_.insert(exception);
        take(recordBytes);
        std::string name = typeName(exception);
        std::u16string text = message(exception, name);
        Stack frames = stack(exception);
        std::vector<RuntimeException> causes;
        if (depth < bounds_.depth) {
            for (const py::object& cause : causesOf(exception)) {
                if (left_ < recordBytes || seen_.size() >= bounds_.records) {
                    break;
                }
                if (seen_.count(cause.ptr()) == 0) {
                    causes.push_back(build(cause.ptr(), statusOf(cause.ptr()), depth + 1));
                }
            }
            causes.shrink_to_fit();
        }
        return {status,
                std::move(text),
                std::move(name),
                std::move(frames.innermostFunction),
                std::move(frames.entries),
                std::move(causes),
                false};
    }

  private:
    struct Stack {
        std::vector<StackFrame> entries;  // with a note where frames are left out
        std::string innermostFunction;    // empty when that frame is among those
    };

    std::size_t take(std::size_t bytes) noexcept {
        const std::size_t taken = std::min(bytes, left_);
        left_ -= taken;
        return taken;
    }

    // The text's beginning, as far as the bounds allow, and a note of what is missing.
    std::u16string bounded(PyObject* text, std::size_t limit) {
        const auto length = static_cast<std::size_t>(PyUnicode_GET_LENGTH(text));
        limit = std::min(limit, left_);
        std::size_t bytes = 0;
        std::size_t count = 0;
        for (; count < length; ++count) {
            const std::size_t next = utf8Length(PyUnicode_READ_CHAR(text, static_cast<Py_ssize_t>(count)));
            if (bytes + next > limit) {
                break;
            }
            bytes += next;
        }
        take(bytes);
        std::u16string units;
        appendUtf16(text, 0, count, units);
        if (count < length) {
            const std::string note = "... (" + std::to_string(length - count) + " more characters)";
            take(note.size());
            units.append(note.begin(), note.end());
        }
        return units;
    }

    // For the host's 8-bit fields: always valid UTF-8, because a peer stops reading a message at bytes that are not.
    std::string boundedUtf8(PyObject* text, std::size_t limit) {
        return msg_svc::protobuf::ustring_to_utf8(bounded(text, limit));
    }

    // Reads the type itself: a metaclass may answer for __module__ and __qualname__ with anything, or raise.
    std::string typeName(PyObject* exception) {
        PyTypeObject* const type = Py_TYPE(exception);
        const py::object name = ownedOrNull(PyType_GetQualName(type));
        if (!name || !PyUnicode_Check(name.ptr())) {
            PyErr_Clear();
            return "BaseException";
        }
        std::string prefix;
        if ((type->tp_flags & Py_TPFLAGS_HEAPTYPE) != 0) {
            PyObject* const module = PyDict_GetItemString(type->tp_dict, "__module__");
            if (module != nullptr && PyUnicode_Check(module) &&
                PyUnicode_CompareWithASCIIString(module, "builtins") != 0) {
                prefix = boundedUtf8(module, nameBytes) + ".";
            }
            return prefix + boundedUtf8(name.ptr(), nameBytes);
        }
        // The name of a type written in C is dotted already, without the builtin ones' module.
        const py::object dotted = ownedOrNull(PyUnicode_FromString(type->tp_name));
        if (!dotted) {
            PyErr_Clear();
            return boundedUtf8(name.ptr(), nameBytes);
        }
        return boundedUtf8(dotted.ptr(), nameBytes);
    }

    // The text where it is what the exception was made with; null where only code can tell.
    static py::object plainText(PyObject* exception) {
        PyObject* const arguments = reinterpret_cast<PyBaseExceptionObject*>(exception)->args;
        if (Py_TYPE(exception)->tp_str != reinterpret_cast<PyTypeObject*>(PyExc_BaseException)->tp_str ||
            PyTuple_GET_SIZE(arguments) > 1) {
            return {};
        }
        if (PyTuple_GET_SIZE(arguments) == 0) {
            return py::str();
        }
        PyObject* const text = PyTuple_GET_ITEM(arguments, 0);
        return PyUnicode_CheckExact(text) ? py::reinterpret_borrow<py::object>(text) : py::object();
    }

    std::u16string message(PyObject* exception, const std::string& name) {
        const py::object text =
            words_ == ErrorWords::ByCode ? ownedOrNull(PyObject_Str(exception)) : plainText(exception);
        if (!text) {
            if (words_ == ErrorWords::ByCode && PyErr_ExceptionMatches(PyExc_KeyboardInterrupt) != 0) {
                interrupted_ = true;
                words_ = ErrorWords::WithoutCode;
            }
            PyErr_Clear();
            const std::string unprintable = "<unprintable " + name + " object>";
            take(unprintable.size());
            return msg_svc::protobuf::utf8_to_ustring(unprintable);
        }
        return bounded(text.ptr(), bounds_.textBytes);
    }

    Stack stack(PyObject* exception) {
        std::vector<PyTracebackObject*> entries;
        const py::object first = ownedOrNull(PyException_GetTraceback(exception));
        for (auto* entry = reinterpret_cast<PyTracebackObject*>(first.ptr()); entry != nullptr;
             entry = entry->tb_next) {
            const py::object code = ownedOrNull(reinterpret_cast<PyObject*>(PyFrame_GetCode(entry->tb_frame)));
            PyObject* const file = reinterpret_cast<PyCodeObject*>(code.ptr())->co_filename;
            if (PyUnicode_CompareWithASCIIString(file, engineFile) != 0) {
                entries.push_back(entry);
            }
        }
        std::vector<StackFrame> frames;
        const std::size_t kept = std::min(entries.size(), bounds_.frames);
        frames.reserve(kept + 1);
        const std::size_t head = kept == entries.size() ? kept : kept / 2;
        // The innermost frames tell most, so they are the first to be given room.
        std::vector<StackFrame> tail;
        for (std::size_t i = 0; i < kept - head && left_ >= recordBytes; ++i) {
            tail.push_back(frame(entries[entries.size() - 1 - i]));
        }
        for (std::size_t i = 0; i < head && left_ >= recordBytes; ++i) {
            frames.push_back(frame(entries[i]));
        }
        const std::size_t missing = entries.size() - frames.size() - tail.size();
        std::string function;
        if (!tail.empty()) {
            function = tail.front().func;
        } else if (missing == 0 && !frames.empty()) {
            function = frames.back().func;
        }
        if (missing > 0) {
            frames.push_back({u"", "(" + std::to_string(missing) + " frames left out)", 0});
        }
        std::move(tail.rbegin(), tail.rend(), std::back_inserter(frames));
        return {std::move(frames), std::move(function)};
    }

    StackFrame frame(PyTracebackObject* entry) {
        take(recordBytes);
        const py::object object = ownedOrNull(reinterpret_cast<PyObject*>(PyFrame_GetCode(entry->tb_frame)));
        auto* const code = reinterpret_cast<PyCodeObject*>(object.ptr());
        // The traceback's own line number is filled in only when it is first asked for.
        const int line = PyCode_Addr2Line(code, entry->tb_lasti);
        return {bounded(code->co_filename, nameBytes), boundedUtf8(code->co_name, nameBytes),
                static_cast<double>(std::max(line, 0))};
    }

    static std::vector<py::object> causesOf(PyObject* exception) {
        std::vector<py::object> causes;
        if (py::object cause = ownedOrNull(PyException_GetCause(exception))) {
            causes.push_back(std::move(cause));
        }
        if (reinterpret_cast<PyBaseExceptionObject*>(exception)->suppress_context == 0) {
            if (py::object context = ownedOrNull(PyException_GetContext(exception))) {
                causes.push_back(std::move(context));
            }
        }
        if (PyObject_TypeCheck(exception, reinterpret_cast<PyTypeObject*>(PyExc_BaseExceptionGroup)) != 0) {
            PyObject* const members = reinterpret_cast<PyBaseExceptionGroupObject*>(exception)->excs;
            for (Py_ssize_t i = 0; members != nullptr && i < PyTuple_GET_SIZE(members); ++i) {
                causes.push_back(py::reinterpret_borrow<py::object>(PyTuple_GET_ITEM(members, i)));
            }
        }
        return causes;
    }

    const RecordBounds bounds_;
    std::size_t left_;
    std::unordered_set<PyObject*> seen_;
    ErrorWords words_;
    bool interrupted_ = false;
};

}  // namespace

ErrorRecord errorRecord(PyObject* exception, inExecutionStatus status, const RecordBounds& bounds, ErrorWords words) {
    Builder builder(bounds, words);
    RuntimeException record = builder.build(exception, status, 1);
    return {std::move(record), builder.interrupted()};
}

inExecutionStatus statusOf(PyObject* exception) noexcept {
    auto* const interrupt = reinterpret_cast<PyTypeObject*>(PyExc_KeyboardInterrupt);
    return PyObject_TypeCheck(exception, interrupt) != 0 ? krutil::cmddistributor::inEXECUTION_CTRLC
                                                         : krutil::cmddistributor::inRUNTIME_ERROR;
}

}  // namespace qvm
