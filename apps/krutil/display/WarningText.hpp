// A warning as a person reads it.
#pragma once

#include <string>

#include "korvel/lang/diagnostic/Warning.hpp"

namespace krutil_client {

/// "Warning: MESSAGE (IDENTIFIER)" in UTF-8, ended by a newline; with `stack`, after it a line for each entry of its
/// stack, in the order in which the engine listed them:
///
///     Warning: no good (UserWarning)
///       In "<eval-1>", line 3, in <module>
std::string warningText(const korvel::lang::diagnostic::Warning& warning, bool stack);

}  // namespace krutil_client
