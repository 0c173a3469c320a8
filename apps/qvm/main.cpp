// krutil-qvm: the engine. See --help.
#include <signal.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <exception>
#include <stdexcept>
#include <string>

#include "KrutilProtocol.hpp"
#include "common/ProtobufLog.hpp"
#include "qvm/Engine.hpp"
#include "qvm/Listener.hpp"
#include "qvm/Options.hpp"
#include "qvm/process/AdmittedUsers.hpp"
#include "qvm/process/InheritedSocket.hpp"
#include "qvm/process/Log.hpp"
#include "qvm/process/StandardDescriptors.hpp"
#include "qvm/python/PythonChoice.hpp"

namespace {

using qvm::ExitCode;

// Whoever has accepted it has not asked who is there.
ExitCode serveConnection(int connection, const qvm::Options& options, qvm::Log& log) {
    if (const std::string refusal = qvm::AdmittedUsers(options.allowUsers).refusal(connection); !refusal.empty()) {
        log.say("refused a client" + refusal);
        ::close(connection);
        return ExitCode::Refused;
    }
    qvm::Engine engine(options, log);
    return engine.run(connection, connection);
}

ExitCode serve(const qvm::Options& options, qvm::Log& log) {
    if (options.stdio) {
        const qvm::ProtocolDescriptors protocol = qvm::moveProtocolAside();
        qvm::Engine engine(options, log);
        return engine.run(protocol.in, protocol.out);
    }
    if (options.listenFds) {
        const qvm::InheritedSocket socket = qvm::takeInheritedSocket();
        qvm::giveToRunningCode();
        if (!socket.listens && options.sessionProcesses > 0) {
            throw std::runtime_error(
                "--limit-processes goes with a socket that listens, and a connection was handed over. Let the service "
                "manager bound this process, for example with TasksMax=.");
        }
        if (!socket.listens) {
            return serveConnection(socket.descriptor, options, log);
        }
        qvm::Listener listener(options, log, socket.descriptor);
        return listener.run();
    }
    qvm::giveToRunningCode();
    qvm::Listener listener(options, log);
    return listener.run();
}

// Running code may have left threads behind, which must not meet the destructors of this process. A leak checker looks
// before, when Python has been finalised.
[[noreturn]] void leave(ExitCode code) {
    ::_exit(static_cast<int>(code));
}

// What the log lacks is in the exit code, where nothing else has gone wrong.
[[noreturn]] void leave(ExitCode code, qvm::Log& log) {
    const bool complete = log.finish();
    leave(code == ExitCode::Ok && !complete ? ExitCode::Lost : code);
}

}  // namespace

#if defined(KRUTIL_SANITIZED)
// The sanitizers' run-time library looks these up by name.
#define SANITIZER_HOOK extern "C" __attribute__((visibility("default"), used))

// A failed allocation is Python's MemoryError, as without a sanitizer.
SANITIZER_HOOK const char* __asan_default_options() {
    return "allocator_may_return_null=1";
}

// The engine looks itself, when Python has been finalised. Forked children of running code end without that.
SANITIZER_HOOK const char* __lsan_default_options() {
    return "leak_check_at_exit=0";
}

// Memory that Python, NumPy and the bridge to them keep until the process ends.
SANITIZER_HOOK const char* __lsan_default_suppressions() {
    return "leak:libpython3\nleak:_multiarray_umath\nleak:numpy\nleak:pybind11::detail::get_local_internals\n";
}
#endif

int main(int argc, char** argv) {
    qvm::Options options = qvm::parseOptions(argc, argv);
    try {
        qvm::checkDescriptorLimit();
        qvm::holdStandardDescriptors();
        ::signal(SIGPIPE, SIG_IGN);
        // A file that must not grow any more is an error of a write.
        ::signal(SIGXFSZ, SIG_IGN);
        // Whoever ignores this one has the program begin so, and code would not see how processes that it starts end.
        ::signal(SIGCHLD, SIG_DFL);
        qvm::Log log(options.log);
        apps::installProtobufLog();
        if (options.noZeroCopy) {
            // Read once in the life of a process, when its first session shakes hands.
            ::setenv("QX_DISABLE_ZEROCOPY", "1", 1);
        }
        const char* const environment = options.python.isolated ? nullptr : std::getenv("VIRTUAL_ENV");
        options.python.program = qvm::choosePython(options.namedPython, environment != nullptr ? environment : "");
        krutil::protobuf::KrutilProtocol::init();
        leave(serve(options, log), log);
    } catch (const std::exception& error) {
        std::fprintf(stderr, "krutil-qvm: %s\n", error.what());
        leave(ExitCode::Lost);
    }
}
