// Numbers of the file format pcapng, as recordings of sessions use it. docs/recording.md describes the file.
#pragma once

#include <cstdint>
#include <string_view>

namespace apps::pcapng {

// Types of blocks.
inline constexpr std::uint32_t sectionHeader = 0x0A0D0D0A;
inline constexpr std::uint32_t interfaceDescription = 1;
inline constexpr std::uint32_t enhancedPacket = 6;

inline constexpr std::uint32_t byteOrderMagic = 0x1A2B3C4D;
inline constexpr std::uint16_t upperPdu = 252;

// Codes of options.
inline constexpr std::uint16_t endOfOptions = 0;
inline constexpr std::uint16_t comment = 1;
inline constexpr std::uint16_t userApplication = 4;  ///< of a section
inline constexpr std::uint16_t interfaceName = 2;    ///< of an interface
inline constexpr std::uint16_t timeResolution = 9;   ///< of an interface
inline constexpr std::uint16_t packetFlags = 2;      ///< of a packet

// Of the flags of a packet.
inline constexpr std::uint32_t inbound = 1;
inline constexpr std::uint32_t outbound = 2;

/// What readers take for a packet at most, in bytes.
inline constexpr std::uint64_t longestPacket = 262'144;

/// Which dissector is meant; in front of the bytes of each packet. Numbers of the tags are big-endian.
inline constexpr std::string_view tags("\0\x0c\0\x08krutil\0\0\0\0\0\0", 16);

}  // namespace apps::pcapng
