// Calls of Python functions by name, with arrays. The caller holds the interpreter lock.
#pragma once

#include <pybind11/pybind11.h>

#include <cstdint>
#include <string>
#include <vector>

#include "foundation/korveldata/Array.hpp"
#include "qvm/python/ReleaseQueue.hpp"

namespace qvm {

/// What the dotted `name` stands for. Its first part is looked for in `session`, then among the builtins, then as a
/// module to import; each further part as an attribute, then, of a package, as a module to import. So a name means what
/// it would mean in the session's code if all modules were imported. Only `qvm.` before other names is always
/// `engineModule`: clients ask for the engine's functions, whatever code has called `qvm`.
///
/// Throws py::error_already_set: NameError or AttributeError that say where the search stopped, TypeError for something
/// that cannot be called, and whatever an import or an attribute raises.
pybind11::object findFunction(const std::string& name, const pybind11::dict& session,
                              const pybind11::object& engineModule);

/// Calls `function` with `arguments`, as toPython() shows them, and returns what it returns. A function of the engine's
/// own module gets numbers as toNumber() shows them. To the function, code of
/// `session` is what calls it: functions such as eval, dir and warnings.warn look at their caller. The arguments'
/// memory is released as soon as neither the call nor what it left behind refers to it. Throws py::error_already_set:
/// what the function raises, and TypeError for an argument that Python cannot have. `name` is that of findFunction().
pybind11::object callWithArrays(const pybind11::object& function, const std::string& name,
                                std::vector<foundation::korveldata::Array> arguments, const pybind11::dict& session);

/// The `wanted` outputs of a call that returned `value`:
///
///     wanted     value                                  outputs
///     0          anything                               none
///     1          anything but None                      the value itself; a tuple of numbers is an array of them
///     n > 1      a tuple or list of exactly n           its elements
///
/// Of the tuple that a function of the engine's own module returns, the first ones are taken when fewer are wanted.
/// Each is converted as toArray() does. Throws py::error_already_set: ValueError for another number of outputs (it
/// tells both), TypeError for an output that cannot be sent, and what NumPy raises. `name` is for texts.
std::vector<foundation::korveldata::Array> outputsOf(const pybind11::object& value, const std::string& name,
                                                     std::uint64_t wanted, ReleaseQueue& releases);

}  // namespace qvm
