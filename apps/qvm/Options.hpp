// What the command line of krutil-qvm asks for.
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "common/Recording.hpp"
#include "foundation/msg_svc/transport/layers/session/Limits.hpp"
#include "qvm/process/SessionLimits.hpp"
#include "qvm/python/PythonChoice.hpp"
#include "qvm/requests/RequestQueue.hpp"

namespace CLI {
class App;
}

namespace qvm {

struct Options {
    bool stdio = false;                   ///< one session on descriptors 0 and 1
    std::string listen;                   ///< path of the Unix socket to serve; empty for none
    bool listenFds = false;               ///< the socket that a service manager hands over
    std::vector<std::string> allowUsers;  ///< whose connections are accepted besides those of the engine's own user
    foundation::msg_svc::transport::layers::session::Limits limits;
    RequestQueue::Bounds queue;
    bool noZeroCopy = false;       ///< arrays travel inside their messages; the peers must do the same
    bool noSharedMemory = false;   ///< large arrays travel as bytes, also between processes of one machine
    bool noPrecheck = false;       ///< numbers that end the process are not looked for in what arrives
    std::size_t maxSessions = 64;  ///< sessions at a time of a listening engine
    SessionLimits session = usualSessionLimits();
    std::uint64_t sessionProcesses = 0;  ///< processes and threads of each session of a listening engine; 0: any number
    std::chrono::milliseconds handshakeTimeout{10'000};
    std::optional<std::string> namedPython;  ///< an interpreter, where the command line names one
    PythonConfig python;                     ///< its program is chosen after the command line has been read
    std::string diary;           ///< file that text of sinks with the diary trait is appended to; empty for none
    apps::RecordOptions record;  ///< a listening engine adds the number of a session's process to the file's name
    std::string log;  ///< file of the engine's own messages and of sinks with the logging trait; empty for none
};

/// Reads the command line. Prints help, the version or what is wrong and ends the process (0, or 2 for wrong usage)
/// when there is nothing to run.
Options parseOptions(int argc, const char* const* argv);

/// Shows `describe` the options that parseOptions() knows, for manual pages and completion. They exist until it
/// returns.
void describeCommandLine(const std::function<void(const CLI::App&)>& describe);

}  // namespace qvm
