// Whose packages running code finds: the choice of an interpreter, before Python starts.
#pragma once

#include <optional>
#include <string>

namespace qvm {

/// How Python starts.
struct PythonConfig {
    std::string program;  ///< an interpreter; its installation or virtual environment is the one that code runs in
    bool isolated =
        false;  ///< the environment of whoever started the engine, and the user's own packages, do not count
};

/// The interpreter to take: `asked`, if there is one, else bin/python3 of the virtual environment in the directory
/// `environment`, if that is not empty, else the one that the engine was built for.
///
/// The engine embeds Python itself; of the interpreter it takes only the place, from which Python finds packages.
/// Python would take its own packages without a word if the file were missing or were of another version. So this
/// function looks: at pyvenv.cfg beside the file or one directory above, else at the name of the file behind symbolic
/// links. No process is started. Throws std::runtime_error, whose sentence says what to do instead.
std::string choosePython(const std::optional<std::string>& asked, const std::string& environment);

}  // namespace qvm
