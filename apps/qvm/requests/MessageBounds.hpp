// How much of what running code makes up goes into one message.
#pragma once

#include <cstddef>

#include "foundation/msg_svc/transport/layers/session/Limits.hpp"

namespace qvm {

/// The peer bounds the bytes of one tagged frame. These are the parts of it that texts may take in their own units, so
/// that what is cut to them fits, however its characters are encoded. A value.
struct MessageBounds {
    explicit MessageBounds(const foundation::msg_svc::transport::layers::session::Limits& peer);

    std::size_t textUnits;          ///< UTF-16 units of one piece of text
    std::size_t warningUnits;       ///< UTF-16 units of a warning that does not fit as it is
    std::size_t errorBytes;         ///< UTF-8 bytes of an error's record
    std::size_t printedCharacters;  ///< characters of an error as Python prints it, which travels with the record
};

}  // namespace qvm
