// The end of a process that cannot go on.
#pragma once

namespace foundation::core::diag {

/// Reports a fatal internal error and aborts. One line goes to the standard error that the process had when this
/// library was loaded (a private duplicate, so redirections made since do not hide it):
///
///     fatal: MESSAGE (FILE:LINE, FUNCTION)
///
/// A null text prints as "(null)". Allocates nothing and takes no lock, so it works on any thread and in any state.
[[noreturn]] void terminate(const char* message, const char* file, int line, const char* function);

}  // namespace foundation::core::diag
