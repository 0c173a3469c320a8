#include "engine/RawPeer.hpp"

#include <sys/uio.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <memory>
#include <stdexcept>
#include <system_error>

namespace bench {
namespace {

// In front of each frame, and counted in its size.
struct Header {
    std::uint64_t size;
    std::uint64_t answer;  // size of the frame that is to come back
};
static_assert(sizeof(Header) == 16);

void writeFrame(int stream, Header header, const char* data) {
    std::array<iovec, 2> parts{iovec{&header, sizeof header},
                               iovec{const_cast<char*>(data), static_cast<std::size_t>(header.size) - sizeof header}};
    for (iovec* part = parts.data(); part < parts.data() + parts.size();) {
        const ssize_t written = ::writev(stream, part, static_cast<int>(parts.data() + parts.size() - part));
        if (written < 0) {
            throw std::system_error(errno, std::generic_category(), "raw peer: write");
        }
        auto left = static_cast<std::size_t>(written);
        while (part < parts.data() + parts.size() && left >= part->iov_len) {
            left -= part->iov_len;
            ++part;
        }
        if (part < parts.data() + parts.size()) {
            part->iov_base = static_cast<char*>(part->iov_base) + left;
            part->iov_len -= left;
        }
    }
}

// One read takes a frame that fits the buffer and has arrived; a larger one makes the buffer grow, once. Empty at the
// end of the stream.
Header readFrame(int stream, std::string& buffer) {
    std::size_t have = 0;
    Header header{sizeof(Header), 0};
    while (have < header.size) {
        const ssize_t got = ::read(stream, buffer.data() + have, buffer.size() - have);
        if (got <= 0) {
            return {0, 0};
        }
        have += static_cast<std::size_t>(got);
        if (have >= sizeof header) {
            std::memcpy(&header, buffer.data(), sizeof header);
            buffer.resize(std::max<std::size_t>(buffer.size(), header.size));
        }
    }
    return header;
}

constexpr std::size_t firstBuffer = 1U << 16;

}  // namespace

RawPeer::RawPeer()
    : process_(krutil_client::EngineProcess::start({"/proc/self/exe", rawPeerArgument})),
      received_(firstBuffer, '\0') {}

void RawPeer::send(const char* data, std::size_t there, std::size_t back) {
    writeFrame(process_.stream(), {there, back}, data);
}

void RawPeer::receive(std::size_t back) {
    if (readFrame(process_.stream(), received_).size != back) {
        throw std::runtime_error("raw peer: expected a frame of " + std::to_string(back) + " bytes, got another");
    }
}

Contender rawRoundTrips(std::size_t there, std::size_t back, const std::string& name) {
    return {name, [peer = std::make_shared<RawPeer>(), data = std::string(there, 'x'), back](std::size_t count) {
                for (std::size_t i = 0; i < count; ++i) {
                    peer->roundTrip(data.data(), data.size(), back);
                }
            }};
}

void serveRaw() {
    std::string buffer(firstBuffer, '\0');
    for (Header header = readFrame(STDIN_FILENO, buffer); header.size > 0; header = readFrame(STDIN_FILENO, buffer)) {
        buffer.resize(std::max<std::size_t>(buffer.size(), header.answer));
        writeFrame(STDOUT_FILENO, {header.answer, 0}, buffer.data() + sizeof header);
    }
}

}  // namespace bench
