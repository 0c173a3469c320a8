// A Python exception as the record that a reply carries.
#pragma once

#include <Python.h>

#include <cstddef>

#include "cmddistributor/RuntimeException.hpp"

namespace qvm {

/// Name that the engine's own Python code has in tracebacks; records leave its frames out.
inline constexpr char engineFile[] = "<qvm>";

/// How much one record may hold. A client bounds the size of a message and the depth of its records, so what user code
/// makes up is cut here, where it is known what matters most.
struct RecordBounds {
    std::size_t textBytes = std::size_t{1} << 20;   ///< of one message, as UTF-8
    std::size_t totalBytes = std::size_t{2} << 20;  ///< of everything, as UTF-8
    std::size_t frames = 1000;                      ///< of one stack; the middle is left out
    std::size_t depth = 64;                         ///< levels of causes, the error itself included
    std::size_t records = 1000;                     ///< errors in all
};

/// What is put into words: with the exceptions' own code, or only as far as none is needed.
enum class ErrorWords { ByCode, WithoutCode };

/// A record, and how it came about.
struct ErrorRecord {
    cmddistributor::RuntimeException exception;
    bool interrupted = false;  ///< code that was to give a text was left by a KeyboardInterrupt
};

/// The record of `exception` (an instance of BaseException): its type as identifier, text, stack from the outermost
/// frame to the innermost, and as causes its __cause__, its __context__ unless suppressed, and the members of a group;
/// each exception once, however often it is reached. `status` is that of the error itself; its causes have
/// inEXECUTION_CTRLC for an interrupt and inRUNTIME_ERROR otherwise.
///
/// Runs the exceptions' own __str__ and nothing else of theirs, and not even that once an interrupt has left one.
/// Leaves no Python exception set; throws std::bad_alloc only. The caller holds the interpreter lock.
ErrorRecord errorRecord(PyObject* exception, krutil::cmddistributor::inExecutionStatus status,
                        const RecordBounds& bounds, ErrorWords words = ErrorWords::ByCode);

/// Status of an error that running code raised, by its type.
krutil::cmddistributor::inExecutionStatus statusOf(PyObject* exception) noexcept;

}  // namespace qvm
