// The program as a whole.
#pragma once

namespace krutil_client {

/// Runs the program for a command line and returns its exit code. A reader of standard output that has gone ends the
/// process as SIGPIPE does.
int runProgram(int argc, const char* const* argv);

}  // namespace krutil_client
