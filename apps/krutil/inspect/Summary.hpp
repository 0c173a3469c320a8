// What a recorded message says, in a few words.
#pragma once

#include <memory>
#include <string>
#include <string_view>

#include "krutil/inspect/InspectedMessage.hpp"

namespace google::protobuf {
class Message;
}

namespace krutil_client {

/// The gist of a message, on one line: the code of a request, the text of an event, how a reply ended. Empty where the
/// type says all. Text of peers is quoted and escaped.
std::string summaryOf(const InspectedMessage& message);

/// What a peer wrote where a name belongs, a tag for example: printable ASCII, everything else as question marks.
std::string printableName(std::string_view name);

/// The message in a tagged frame or a part of the handshake, as far as it was recorded; null where there is none.
std::unique_ptr<google::protobuf::Message> messageIn(const InspectedFrame& frame);

}  // namespace krutil_client
