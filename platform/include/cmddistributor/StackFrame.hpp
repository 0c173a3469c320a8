// One entry of an error's stack.
#pragma once

#include <string>

namespace cmddistributor {

/// A place in code, as an error tells it.
struct StackFrame {
    std::u16string file;  ///< source file, UTF-16
    std::string func;     ///< function name, UTF-8
    double line = 0;      ///< line number; 0 when unknown

    bool operator==(const StackFrame&) const = default;  ///< the same in every part
};

}  // namespace cmddistributor
