// A Python exception as the record that a reply carries.
#pragma once

#include <Python.h>

#include <cstddef>

#include "cmddistributor/RuntimeException.hpp"

namespace qvm {

/// Name that the engine's own Python code has in tracebacks; records leave its frames out.
inline constexpr char kEngineFile[] = "<qvm>";

/// How much one record may hold. A client bounds the size of a message and the depth of its records, so what user code
/// makes up is cut here, where it is known what matters most.
struct RecordBounds {
    std::size_t textBytes = std::size_t{1} << 20;   ///< of one message, as UTF-8
    std::size_t totalBytes = std::size_t{2} << 20;  ///< of everything, as UTF-8
    std::size_t frames = 1000;                      ///< of one stack; the middle is left out
    std::size_t depth = 64;                         ///< levels of causes, the error itself included
    std::size_t records = 1000;                     ///< errors in all
};

/// The record of `exception` (an instance of BaseException): its type as identifier, text, stack from the outermost
/// frame to the innermost, and as causes its __cause__, its __context__ unless suppressed, and the members of a group;
/// each exception once, however often it is reached. `status` is that of the error itself; its causes have
/// inEXECUTION_CTRLC for an interrupt and inRUNTIME_ERROR otherwise.
///
/// Runs the exceptions' own __str__ and nothing else of theirs, and not even that once `interrupted` is set, which a
/// KeyboardInterrupt does that leaves one: then only texts that need no code are there. Leaves no Python exception set;
/// throws std::bad_alloc only. The caller holds the interpreter lock.
cmddistributor::RuntimeException errorRecord(PyObject* exception, krutil::cmddistributor::inExecutionStatus status,
                                             const RecordBounds& bounds, bool& interrupted);

/// Status of an error that running code raised, by its type.
krutil::cmddistributor::inExecutionStatus statusOf(PyObject* exception) noexcept;

}  // namespace qvm
