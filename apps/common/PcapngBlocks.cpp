#include "common/PcapngBlocks.hpp"

#include <algorithm>
#include <cstddef>
#include <limits>
#include <string_view>

#include "common/Pcapng.hpp"

namespace apps::pcapng {
namespace {

constexpr std::uint64_t largestPart = longestPacket - tags.size();

template <class Number>
void append(std::string& block, Number number) {
    for (std::size_t i = 0; i < sizeof(Number); ++i) {
        block += static_cast<char>(static_cast<unsigned char>(number >> (8 * i)));
    }
}

void pad(std::string& block) {
    block.append((4 - block.size() % 4) % 4, '\0');
}

void appendOption(std::string& block, std::uint16_t code, std::string_view value) {
    append(block, code);
    append(block, static_cast<std::uint16_t>(value.size()));
    block += value;
    pad(block);
}

void beginBlock(std::string& block, std::uint32_t type) {
    append(block, type);
    // The length, which endBlock() knows.
    append(block, std::uint32_t{0});
}

// The block begins at `begin`, and is the last one.
void endBlock(std::string& block, std::size_t begin = 0) {
    append(block, endOfOptions);
    append(block, std::uint16_t{0});
    const auto length = static_cast<std::uint32_t>(block.size() - begin + 4);
    append(block, length);
    block.replace(begin + 4, 4, block, block.size() - 4, 4);
}

// `count` bytes of the unit from `first` on.
void appendBytes(std::string& block, std::span<const iovec> unit, std::uint64_t first, std::uint64_t count) {
    for (const iovec& piece : unit) {
        if (first >= piece.iov_len) {
            first -= piece.iov_len;
            continue;
        }
        const std::uint64_t taken = std::min<std::uint64_t>(count, piece.iov_len - first);
        block.append(static_cast<const char*>(piece.iov_base) + first, taken);
        count -= taken;
        first = 0;
    }
}

}  // namespace

void makeSection(std::string& block, const std::string& remark, const std::string& program,
                 const std::string& process) {
    block.clear();
    beginBlock(block, sectionHeader);
    append(block, byteOrderMagic);
    append(block, std::uint16_t{1});
    append(block, std::uint16_t{0});
    append(block, std::int64_t{-1});
    if (!remark.empty()) {
        appendOption(block, comment, remark);
    }
    appendOption(block, userApplication, program);
    endBlock(block);

    const std::size_t begin = block.size();
    beginBlock(block, interfaceDescription);
    append(block, upperPdu);
    append(block, std::uint16_t{0});
    append(block, static_cast<std::uint32_t>(longestPacket));
    appendOption(block, interfaceName, process);
    appendOption(block, timeResolution, "\x09");
    endBlock(block, begin);
}

std::uint64_t makePacket(std::string& block, const Unit& unit, std::uint64_t first) {
    const std::uint64_t count = std::min(unit.kept - first, largestPart);
    // Only the last packet tells of what is missing.
    const std::uint64_t missing = first + count == unit.kept ? unit.size - unit.kept : 0;
    const std::uint64_t original =
        std::min<std::uint64_t>(tags.size() + count + missing, std::numeric_limits<std::uint32_t>::max());
    block.clear();
    beginBlock(block, enhancedPacket);
    append(block, std::uint32_t{0});
    append(block, static_cast<std::uint32_t>(unit.nanoseconds >> 32U));
    append(block, static_cast<std::uint32_t>(unit.nanoseconds));
    append(block, static_cast<std::uint32_t>(tags.size() + count));
    append(block, static_cast<std::uint32_t>(original));
    block += tags;
    appendBytes(block, unit.bytes, first, count);
    pad(block);
    append(block, packetFlags);
    append(block, std::uint16_t{4});
    append(block, unit.outbound ? outbound : inbound);
    if (count != unit.size) {
        appendOption(block, comment,
                     "bytes " + std::to_string(first) + "-" + std::to_string(first + count - 1) + " of " +
                         std::to_string(unit.size));
    }
    endBlock(block);
    return count;
}

}  // namespace apps::pcapng
