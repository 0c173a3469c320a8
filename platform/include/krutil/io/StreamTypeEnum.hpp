// Kinds of text streams.
#pragma once

#include <cstdint>

namespace krutil::io {

/// Numbers are those of the wire.
enum class StreamTypeEnum : std::int32_t {
    OUTPUT_STREAM = 0,
    ERROR_STREAM = 1,
    GENERIC_STREAM = 2,  ///< neither: text that belongs to no request's output or errors
};

}  // namespace krutil::io
