// Any bytes after the handshake: the reader gives messages or a violation, in whatever pieces the bytes arrive. The
// first byte of the input is the length of the pieces; with its highest bit, the session has shared memory, and a
// descriptor comes with each piece.

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <optional>
#include <span>
#include <string_view>

#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "foundation/msg_svc/transport/layers/session/MessageReader.hpp"
#include "foundation/msg_svc/transport/layers/session/Outgoing.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionError.hpp"
#include "foundation/msg_svc/transport/layers/session/lending/Borrower.hpp"
#include "foundation/msg_svc/transport/layers/session/lending/DescriptorPassing.hpp"

namespace {

using namespace foundation::msg_svc::transport::layers::session;
using foundation::core::posix::OwnedDescriptor;

void require(bool holds) {
    if (!holds) {
        std::abort();
    }
}

// Memory that keeps to the rules.
OwnedDescriptor sealedMemory() {
    constexpr off_t size = 2 << 20;
    OwnedDescriptor memory(::memfd_create("fuzz", MFD_CLOEXEC | MFD_ALLOW_SEALING));
    require(::ftruncate(memory.get(), size) == 0 && ::fallocate(memory.get(), 0, 0, size) == 0 &&
            ::fcntl(memory.get(), F_ADD_SEALS, F_SEAL_SHRINK | F_SEAL_GROW | F_SEAL_FUTURE_WRITE | F_SEAL_SEAL) == 0);
    return memory;
}

struct SocketPair {
    SocketPair() {
        int ends[2] = {-1, -1};
        require(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0, ends) == 0);
        near.reset(ends[0]);
        far.reset(ends[1]);
    }

    OwnedDescriptor near;
    OwnedDescriptor far;
};

// A stream that passes descriptors, and what borrows the memory that they stand for. Nobody reads what is given back.
class SharingStream final : private Outgoing::Owner {
  public:
    lending::Borrower& borrower() { return borrower_; }

    // Returns how many bytes the reader has received.
    std::size_t pass(std::string_view bytes, std::span<const iovec> target) {
        static const OwnedDescriptor memory = sealedMemory();
        const iovec piece{const_cast<char*>(bytes.data()), bytes.size()};
        const int descriptor = memory.get();
        const ssize_t sent = lending::sendWithDescriptors(toReader_.near.get(), {&piece, 1}, {&descriptor, 1});
        require(sent == static_cast<ssize_t>(bytes.size()));
        const ssize_t received = borrower_.read(toReader_.far.get(), target);
        require(received > 0);
        return static_cast<std::size_t>(received);
    }

  private:
    void onWritten(bool) override {}
    void onWriteFailed(int) override {}
    void onHangUp() override {}

    SocketPair toReader_;
    SocketPair back_;
    asio::io_context io_;
    Outgoing outgoing_{io_, back_.near, 1, nullptr, *this};
    lending::Borrower borrower_{outgoing_};
};

// Returns how many bytes the reader has received, without descriptors.
std::size_t copy(std::string_view bytes, std::span<const iovec> target) {
    std::size_t taken = 0;
    for (const iovec& part : target) {
        taken += bytes.copy(static_cast<char*>(part.iov_base), part.iov_len, taken);
    }
    return taken;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    if (size == 0) {
        return 0;
    }
    const std::size_t piece = std::max<std::size_t>(*data & 0x7FU, 1);
    std::optional<SharingStream> sharing;
    if ((*data & 0x80U) != 0) {
        sharing.emplace();
    }
    std::string_view bytes(reinterpret_cast<const char*>(data) + 1, size - 1);
    // Small limits, so that a search does not spend its time on filling buffers; but two shared contents fit.
    Limits limits;
    limits.taggedFrame = 4096;
    limits.arrayMessage = 8192;
    limits.message = sharing ? 3U << 20 : 65'536;
    limits.frames = 64;
    MessageReader reader(limits, "krutil:QDA", sharing ? &sharing->borrower() : nullptr);
    try {
        while (!bytes.empty()) {
            const std::string_view next = bytes.substr(0, piece);
            const std::size_t taken = sharing ? sharing->pass(next, reader.buffers()) : copy(next, reader.buffers());
            bytes.remove_prefix(taken);
            reader.commit(taken);
            while (reader.next()) {
            }
        }
        static_cast<void>(reader.position());
    } catch (const ProtocolViolation&) {
    }
    return 0;
}
