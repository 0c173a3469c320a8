// How a program names itself and its build: to a peer in the handshake, and to a person with --version.
#pragma once

#include <string>
#include <string_view>

namespace apps {

/// "PROGRAM VERSION (krutil_protobuf, COMPILER VERSION)", for example "krutil 0.1.0 (krutil_protobuf, GCC 12.2.0)".
std::string buildString(std::string_view program);

}  // namespace apps
