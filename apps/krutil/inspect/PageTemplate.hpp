// The page into which MessagePage puts the messages of a recording.
#pragma once

#include <string_view>

namespace krutil_client {

/// page.html, which is compiled into the program.
extern const std::string_view pageTemplate;

}  // namespace krutil_client
