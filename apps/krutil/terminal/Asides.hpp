// Lines that are no code: questions about names, and commands of a shell.
#pragma once

#include <functional>
#include <optional>
#include <string>

#include "krutil/base/Output.hpp"

namespace krutil_client {

/// Tells about a name, UTF-8: empty when there is nothing to tell, nothing when nobody can.
using Inspect = std::function<std::optional<std::string>(const std::string& name)>;

/// "?name" and "name?" show what `inspect` tells about the name; "!command" shows what to type instead. Returns false,
/// and does nothing, for any other line. Throws what `inspect` and Output::write() throw.
bool answerAside(const std::string& line, const Inspect& inspect, Output& out);

}  // namespace krutil_client
