// Where an end of a session says something else than in a recording.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "krutil/replay/Talk.hpp"

namespace krutil_client {

/// Whether hexadecimal numbers of the form 0x7f1234 in texts, which are mostly addresses, may differ.
enum class Addresses { MayDiffer, Count };

/// A message as a report names it: the tag of its root, "goodbye" or "abort".
std::string nameOf(const Said& said);

/// Where the frames of two messages differ, in ends of sentences: ", frame 1: modified: text: ...". The times of
/// warnings may differ, and the numbers that clients of function calls give themselves.
std::vector<std::string> compareFrames(const Said& before, const Said& now, Addresses addresses);

/// What an engine said to a request, or of its own accord, beside what it had said in the recording.
struct Compared {
    std::string what;                      ///< "request 3 on stream 5 (krutil:IIPEnqueueMessage)"
    std::vector<std::string> differences;  ///< sentences; empty if there are none
};

/// Whether the recording has the engine's last message. Otherwise the session was lost, or the recording ends early.
bool endsInGoodOrder(const Talk& talk);

/// Compares message by message for each request of the client, in their order; last comes what belongs to no request.
/// Texts that follow each other are compared as one. Addresses in texts, and the times of warnings, may
/// differ. When the recording ends early, the engine may say more. `now` is what the engine said this time.
std::vector<Compared> compare(const Talk& talk, const std::vector<Said>& now);

}  // namespace krutil_client
