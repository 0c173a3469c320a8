#include "krutil/io/SinkTraits.hpp"

namespace krutil::io {

SinkTraits::SinkTraits(bool untransmitted, bool supportsHotlinks, bool needsFormattingForDisplay, bool useDiary,
                       bool useEcho, bool useLogging) noexcept
    : untransmitted_(untransmitted),
      supportsHotlinks_(supportsHotlinks),
      needsFormattingForDisplay_(needsFormattingForDisplay),
      useDiary_(useDiary),
      useEcho_(useEcho),
      useLogging_(useLogging) {}

SinkTraits::~SinkTraits() = default;

bool SinkTraits::operator==(const SinkTraits& other) const noexcept = default;

}  // namespace krutil::io
