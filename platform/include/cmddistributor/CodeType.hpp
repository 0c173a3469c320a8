// Kinds of code text.
#pragma once

#include <cstdint>

namespace cmddistributor {

/// How an engine reads the text of an eval request.
enum class CodeType : std::int32_t {
    CodeBlockType = 0,     ///< statements; the value of a trailing expression is shown
    ScriptType = 1,        ///< the text of a program
    ConventionalType = 2,  ///< a single statement
    Undefined = 3,         ///< not stated; read as a block
};

}  // namespace cmddistributor
