// What a client or an engine can do.
#pragma once

#include <cstdint>

namespace capabilities {

/// Numbers are the host's own; the wire's are one higher.
enum class Capability : std::uint64_t {
    InteractiveCommandLine = 0,  ///< a person can be asked for a line of input
    Swing = 1,                   ///< simple windows
    ComplexSwing = 2,            ///< windows of any kind
    LocalClient = 3,             ///< client and engine share a machine
    WebWindow = 4,               ///< pages can be shown
    ModalDialogs = 5,            ///< a dialog can hold up the request that opened it
    Debugging = 6,               ///< a debugger prompt can be shown
};

}  // namespace capabilities
