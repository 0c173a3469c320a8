// Foreign bytes in messages for a person.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace foundation::msg_svc::transport::layers::session {

/// `bytes` between double quotes, at most `longest` of them and then "...". What is not printable ASCII, a quote or a
/// backslash is written as an escape, so that a peer cannot steer a terminal or a log.
std::string quoted(std::string_view bytes, std::size_t longest = 80);

/// Well-formed UTF-8 without control characters but tab and line feed, at most `longest` bytes (and then "..."): what
/// is shown of a sentence that the peer wrote. Bytes that are not are replaced.
std::string sentence(const std::string& text, std::size_t longest = 8192);

}  // namespace foundation::msg_svc::transport::layers::session
