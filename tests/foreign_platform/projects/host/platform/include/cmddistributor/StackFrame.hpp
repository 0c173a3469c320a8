// Where an error was.
#pragma once

#include <string>

namespace cmddistributor {

struct StackFrame {
    StackFrame(std::u16string inFile, std::string inFunction, double atLine)
        : line(atLine), func(std::move(inFunction)), file(std::move(inFile)) {}

    bool operator==(const StackFrame&) const = default;

    double line;
    std::string func;
    std::u16string file;
};

}  // namespace cmddistributor
