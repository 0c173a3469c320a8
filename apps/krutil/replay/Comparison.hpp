// Where an engine answers otherwise than in a recording.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "krutil/replay/Talk.hpp"

namespace krutil_client {

/// What an engine said to a request, or of its own accord, beside what it had said in the recording.
struct Compared {
    std::string what;                      ///< "request 3 on stream 5 (krutil:IIPEnqueueMessage)"
    std::vector<std::string> differences;  ///< sentences; empty if there are none
};

/// Whether the recording has the engine's last message. Otherwise the session was lost, or the recording ends early.
bool endsInGoodOrder(const Talk& talk);

/// Compares message by message for each request of the client, in their order; last comes what belongs to no request.
/// Texts that follow each other are compared as one. Numbers of the form 0x7f1234 in texts, and the times of warnings,
/// may differ. When the recording ends early, the engine may say more. `now` is what the engine said this time.
std::vector<Compared> compare(const Talk& talk, const std::vector<Said>& now);

}  // namespace krutil_client
