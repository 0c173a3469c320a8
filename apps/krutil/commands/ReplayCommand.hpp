// `krutil replay`.
#pragma once

#include "krutil/base/ExitCode.hpp"
#include "krutil/base/Interrupt.hpp"
#include "krutil/base/Options.hpp"
#include "krutil/base/Output.hpp"

namespace krutil_client {

/// Says what the client of a recording has said, each session to an engine of its own, and shows where the engine
/// answers otherwise. Returns ExitCode::CodeError when it does. Throws Failure, and Cancelled on Ctrl-C.
ExitCode replayRecording(const ConnectionOptions& connection, const ReplayOptions& options, Output& out,
                         Interrupt& interrupt);

/// Says what the engine of a recording has said, to a client at standard input and output, and shows on `err` where the
/// client says something else. Returns ExitCode::CodeError when it does, and ExitCode::Stream when it has gone before
/// the end. Throws Failure, and Cancelled on Ctrl-C.
ExitCode serveRecording(const ConnectionOptions& connection, const ReplayOptions& options, Output& err,
                        Interrupt& interrupt);

}  // namespace krutil_client
