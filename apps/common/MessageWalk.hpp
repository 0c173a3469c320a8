// Walks over messages of any type.
#pragma once

#include <google/protobuf/message.h>

#include <functional>
#include <memory>
#include <string>
#include <string_view>

namespace apps {

/// The message in a frame with this tag; null when the protocol does not use the tag, or when the content cannot be
/// read. Required fields may be missing.
std::unique_ptr<google::protobuf::Message> parsedMessage(std::string_view tag, std::string_view content);

/// Calls `see` with a message and all messages in it, the outer ones first.
void forEachMessage(google::protobuf::Message& message, const std::function<void(google::protobuf::Message&)>& see);

/// Calls `see` with each field of text or bytes in a message and in those within it. What `see` makes of the text is
/// stored.
void forEachText(google::protobuf::Message& message, const std::function<void(std::string&)>& see);

}  // namespace apps
