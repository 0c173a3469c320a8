// krutil-qvm: the engine. See --help.
#include <signal.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <exception>

#include "KrutilProtocol.hpp"
#include "common/ProtobufLog.hpp"
#include "qvm/Engine.hpp"
#include "qvm/Listener.hpp"
#include "qvm/Log.hpp"
#include "qvm/Options.hpp"
#include "qvm/StandardDescriptors.hpp"

namespace {

using qvm::ExitCode;

ExitCode serve(const qvm::Options& options, qvm::Log& log) {
    if (options.stdio) {
        const qvm::ProtocolDescriptors protocol = qvm::moveProtocolAside();
        qvm::Engine engine(options, log);
        return engine.run(protocol.in, protocol.out);
    }
    qvm::giveToRunningCode();
    qvm::Listener listener(options, log);
    return listener.run();
}

// Running code may have left threads behind, which must not meet the destructors of this process.
[[noreturn]] void leave(ExitCode code) {
#if defined(KRUTIL_SANITIZED)
    std::exit(static_cast<int>(code));
#else
    ::_exit(static_cast<int>(code));
#endif
}

}  // namespace

#if defined(KRUTIL_SANITIZED)
// Memory that Python and NumPy keep until the process ends.
extern "C" const char* __lsan_default_suppressions() {
    return "leak:libpython3\nleak:_multiarray_umath\nleak:numpy\n";
}
#endif

int main(int argc, char** argv) {
    const qvm::Options options = qvm::parseOptions(argc, argv);
    try {
        qvm::holdStandardDescriptors();
        ::signal(SIGPIPE, SIG_IGN);
        qvm::Log log(options.log);
        apps::installProtobufLog();
        if (options.noZeroCopy) {
            // Read once in the life of a process, when its first session shakes hands.
            ::setenv("QX_DISABLE_ZEROCOPY", "1", 1);
        }
        krutil::protobuf::KrutilProtocol::init();
        leave(serve(options, log));
    } catch (const std::exception& error) {
        std::fprintf(stderr, "krutil-qvm: %s\n", error.what());
        leave(ExitCode::Lost);
    }
}
