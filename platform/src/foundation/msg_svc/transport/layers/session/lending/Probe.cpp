#include "foundation/msg_svc/transport/layers/session/lending/Probe.hpp"

#include <algorithm>
#include <array>
#include <cstdint>
#include <cstring>
#include <exception>
#include <memory>
#include <random>
#include <string>
#include <vector>

#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "foundation/msg_svc/transport/layers/session/LittleEndian.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionError.hpp"
#include "foundation/vantor/carrier/shared_memory/ReceivedMemory.hpp"
#include "foundation/vantor/carrier/shared_memory/Segment.hpp"

namespace foundation::msg_svc::transport::layers::session::lending {
namespace {

using vantor::carrier::shared_memory::ReceivedMemory;
using vantor::carrier::shared_memory::Segment;

// A number that no other memory of the two ends begins with.
using Token = std::array<char, 8>;

Token newToken() {
    std::random_device random;
    Token token{};
    storeLittleEndian<std::uint32_t>(token.data(), random());
    storeLittleEndian<std::uint32_t>(token.data() + 4, random());
    return token;
}

bool shows(const std::vector<core::posix::OwnedDescriptor>& descriptors, const Token& token) {
    if (descriptors.size() != 1) {
        return false;
    }
    try {
        const ReceivedMemory memory(descriptors.front().get(), 0, token.size());
        return std::equal(token.begin(), token.end(), memory.data());
    } catch (const std::exception&) {
        // Arrays would be refused for the same reason.
        return false;
    }
}

}  // namespace

bool probeSharedMemory(HandshakeStream& stream) {
    const Token own = newToken();
    const std::unique_ptr<Segment> segment = Segment::create(own.size());
    if (segment) {
        std::memcpy(segment->data(), own.data(), own.size());
    }
    stream.sendWith({own.data(), own.size()}, segment ? segment->descriptor()->get() : -1);
    Token peers{};
    std::vector<core::posix::OwnedDescriptor> descriptors;
    stream.receive(peers.data(), peers.size(), "the peer's probe of shared memory", nullptr, &descriptors);
    stream.endUnit();
    const bool shown = shows(descriptors, peers);
    stream.send(std::string(1, shown ? '\1' : '\0'));
    unsigned char answer = 0;
    stream.receive(reinterpret_cast<char*>(&answer), 1, "the peer's answer to the probe of shared memory");
    stream.endUnit();
    if (answer > 1) {
        throw ProtocolViolation("the peer's answer to the probe of shared memory: expected 0 or 1, got " +
                                std::to_string(answer));
    }
    stream.flush();
    return shown && answer == 1;
}

}  // namespace foundation::msg_svc::transport::layers::session::lending
