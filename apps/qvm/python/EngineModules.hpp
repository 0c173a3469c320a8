// The engine's Python part, compiled.
#pragma once

#include <Python.h>

namespace qvm {

/// The modules of this room, as PyImport_FrozenModules takes them. They are made when the engine is built, by the
/// Python that it embeds, and are imported by their names as modules in files are.
const _frozen* engineModules() noexcept;

}  // namespace qvm
