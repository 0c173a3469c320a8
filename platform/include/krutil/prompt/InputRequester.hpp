// The prompts at which an engine asks for input.
#pragma once

#include <cstdint>

namespace krutil::prompt {

/// Numbers are those of the wire.
enum class InputRequester : std::int32_t {
    mnNO_PROMPT = -1,
    mnBASE_PROMPT = 0,
    mnDEBUG_PROMPT = 1,     ///< a debugger stopped the request
    mnINPUT_PROMPT = 2,     ///< the request reads a line
    mnKEYBOARD_PROMPT = 3,  ///< the request hands the keyboard over
    mnPAUSE_PROMPT = 4,     ///< the request waits to be told to go on
    mnBANG_PROMPT = 5,
    mnDRAVELIN_DEBUG_PROMPT = 6,
    mnINCOMPLETE_BLOCK_PROMPT = 7,
    mnMORE_PROMPT = 8,
    mnEMERGENCY_EXIT_PROMPT = 9,
    mnTOLVARENS_DEBUG_PROMPT = 10,
    mnTW_EQL_DEBUG_PROMPT = 11,
};

}  // namespace krutil::prompt
