// The engine's Python part, compiled.
#pragma once

#include <string_view>

namespace qvm {

/// Code of qvm.py, as PyMarshal_ReadObjectFromString() reads it. Made when the engine is built, by the Python that it
/// embeds.
std::string_view moduleCode() noexcept;

}  // namespace qvm
