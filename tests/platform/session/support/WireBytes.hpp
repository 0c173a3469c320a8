// Frames of a session as bytes, as another implementation would write them.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace wire {

/// `count` bytes of `number`, the least significant first.
inline std::string little(std::uint64_t number, int count) {
    std::string bytes;
    for (int i = 0; i < count; ++i) {
        bytes += static_cast<char>(static_cast<unsigned char>(number >> (8 * i)));
    }
    return bytes;
}

/// The number that `count` bytes at `position` are, the least significant first. Throws std::out_of_range without them.
inline std::uint64_t number(const std::string& bytes, std::size_t position, int count) {
    std::uint64_t value = 0;
    for (int i = 0; i < count; ++i) {
        value |= std::uint64_t{static_cast<unsigned char>(bytes.at(position++))} << (8 * i);
    }
    return value;
}

struct Header {
    unsigned kind = 1;
    bool last = true;
    unsigned type = 29;
    std::uint64_t tagSize = 0;
    std::uint64_t stream = 1;
    std::uint64_t index = 1;
    std::uint64_t contentSize = 0;
};

inline std::string header(const Header& h) {
    return little(h.kind | (h.last ? 0x80U : 0U), 1) + little(h.type, 1) + little(h.tagSize, 2) + little(h.stream, 4) +
           little(h.index, 8) + little(h.contentSize, 8);
}

inline std::string tagged(std::uint64_t stream, std::uint64_t index, bool last, const std::string& tag,
                          const std::string& content, unsigned type = 29) {
    return header({1, last, type, tag.size(), stream, index, content.size()}) + tag + content;
}

inline std::string data(std::uint64_t stream, std::uint64_t index, bool last, const std::string& content,
                        unsigned type = 4) {
    return header({2, last, type, 0, stream, index, content.size()}) + content;
}

inline std::string sharedData(std::uint64_t stream, std::uint64_t index, std::uint64_t number, std::uint64_t offset,
                              std::uint64_t size) {
    return header({5, false, 4, 0, stream, index, 24}) + little(number, 8) + little(offset, 8) + little(size, 8);
}

inline std::string giveBack(std::uint64_t number, bool kept = false) {
    return header({6, false, kept ? 1U : 0U, 0, 0, number, 0});
}

inline std::string goodbye() {
    return header({3, false, 0, 0, 0, 0, 0});
}

inline std::string keepAlive() {
    return header({7, false, 0, 0, 0, 0, 0});
}

inline std::string abort(const std::string& reason) {
    return header({4, false, 0, 0, 0, 0, reason.size()}) + reason;
}

/// Bytes of a stream, divided into frames; the last one has what is left.
inline std::vector<std::string> framesOf(std::string bytes) {
    const auto number = [&bytes](std::size_t at, std::size_t count) {
        std::size_t value = 0;
        for (std::size_t i = count; i > 0; --i) {
            value = value << 8U | static_cast<unsigned char>(bytes.at(at + i - 1));
        }
        return value;
    };
    std::vector<std::string> frames;
    while (!bytes.empty()) {
        const std::size_t size = bytes.size() < 24 ? bytes.size() : 24 + number(2, 2) + number(16, 8);
        frames.push_back(bytes.substr(0, size));
        bytes.erase(0, size);
    }
    return frames;
}

}  // namespace wire
