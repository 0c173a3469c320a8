#include "qvm/requests/MessageBounds.hpp"

#include <algorithm>
#include <cstdint>

namespace qvm {
namespace {

constexpr std::uint64_t leastTextUnits = 16;
constexpr std::uint64_t mostTextUnits = 32'768;
constexpr std::uint64_t mostErrorBytes = std::uint64_t{2} << 20;

// On the wire a UTF-16 unit is at most three bytes and a character at most four. So an eighth of the bytes, counted in
// either, takes no more than half of them.
constexpr std::uint64_t bytesForOne = 8;

}  // namespace

MessageBounds::MessageBounds(const foundation::msg_svc::transport::layers::session::Limits& peer)
    : textUnits(static_cast<std::size_t>(std::clamp(peer.taggedFrame / bytesForOne, leastTextUnits, mostTextUnits))),
      warningUnits(static_cast<std::size_t>(peer.taggedFrame / bytesForOne)),
      // The other half is for the printed text.
      errorBytes(static_cast<std::size_t>(std::min(peer.taggedFrame / 2, mostErrorBytes))),
      printedCharacters(errorBytes / bytesForOne) {}

}  // namespace qvm
