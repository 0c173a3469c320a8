// Which output streams a request writes to.
#pragma once

#include <cstdint>

namespace cmddistributor {

/// Numbers are those of the wire. A request received from a peer may hold any 32-bit number.
enum class IqmStreamID : std::int32_t {
    ekIqmNoStreams = -2,    ///< none: the request's text is dropped
    ekIqmAllStreams = -1,   ///< every stream: text that other threads write meanwhile counts as the request's too
    ekIqmCmdWinStream = 0,  ///< the command window: the request's own output and error text
    ekIqmJavaStream = 1000  ///< acts as ekIqmAllStreams
};

}  // namespace cmddistributor
