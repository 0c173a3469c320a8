// Which schema message a frame's tag stands for.
#pragma once

#include <string>
#include <string_view>

namespace apps {

/// Full name of the message in a frame with this tag, for a look-up in the descriptor pool; tags are names of
/// serializers, several of which share a message. Empty for a tag that the protocol does not use.
std::string messageNameOfTag(std::string_view tag);

}  // namespace apps
