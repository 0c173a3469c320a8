// Python's start in this process, and forks of a process in which it has started.
#pragma once

#include <sys/types.h>

#include "qvm/python/PythonChoice.hpp"

namespace qvm {

/// Starts Python as `world` says and loads the engine's own module, unless this process or the one that it was forked
/// from has done so. The calling thread becomes Python's main thread and holds the interpreter lock. Throws
/// std::runtime_error with Python's reason.
void startPython(const PythonConfig& world);

/// For a process that is forked for each session: startPython(), and what else would cost each session time or memory.
/// Throws as startPython() does.
void preparePython(const PythonConfig& world);

/// fork(2) for the thread that prepared Python, while it is the only one. Python of the new process is one of its own:
/// what differs from process to process, such as seeds of random numbers, is renewed. Its hash seed and its modules are
/// those of this process.
pid_t forkPrepared() noexcept;

}  // namespace qvm
