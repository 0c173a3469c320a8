// How the execution of a request ended.
#pragma once

#include <cstdint>

namespace krutil::cmddistributor {

/// Numbers are those of the wire.
enum inExecutionStatus : std::int32_t {
    inEXECUTION_SUCCESS = 0,
    inCOMPILE_ERROR = 1,     ///< the code text is no code
    inRUNTIME_ERROR = 2,     ///< the code raised an error
    inEXECUTION_DBQUIT = 3,  ///< the debugger was left with quit
    inEXECUTION_CTRLC = 4,   ///< cancelled
    inCOMM_ERROR = 5,        ///< the request or its result could not be carried
};

}  // namespace krutil::cmddistributor
