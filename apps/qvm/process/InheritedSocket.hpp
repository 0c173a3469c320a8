// A socket from the service manager that has started this process.
#pragma once

namespace qvm {

/// The socket, which is the caller's from now on.
struct InheritedSocket {
    int descriptor;
    bool listens;  ///< else it is a connection
};

/// Takes the one socket that LISTEN_FDS announces to this process: descriptor 3, which is moved to a private number.
/// The variables are removed, so that nobody else takes it for theirs. Call once, before there are threads. Throws
/// std::runtime_error with a sentence when there is none, or one that no session can use.
InheritedSocket takeInheritedSocket();

}  // namespace qvm
