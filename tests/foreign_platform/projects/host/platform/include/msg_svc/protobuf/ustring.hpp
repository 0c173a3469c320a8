// UTF-16 and UTF-8.
#pragma once

#include <string>

namespace msg_svc::protobuf {

/// Both leave out what is ill-formed.
std::string ustring_to_utf8(const std::u16string& text);
std::u16string utf8_to_ustring(const std::string& text);

}  // namespace msg_svc::protobuf
