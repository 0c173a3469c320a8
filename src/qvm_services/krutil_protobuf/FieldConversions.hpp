// Conversions of the fields that many messages have: identifiers, text, required fields and enumerations, with the ways
// in which they fail. All functions are reentrant.
#pragma once

#include <stdexcept>
#include <string>
#include <type_traits>

#include "foundation/core/diag/terminate.hpp"
#include "msg_svc/protobuf/ustring.hpp"
#include "msg_svc/protobuf_serializer/IDTypeSerializer.hpp"

namespace krutil::protobuf_serializer {

/// Identifier to and from its message. On the wire the sub-message is present for the default identifier too.
using IDTypeSerializer = ::msg_svc::protobuf_serializer::IDTypeSerializer;

using ::msg_svc::protobuf::ustring_to_utf8;
using ::msg_svc::protobuf::utf8_to_ustring;

/// Throws std::logic_error with `text` unless `condition` holds: the peer left out what a message needs. The texts
/// differ in form; peers and logs match them as they stand.
inline void require(bool condition, const char* text) {
    if (!condition) {
        throw std::logic_error(text);
    }
}

/// The four values of a fatal report. File, line and function are settled literals that logs match; they are not those
/// of the source as it stands.
struct FatalDiagnostic {
    const char* message;
    const char* file;
    int line;
    const char* function;
};

/// Whether the number of an enumeration of type `Enum` is an int without loss: the numbers on the wire have 32 bits.
template <class Enum>
inline constexpr bool fitsIntoInt = std::is_enum_v<Enum> && sizeof(Enum) <= sizeof(int);

/// The enumerations on both sides have the same numbers, so a conversion keeps the number and checks it. This one ends
/// the process for a number outside the table: the failure of a value that this process itself made up.
template <class To, class From>
To sameNumberOrTerminate(From value, bool (*isKnown)(int), const FatalDiagnostic& diagnostic) {
    static_assert(fitsIntoInt<From> && fitsIntoInt<To>);
    const auto number = static_cast<int>(value);
    if (!isKnown(number)) {
        foundation::core::diag::terminate(diagnostic.message, diagnostic.file, diagnostic.line, diagnostic.function);
    }
    return static_cast<To>(number);
}

/// The same, but a number outside the table throws std::logic_error with `prefix` and the number in decimal: the
/// failure of a value that a peer sent.
template <class To, class From>
To sameNumberOrThrow(From value, bool (*isKnown)(int), const char* prefix) {
    static_assert(fitsIntoInt<From> && fitsIntoInt<To>);
    const auto number = static_cast<int>(value);
    if (!isKnown(number)) {
        throw std::logic_error(prefix + std::to_string(number));
    }
    return static_cast<To>(number);
}

}  // namespace krutil::protobuf_serializer
