#include "qvm/process/InheritedSocket.hpp"

#include <fcntl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <stdexcept>
#include <string>
#include <system_error>

#include "qvm/process/StandardDescriptors.hpp"

namespace qvm {
namespace {

constexpr int firstInherited = 3;

std::string variable(const char* name) {
    const char* const value = std::getenv(name);
    return value != nullptr ? value : "";
}

int socketOption(int socket, int name) {
    int value = 0;
    socklen_t size = sizeof(value);
    return ::getsockopt(socket, SOL_SOCKET, name, &value, &size) == 0 ? value : -1;
}

}  // namespace

InheritedSocket takeInheritedSocket() {
    const std::string process = variable("LISTEN_PID");
    const std::string count = variable("LISTEN_FDS");
    if (count != "1" || process != std::to_string(::getpid())) {
        throw std::runtime_error("--listen-fds: expected one socket from a service manager (LISTEN_FDS=1, LISTEN_PID=" +
                                 std::to_string(::getpid()) + "), got LISTEN_FDS=" + count + ", LISTEN_PID=" + process +
                                 "; start the engine by a socket unit, or use --listen PATH.");
    }
    for (const char* const name : {"LISTEN_PID", "LISTEN_FDS", "LISTEN_FDNAMES"}) {
        ::unsetenv(name);
    }
    if (socketOption(firstInherited, SO_DOMAIN) != AF_UNIX || socketOption(firstInherited, SO_TYPE) != SOCK_STREAM) {
        throw std::runtime_error(
            "--listen-fds: expected a Unix socket of the type SOCK_STREAM, got another descriptor; an engine is not "
            "served unencrypted over a network.");
    }
    const int moved = ::fcntl(firstInherited, F_DUPFD_CLOEXEC, firstPrivateDescriptor);
    if (moved < 0) {
        throw std::system_error(errno, std::generic_category(), "Cannot move the inherited socket aside");
    }
    ::close(firstInherited);
    return {moved, socketOption(moved, SO_ACCEPTCONN) == 1};
}

}  // namespace qvm
