// The module _qvm: what the engine's Python code calls in the engine.
#pragma once

#include "qvm/python/EngineServices.hpp"
#include "qvm/requests/Announcer.hpp"
#include "qvm/requests/TextOutput.hpp"

namespace qvm {

/// Makes the module importable; call before Python is initialised. The objects must live as long as Python code may
/// run, threads of that code included.
void installEngineModule(TextOutput& output, Announcer& announcer, EngineServices& services);

}  // namespace qvm
