// Removes what is private from a recording, and keeps what a report of a fault needs.
#pragma once

#include <string>
#include <string_view>

#include "common/RecordingReader.hpp"

namespace krutil_client {

/// Replaces text and numbers in the bytes of a unit. Its size stays, and so does the size of everything in it: messages
/// parse to the same shape. docs/recording.md lists what is kept; all else is replaced, what nobody knows included.
/// Text becomes the letter x, elements of arrays zero, other numbers some other of their
/// length.
void redact(apps::RecordedUnit& unit);

/// Whether this is how one of this system's programs names itself and its version, and nothing else.
bool isBuild(std::string_view text);

}  // namespace krutil_client
