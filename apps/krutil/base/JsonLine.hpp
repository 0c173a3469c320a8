// JSON that a terminal can show.
#pragma once

#include <nlohmann/json_fwd.hpp>
#include <string>

namespace krutil_client {

/// `object` on a line. Text that is not valid UTF-8 shows U+FFFD. All characters that
/// steersTerminal() names are escapes, which a reader of JSON takes back.
std::string jsonLine(const nlohmann::ordered_json& object);

}  // namespace krutil_client
