// Buffers of data frames.
#pragma once

#include <chrono>
#include <cstddef>
#include <optional>

#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace foundation::vantor::carrier::framing {

/// What may be done with the bytes of an adopted buffer.
enum class Adoption {
    Borrowed,  ///< another owner still reads them: whoever receives the buffer must not write into it
    Owned,     ///< they are the buffer's alone
    Foreign,   ///< the same, but another process may change them at any time: what is checked must be a copy
};

/// Hands out the buffers that data frames are received into and that arrays live in, and knows each one's size by its
/// address: a receiver can compare what a peer announced with what it sent. Addresses are 64-byte aligned. All members
/// may be called from any thread.
///
/// Buffers of 1 MiB and more have pages of their own, which are not touched before their user touches them. Faulting
/// such pages in takes longer than filling them once more, so released buffers are kept for others of their size: 256
/// MiB at most, the latest first, until trim(). The same holds for shared memory that nobody uses.
class BufferAllocator {
  public:
    /// A buffer of `size` bytes, uninitialised; never null, for size 0 either. Throws std::bad_alloc.
    static char* allocate(std::size_t size);

    /// The same for bytes that this process fills and perhaps sends. While a session of the process shares memory with
    /// its peer, a large buffer lies in such memory, so that it arrives without being copied. The peer may then see
    /// what is written into it, sent or not.
    static char* allocateToSend(std::size_t size);

    /// The deleter of every buffer of this allocator: a plain function, so that it can be told apart by its address and
    /// stored where only a function pointer fits. Null is ignored; an address that is not in use ends the process
    /// through diag::terminate.
    static void release(char* buffer);

    /// Size in bytes that `buffer` was allocated with (or adopted with); empty for any other address.
    static std::optional<std::size_t> sizeOf(const char* buffer);

    /// Lets memory of another owner travel as a buffer of this allocator, without a copy: release(address) calls
    /// `drop(owner)` instead of freeing. The bytes must stay valid until then, borrowed ones unchanged. An address may
    /// be adopted several times, with the same size or another; each release() pairs with one adopt(), the latest
    /// first, and sizeOf() tells the latest's size. `drop` runs on whatever thread releases and must not throw. Returns
    /// `address`.
    static char* adopt(char* address, std::size_t size, void (*drop)(void* owner), void* owner,
                       Adoption adoption = Adoption::Borrowed);

    /// True when release(buffer) would drop an adoption of borrowed bytes: another owner may still read them, so
    /// whoever receives such a buffer must not write into it. False for any other address.
    static bool isAdopted(const char* buffer);

    /// True when release(buffer) would drop an adoption of foreign bytes. False for any other address.
    static bool isForeign(const char* buffer);

    /// allocate() wrapped as a frame's buffer, with &BufferAllocator::release as deleter.
    static FrameBuffer makeFrameBuffer(std::size_t size);

    /// Bytes of memory for large buffers that this process has, in use or kept.
    static std::size_t largeBytes();

    /// Gives kept memory back to the system that has not been used for so long. Sessions call this, as
    /// SessionConfig::keepMemory says; a process that has none may.
    static void trim(std::chrono::steady_clock::duration unused);

    /// Number of buffers in use, adopted ones included; for tests that look for leaks.
    static std::size_t inUse();
};

}  // namespace foundation::vantor::carrier::framing
