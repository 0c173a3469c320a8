// What messages for a person name: foreign bytes, and frames.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

namespace foundation::msg_svc::transport::layers::session {

/// `bytes` between double quotes, at most `longest` of them and then "...". What is not printable ASCII, a quote or a
/// backslash is written as an escape, so that a peer cannot steer a terminal or a log.
std::string quoted(std::string_view bytes, std::size_t longest = 80);

/// Well-formed UTF-8 without control characters but tab and line feed, and without controls of direction, which change
/// how a line reads; at most `longest` bytes (and then "..."): what is shown of a sentence that the peer wrote.
/// Whatever is not so is replaced.
std::string sentence(const std::string& text, std::size_t longest = 8192);

/// What messages call the frame with this index.
std::string frameName(std::uint64_t index);

}  // namespace foundation::msg_svc::transport::layers::session
