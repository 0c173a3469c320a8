// Buffers of data frames.
#pragma once

#include <cstddef>
#include <optional>

#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace foundation::vantor::carrier::framing {

/// Hands out the buffers that data frames are received into and that arrays live in, and knows each one's size by its
/// address: a receiver can compare what a peer announced with what it sent. Addresses are 64-byte aligned. Pages of a
/// large buffer are not touched before its user touches them; large buffers are recycled, up to a bound. All members
/// may be called from any thread.
class BufferAllocator {
  public:
    /// A buffer of `size` bytes, uninitialised; never null, for size 0 either. Throws std::bad_alloc.
    static char* allocate(std::size_t size);

    /// The deleter of every buffer of this allocator: a plain function, so that it can be told apart by its address and
    /// stored where only a function pointer fits. Null is ignored; an address that is not in use ends the process
    /// through diag::terminate.
    static void release(char* buffer);

    /// Size in bytes that `buffer` was allocated with (or adopted with); empty for any other address.
    static std::optional<std::size_t> sizeOf(const char* buffer);

    /// Lets memory of another owner travel as a buffer of this allocator, without a copy: release(address) calls
    /// `drop(owner)` instead of freeing. The bytes must stay valid and unchanged until then. An address may be adopted
    /// several times, with the same size or another; each release() pairs with one adopt(), the latest first, and
    /// sizeOf() tells the latest's size. `drop` runs on whatever thread releases and must not throw. Returns `address`.
    static char* adopt(char* address, std::size_t size, void (*drop)(void* owner), void* owner);

    /// True when release(buffer) would drop an adoption: the bytes are another owner's, who may still read them, so
    /// whoever receives such a buffer must not write into it. False for any other address.
    static bool isAdopted(const char* buffer);

    /// allocate() wrapped as a frame's buffer, with &BufferAllocator::release as deleter.
    static FrameBuffer makeFrameBuffer(std::size_t size);

    /// Number of buffers in use, adopted ones included; for tests that look for leaks.
    static std::size_t inUse();
};

}  // namespace foundation::vantor::carrier::framing
