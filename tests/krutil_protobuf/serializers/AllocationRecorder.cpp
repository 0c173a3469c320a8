#include "krutil_protobuf/serializers/AllocationRecorder.hpp"

#include <algorithm>
#include <cstdlib>
#include <new>

namespace {

thread_local AllocationRecorder* current = nullptr;

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
            if (array) {
                ++recorder->arrays_;
                recorder->lastArray_ = size;
            }
        }
        return std::malloc(size != 0 ? size : 1);
    }

    static void* allocateOrThrow(std::size_t size, bool array) {
        void* memory = allocate(size, array);
        if (memory == nullptr) {
            throw std::bad_alloc();
        }
        return memory;
    }

    static void release(void* memory) noexcept {
        if (current != nullptr && memory != nullptr) {
            --current->outstanding_;
        }
        std::free(memory);
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
