// Copies of recordings that can be given away.
#pragma once

#include <optional>
#include <string>

namespace krutil_client {

class Interrupt;

/// Writes a redacted copy of a recording, "-" for standard input, to the file `out`. That is created for this user
/// alone; one that is there is not touched. The copy has the sessions and units of the recording with their times, and
/// nothing else that the file holds. Returns a sentence when the recording ends within a unit, which the copy does not
/// have. Throws Failure when the recording cannot be read, or the copy not be written, and what `interrupt` throws. The
/// copy has what was read until then.
std::optional<std::string> redactRecording(const std::string& file, const std::string& out, Interrupt& interrupt);

}  // namespace krutil_client
