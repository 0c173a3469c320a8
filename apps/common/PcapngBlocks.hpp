// Makes the blocks of recordings. docs/recording.md describes the file.
#pragma once

#include <sys/uio.h>

#include <cstdint>
#include <span>
#include <string>

namespace apps::pcapng {

/// A unit of a session, as far as it is recorded.
struct Unit {
    bool outbound = false;
    std::uint64_t nanoseconds = 0;  ///< since 1970, UTC
    std::span<const iovec> bytes;   ///< `kept` of them at least
    std::uint64_t kept = 0;         ///< the first ones, which are recorded
    std::uint64_t size = 0;         ///< of the whole unit
};

/// Makes `block` what a section begins with: its header and its only interface. An empty remark, which is its comment,
/// is left out.
void makeSection(std::string& block, const std::string& remark, const std::string& program, const std::string& process);

/// Makes `block` the packet with the bytes of a unit from `first` on. Returns how many of them it has: as many as a
/// packet may have, or those that are left.
std::uint64_t makePacket(std::string& block, const Unit& unit, std::uint64_t first);

}  // namespace apps::pcapng
