#include "qvm/Options.hpp"

#include <CLI/CLI.hpp>
#include <cstdint>
#include <cstdlib>
#include <limits>

#include "common/Build.hpp"
#include "common/HelpFormatter.hpp"
#include "common/LimitOptions.hpp"
#include "common/RecordOptions.hpp"
#include "qvm/process/SessionGroups.hpp"
#include "qvm/process/StandardDescriptors.hpp"

namespace qvm {
namespace {

constexpr int usageError = 2;

// All options, and what parsing fills in.
struct OptionTable {
    OptionTable();

    Options options;
    double timeoutSeconds = std::chrono::duration<double>(options.handshakeTimeout).count();
    CLI::App app{
        "The krutil engine: runs Python code that clients send over the krutil protocol.\n"
        "\n"
        "An engine runs whatever its clients send, with the rights of the user who started it. It serves\n"
        "one client on its standard input and output (--stdio), or any number of clients of the same user\n"
        "on a Unix socket (--listen, --listen-fds), each in a process of its own.",
        "krutil-qvm"};
};

OptionTable::OptionTable() {
    app.formatter(std::make_shared<apps::HelpFormatter>());
    app.set_version_flag("--version", apps::buildString("krutil-qvm"));

    const std::string where = "Where to serve (one of these)";
    app.add_flag("--stdio", options.stdio, "One session on standard input and output, then end")->group(where);
    app.add_option("--listen", options.listen,
                   "Unix socket to serve; its directory is created, or must be private to this user (0700)")
        ->type_name("PATH")
        ->group(where);
    app.add_flag("--listen-fds", options.listenFds,
                 "The Unix socket that a service manager such as systemd hands over: one that listens, or a connection")
        ->group(where);

    const std::string sessions = "Sessions";
    app.add_option("--max-sessions", options.maxSessions, "Sessions at a time of a listening engine")
        ->check(CLI::Range(1, 10'000))
        ->type_name("COUNT")
        ->capture_default_str()
        ->group(sessions);
    app.add_option(
           "--allow-user", options.allowUsers,
           "Accept connections of this user as well, such as a proxy's; with --listen or --listen-fds, once for "
           "each. Whoever it lets through has code run as the engine's user")
        ->type_name("NAME")
        ->allow_extra_args(false)
        ->group(sessions);
    app.add_option("--handshake-timeout", timeoutSeconds, "Seconds that a client has to say what it speaks")
        ->check(CLI::Range(0.001, 3600.0))
        ->type_name("SECONDS")
        ->capture_default_str()
        ->group(sessions);
    app.add_option("--max-queued", options.queue.count, "Requests that may wait; one more is refused with a reply")
        ->check(CLI::Range(1, 1'000'000))
        ->type_name("COUNT")
        ->capture_default_str()
        ->group(sessions);
    apps::addSizeOption(app, "--max-queued-bytes", options.queue.bytes,
                        "Memory that waiting requests may hold, such as 64MiB")
        ->group(sessions);

    apps::addSizeOption(
        app, "--limit-memory", options.session.memory,
        "Memory that the process of a session may have, such as 8GiB; more is a MemoryError of its code. Without this "
        "option it is what the machine has",
        std::numeric_limits<std::uint64_t>::max(), smallestMemoryLimit)
        ->default_str("")
        ->group(sessions);
    app.add_option("--limit-descriptors", options.session.descriptors,
                   "Descriptors that the process of a session may have at a time")
        ->check(CLI::Range(neededDescriptors, 1'000'000'000))
        ->type_name("COUNT")
        ->capture_default_str()
        ->group(sessions);
    app.add_option("--limit-processes", options.sessionProcesses,
                   "Processes and threads that a session may have at a time; with --listen or --listen-fds, where a "
                   "control group is delegated to the engine. Without this option they are not bounded")
        ->check(CLI::Range(smallestProcessLimit, largestProcessLimit))
        ->type_name("COUNT")
        ->group(sessions);

    app.add_flag("--no-zero-copy", options.noZeroCopy,
                 "Copy arrays into their messages, as QX_DISABLE_ZEROCOPY=1 does; clients must do the same")
        ->group(sessions);
    app.add_flag("--no-shared-memory", options.noSharedMemory,
                 "Send large arrays as bytes, also to a client of this machine that could read them where they are")
        ->group(sessions);
    app.add_flag("--no-precheck", options.noPrecheck,
                 "Let numbers that the protocol has no meaning for end the process, instead of closing the session")
        ->group(sessions);

    const std::string python = "Python";
    app.add_option(
           "--python", options.namedPython,
           "Interpreter whose packages code finds, also with --isolated; otherwise bin/python3 of VIRTUAL_ENV, or "
           "the system's")
        ->type_name("FILE")
        ->group(python);
    app.add_flag("--isolated", options.python.isolated,
                 "Neither environment variables (PYTHONPATH, VIRTUAL_ENV, ...) nor packages of the user count")
        ->group(python);

    const std::string files = "Files";
    app.add_option("--diary", options.diary, "Append what is shown to sinks with the diary trait to this file")
        ->type_name("FILE")
        ->group(files);
    app.add_option("--log", options.log,
                   "Append the engine's own messages, and the text of sinks with the logging trait, to this file")
        ->type_name("FILE")
        ->group(files);

    apps::addRecordOptions(app, options.record, files,
                           "Record the session in this file, which is emptied first, for Wireshark and other readers "
                           "of pcapng; with --listen each session in FILE.PID, PID being its process");

    apps::addLimitOptions(app, options.limits);

    app.footer(
        "Exit codes:\n"
        "  0  the session ended as agreed\n"
        "  2  wrong usage\n"
        "  3  cannot serve, the client was lost, or a diary, a log or a recording is not complete\n"
        "  4  the client broke the protocol\n"
        "  5  version or feature refused, or the client is of a user that is not admitted");
}

}  // namespace

void describeCommandLine(const std::function<void(const CLI::App&)>& describe) {
    describe(OptionTable().app);
}

Options parseOptions(int argc, const char* const* argv) {
    OptionTable table;
    Options& options = table.options;
    try {
        table.app.parse(argc, argv);
        if (int{options.stdio} + int{!options.listen.empty()} + int{options.listenFds} != 1) {
            throw CLI::ValidationError("Exactly one of --stdio, --listen and --listen-fds is required");
        }
        if (options.stdio && !options.allowUsers.empty()) {
            throw CLI::ValidationError("--allow-user goes with --listen or --listen-fds");
        }
        if (options.stdio && options.sessionProcesses > 0) {
            throw CLI::ValidationError("--limit-processes goes with --listen or --listen-fds");
        }
    } catch (const CLI::ParseError& error) {
        const int status = table.app.exit(error);
        std::exit(status == 0 ? EXIT_SUCCESS : usageError);
    }
    options.handshakeTimeout = std::chrono::milliseconds(static_cast<long>(table.timeoutSeconds * 1000.0));
    return options;
}

}  // namespace qvm
