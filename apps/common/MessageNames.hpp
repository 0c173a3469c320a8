// Which schema message a frame's tag stands for.
#pragma once

#include <span>
#include <string>
#include <string_view>

namespace apps {

/// Tag of a frame, and the full name of the message in it.
struct MessageName {
    std::string_view tag;
    std::string_view message;
};

/// All tags of the protocol, which are the names of its serializers; several of them share a message.
std::span<const MessageName> messageNames() noexcept;

/// Full name of the message in a frame with this tag, for a look-up in the descriptor pool. Empty for a tag that the
/// protocol does not use.
std::string messageNameOfTag(std::string_view tag);

}  // namespace apps
