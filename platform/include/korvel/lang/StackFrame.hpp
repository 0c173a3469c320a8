// One entry of a warning's stack.
#pragma once

#include <string>
#include <utility>

namespace korvel::lang {

/// A place in code, as a warning tells it.
struct StackFrame {
    /// `lineNumber` is 0 when it is not known.
    StackFrame(std::u16string fileName, std::u16string functionName, unsigned int lineNumber)
        : file(std::move(fileName)), name(std::move(functionName)), line(lineNumber) {}

    std::u16string file;  ///< source file
    std::u16string name;  ///< function name
    unsigned int line;    ///< line number; 0 when unknown

    bool operator==(const StackFrame&) const = default;  ///< the same in every part
};

}  // namespace korvel::lang
