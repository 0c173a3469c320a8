// Any bytes after the handshake: the reader gives messages or a violation, in whatever pieces the bytes arrive. The
// first byte of the input is the length of the pieces.

#include <algorithm>
#include <cstdint>
#include <cstring>

#include "foundation/msg_svc/transport/layers/session/MessageReader.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionError.hpp"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    using namespace foundation::msg_svc::transport::layers::session;
    if (size == 0) {
        return 0;
    }
    const std::size_t piece = std::max<std::size_t>(*data, 1);
    ++data;
    --size;
    // Small limits, so that a search does not spend its time on filling buffers.
    Limits limits;
    limits.taggedFrame = 4096;
    limits.arrayMessage = 8192;
    limits.message = 65'536;
    limits.frames = 64;
    MessageReader reader(limits, "krutil:QDA");
    try {
        while (size > 0) {
            std::size_t budget = std::min(piece, size);
            std::size_t taken = 0;
            for (const iovec& part : reader.buffers()) {
                const std::size_t count = std::min(part.iov_len, budget);
                if (count > 0) {
                    std::memcpy(part.iov_base, data, count);
                }
                data += count;
                size -= count;
                budget -= count;
                taken += count;
            }
            reader.commit(taken);
            while (reader.next()) {
            }
        }
        static_cast<void>(reader.position());
    } catch (const ProtocolViolation&) {
    }
    return 0;
}
