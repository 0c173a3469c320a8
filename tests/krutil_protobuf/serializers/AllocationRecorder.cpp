#include "krutil_protobuf/serializers/AllocationRecorder.hpp"

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <new>

namespace {

thread_local AllocationRecorder* current = nullptr;

// Stands before each allocation that is in use.
struct alignas(std::max_align_t) Mark {
    std::uint64_t value;
    std::uint64_t size;
};

constexpr std::uint64_t inUse = 0x9E3779B97F4A7C15;

}  // namespace

struct AllocationHooks {
    static void* allocate(std::size_t size, bool array) {
        if (AllocationRecorder* recorder = current; recorder != nullptr) {
            if (recorder->failing_-- == 0) {
                recorder->failed_ = true;
                return nullptr;
            }
            ++recorder->allocations_;
            ++recorder->outstanding_;
            recorder->bytes_ += size;
            recorder->largest_ = std::max(recorder->largest_, size);
            recorder->held_ += static_cast<std::ptrdiff_t>(size);
            recorder->peak_ =
                std::max(recorder->peak_, static_cast<std::size_t>(std::max<std::ptrdiff_t>(recorder->held_, 0)));
            if (array) {
                ++recorder->arrays_;
                recorder->lastArray_ = size;
            }
        }
        void* memory = std::malloc(sizeof(Mark) + std::max<std::size_t>(size, 1));
        return memory != nullptr ? new (memory) Mark{inUse, size} + 1 : nullptr;
    }

    static void* allocateOrThrow(std::size_t size, bool array) {
        void* memory = allocate(size, array);
        if (memory == nullptr) {
            throw std::bad_alloc();
        }
        return memory;
    }

    static void release(void* memory) noexcept {
        if (memory == nullptr) {
            return;
        }
        Mark* mark = static_cast<Mark*>(memory) - 1;
        if (current != nullptr) {
            --current->outstanding_;
            current->held_ -= static_cast<std::ptrdiff_t>(mark->size);
        }
        mark->value = 0;
        std::free(mark);
    }
};

AllocationRecorder::AllocationRecorder(long failing) noexcept : failing_(failing) {
    current = this;
}

AllocationRecorder::~AllocationRecorder() {
    stop();
}

void AllocationRecorder::stop() noexcept {
    current = nullptr;
}

bool AllocationRecorder::beginsAt(const void* address) noexcept {
    std::uint64_t value = 0;
    std::memcpy(&value, static_cast<const char*>(address) - sizeof(Mark), sizeof(value));
    return value == inUse;
}

void* operator new(std::size_t size) {
    return AllocationHooks::allocateOrThrow(size, false);
}
void* operator new[](std::size_t size) {
    return AllocationHooks::allocateOrThrow(size, true);
}
void* operator new(std::size_t size, const std::nothrow_t& /*tag*/) noexcept {
    return AllocationHooks::allocate(size, false);
}
void* operator new[](std::size_t size, const std::nothrow_t& /*tag*/) noexcept {
    return AllocationHooks::allocate(size, true);
}
void operator delete(void* memory) noexcept {
    AllocationHooks::release(memory);
}
void operator delete[](void* memory) noexcept {
    AllocationHooks::release(memory);
}
void operator delete(void* memory, std::size_t /*size*/) noexcept {
    AllocationHooks::release(memory);
}
void operator delete[](void* memory, std::size_t /*size*/) noexcept {
    AllocationHooks::release(memory);
}
void operator delete(void* memory, const std::nothrow_t& /*tag*/) noexcept {
    AllocationHooks::release(memory);
}
void operator delete[](void* memory, const std::nothrow_t& /*tag*/) noexcept {
    AllocationHooks::release(memory);
}
