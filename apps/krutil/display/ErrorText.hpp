// An error as a person reads it.
#pragma once

#include <string>

#include "cmddistributor/RuntimeException.hpp"

namespace krutil_client {

/// The whole error in lines of UTF-8, each ended by a newline. What caused it comes first, then where it arose, a line
/// for each entry of its stack in the order in which the engine listed them, then its identifier and message:
///
///     In "<eval-1>", line 1, in <module>
///     ZeroDivisionError: division by zero
///
///     The error above caused this one:
///
///     In "<eval-1>", line 3, in <module>
///     ValueError: no good
std::string errorText(const cmddistributor::RuntimeException& error);

}  // namespace krutil_client
