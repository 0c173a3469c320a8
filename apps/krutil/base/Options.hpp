// What the program is asked to do, in structures: filled by the command line, read by everything else.
#pragma once

#include <chrono>
#include <cstddef>
#include <limits>
#include <optional>
#include <string>
#include <variant>
#include <vector>

#include "cmddistributor/CodeType.hpp"
#include "common/Recording.hpp"
#include "foundation/msg_svc/transport/layers/session/Limits.hpp"

namespace krutil_client {

/// Which engine, and what is agreed with it.
struct ConnectionOptions {
    std::optional<std::string> engine;  ///< a shell command; empty for the engine that comes with this program
    std::optional<std::string> socket;  ///< where to connect instead of starting one: a Unix socket, tls://HOST:PORT
    std::string certificate;            ///< for TLS, a PEM file each; empty for those not given
    std::string key;
    std::string authorities;
    std::chrono::milliseconds handshakeTimeout{10'000};
    std::chrono::milliseconds keepAlive{0};  ///< how often an engine elsewhere gets a sign of life; 0 for never
    bool noPrecheck = false;      ///< a number that the protocol does not know ends this program, not just the session
    bool noZeroCopy = false;      ///< elements of arrays travel inside their messages
    bool noSharedMemory = false;  ///< those of large arrays as bytes, also to an engine on this machine
    foundation::msg_svc::transport::layers::session::Limits limits;
};

/// Whether errors, warnings and code that is typed are coloured.
enum class Color { Auto, Always, Never };

/// What is shown, and how.
struct DisplayOptions {
    bool json = false;
    bool trace = false;                    ///< each frame goes to standard error
    std::optional<std::string> traceFile;  ///< each frame goes to this file
    apps::RecordOptions record;
    bool timing = false;
    bool warningStack = false;  ///< warnings tell where they were issued
    bool safeText = false;      ///< characters of programs that steer a terminal are shown as escapes
    Color color = Color::Auto;
};

/// What a request asks of the place that shows its text.
struct SinkOptions {
    bool hotlinks = false;
    bool echo = false;
    bool diary = false;
    bool log = false;
};

/// `krutil eval`, and `krutil run`, which is a script from a file with arguments.
struct EvalOptions {
    std::string source;     ///< the code, or the file that holds it
    bool fromFile = false;  ///< `source` names a file
    bool fromStandardInput = false;
    /// What the code finds in sys.argv after its name; without, sys.argv stays as it is.
    std::optional<std::vector<std::string>> arguments;
    cmddistributor::CodeType type = cmddistributor::CodeType::CodeBlockType;
    bool sparingly = false;
    SinkOptions sink;
};

/// `krutil call`.
struct CallOptions {
    std::string function;                ///< dotted name
    std::vector<std::string> arguments;  ///< literals and files, as they were typed
    std::size_t outputs = 1;             ///< that are wanted
    std::vector<std::string> files;      ///< for the first outputs, in order
    bool sparingly = false;
    SinkOptions sink;
};

/// `krutil repl`.
struct ReplOptions {
    bool noHistory = false;  ///< lines are not kept for later sessions
    SinkOptions sink;
};

/// `krutil replay`.
struct ReplayOptions {
    std::string file;
    bool serve = false;                          ///< the engine's side, to a client, instead of the client's
    std::chrono::milliseconds patience{10'000};  ///< an answer may take that much longer than in the recording
};

/// `krutil inspect`.
struct InspectOptions {
    using Role = foundation::msg_svc::transport::layers::session::Role;

    std::string file;       ///< "-" for standard input
    bool frames = false;    ///< a line for each frame
    bool fields = false;    ///< with its fields
    bool hex = false;       ///< with its bytes
    bool timeline = false;  ///< requests instead of messages
    bool lint = false;      ///< broken rules instead of messages
    bool json = false;
    std::optional<std::string> html;  ///< the page that is written instead; "-" for standard output
    std::string redacted;             ///< the copy without text and numbers that is written instead; empty for none
    std::string request;              ///< the identifier of the only one, or its first digits
    std::vector<std::string> types;   ///< the only ones; empty for all
    std::optional<Role> from;         ///< the only sender
    double since = 0;                 ///< seconds after the first packet
    double until = std::numeric_limits<double>::infinity();
};

struct Options {
    ConnectionOptions connection;
    DisplayOptions display;
    std::variant<EvalOptions, CallOptions, ReplOptions, ReplayOptions, InspectOptions> command;
};

}  // namespace krutil_client
