// krutil inspect: what is in a recording.
#pragma once

#include "krutil/base/ExitCode.hpp"
#include "krutil/base/Options.hpp"

namespace krutil_client {

class Interrupt;
class Output;

/// Shows the messages of a recording on `out` as they are read, or checks them; `err` gets what is to be said of the
/// file itself. Returns Violation when a rule is broken. Throws Failure (Usage) for a file that cannot be read.
ExitCode inspectRecording(const InspectOptions& options, Output& out, Output& err, Interrupt& interrupt);

}  // namespace krutil_client
