// A reader of recordings, written after the format's description and not with the programs' own.
#pragma once

#include <cstdint>
#include <cstring>
#include <map>
#include <stdexcept>
#include <string>
#include <string_view>
#include <vector>

namespace test_support {

struct RecordedPacket {
    std::string section;  ///< the comment of the section
    std::string interface;
    std::uint32_t flags = 0;
    std::uint64_t nanoseconds = 0;
    std::uint32_t original = 0;
    std::string comment;
    std::string data;  ///< without the tags
};

/// The packets of all sections. Throws std::runtime_error for what is no recording; a part of a block at the end is.
inline std::vector<RecordedPacket> packetsOf(std::string_view file) {
    const auto number = [](std::string_view bytes, std::size_t at) {
        std::uint32_t value = 0;
        std::memcpy(&value, bytes.substr(at, 4).data(), 4);
        return value;
    };
    const auto options = [&](std::string_view bytes) {
        std::map<unsigned, std::string> found;
        while (bytes.size() >= 4 && (number(bytes, 0) & 0xFFFFU) != 0) {
            const std::size_t size = number(bytes, 0) >> 16U;
            found[number(bytes, 0) & 0xFFFFU] = bytes.substr(4, size);
            bytes.remove_prefix(4 + (size + 3) / 4 * 4);
        }
        return found;
    };
    const std::string_view tags("\0\x0c\0\x08krutil\0\0\0\0\0\0", 16);
    std::vector<RecordedPacket> packets;
    std::string section;
    std::string interface;
    while (!file.empty()) {
        const std::size_t size = file.size() < 12 ? 0 : number(file, 4);
        if (size < 12 || size > file.size() || size % 4 != 0 || number(file, size - 4) != size) {
            throw std::runtime_error("a block is damaged");
        }
        const std::string_view body = file.substr(8, size - 12);
        switch (number(file, 0)) {
            case 0x0A0D0D0A:
                interface.clear();
                section = options(body.substr(16))[1];
                break;
            case 1:
                if (!interface.empty() || number(body, 0) != 252 || number(body, 4) != 262'144) {
                    throw std::runtime_error("the interface is not as it has to be");
                }
                interface = options(body.substr(8))[2];
                break;
            case 6: {
                const std::size_t captured = number(body, 12);
                if (interface.empty() || captured > 262'144 || body.substr(20, tags.size()) != tags) {
                    throw std::runtime_error("a packet is not as it has to be");
                }
                auto found = options(body.substr(20 + (captured + 3) / 4 * 4));
                RecordedPacket packet;
                packet.section = section;
                packet.interface = interface;
                packet.flags = number(found[2], 0);
                packet.nanoseconds = std::uint64_t{number(body, 4)} << 32U | number(body, 8);
                packet.original = number(body, 16);
                packet.comment = found[1];
                packet.data = body.substr(20 + tags.size(), captured - tags.size());
                packets.push_back(packet);
                break;
            }
            default:
                throw std::runtime_error("a block has an unknown type");
        }
        file.remove_prefix(size);
    }
    return packets;
}

/// What went in one direction: 1 is inbound, 2 outbound.
inline std::string recordedStream(const std::vector<RecordedPacket>& packets, std::uint32_t flags) {
    std::string bytes;
    for (const RecordedPacket& packet : packets) {
        if (packet.flags == flags) {
            bytes += packet.data;
        }
    }
    return bytes;
}

}  // namespace test_support
