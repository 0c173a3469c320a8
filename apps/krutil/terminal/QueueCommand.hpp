// What a person asks about the engine's queue while a line is edited.
#pragma once

#include <string>

#include "krutil/base/Output.hpp"
#include "krutil/session/Client.hpp"

namespace krutil_client {

/// ":queue" lists the requests that have no answer on `out`, and what the two ends can do; ":queue cancel NUMBER" has
/// one cancelled. Returns false, and does nothing, for any other command. Throws what Output::write() throws.
bool obeyQueueCommand(Client& client, const std::string& command, Output& out);

}  // namespace krutil_client
