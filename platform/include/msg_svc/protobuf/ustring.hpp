// Conversion between the host's UTF-16 text and the wire's UTF-8.
#pragma once

#include <string>

namespace msg_svc::protobuf {

/// UTF-8 encoding of `text`. An unpaired surrogate becomes U+FFFD; embedded NULs are kept. Throws only std::bad_alloc
/// and std::length_error (above 2^31 - 1 code units).
std::string ustring_to_utf8(const std::basic_string<char16_t>& text);

/// UTF-16 decoding of `utf8`. Each maximal ill-formed piece (Unicode, "U+FFFD Substitution of Maximal Subparts")
/// becomes one U+FFFD; embedded NULs are kept. Throws only std::bad_alloc and std::length_error (above 2^31 - 1 bytes).
std::basic_string<char16_t> utf8_to_ustring(const std::string& utf8);

}  // namespace msg_svc::protobuf
