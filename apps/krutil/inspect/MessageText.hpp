// Recorded messages as lines for a person, and as JSON for programs.
#pragma once

#include <cstdint>
#include <string>

#include "common/RecordingReader.hpp"
#include "krutil/base/Options.hpp"
#include "krutil/inspect/InspectedMessage.hpp"

namespace krutil_client {

/// The line of a message, `begin` being the time 0 in nanoseconds since 1970:
///
///         0.001234 --> f24ed647 IIPEnqueueMessage, 131 bytes: eval "print(1)"
///
/// An arrow to the right goes to the engine. As the options ask for it, a line for each frame follows, with its fields
/// and its bytes. All lines end with a newline.
std::string messageText(const InspectedMessage& message, std::uint64_t begin, const InspectOptions& options);

/// The same as one JSON object, on a line. docs/json-output.md describes it.
std::string messageJson(const InspectedMessage& message, std::uint64_t begin, const InspectOptions& options);

/// Seconds since `begin`, with microseconds.
std::string secondsText(std::uint64_t nanoseconds, std::uint64_t begin);

}  // namespace krutil_client
