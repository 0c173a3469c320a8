// `krutil call`.
#pragma once

#include <string>
#include <vector>

#include "foundation/korveldata/Array.hpp"
#include "krutil/arrays/NpyFile.hpp"
#include "krutil/base/Output.hpp"
#include "krutil/commands/CommandLine.hpp"
#include "krutil/session/Client.hpp"

namespace krutil_client {

/// A call with all that it takes from the command line, so that no engine is started for one that cannot be made.
struct PreparedCall {
    std::vector<foundation::korveldata::Array> arguments;
    std::vector<NpyOutput> files;  ///< for the first outputs, in order
};

/// Reads the arguments: literals, and .npy files for those that end in .npy or begin with @. Creates the files for the
/// outputs. Throws Failure (Usage), which points at the place in a literal.
PreparedCall prepareCall(const CallOptions& options);

/// Has the function called and shows what comes of it, the outputs or the files that they went to, through the client's
/// `printer`. While large arrays
/// are on their way, `err` shows how far they are if it is a terminal. Throws what Client::request() and
/// NpyOutput::write() throw.
ExitCode callFunction(Client& client, const CallOptions& options, PreparedCall call, Printer& printer, Output& err);

}  // namespace krutil_client
