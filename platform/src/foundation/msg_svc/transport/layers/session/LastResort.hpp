// A call on the I/O thread that needs no memory when it is asked for.
#pragma once

#include <array>
#include <atomic>
#include <cstddef>
#include <functional>
#include <new>
#include <utility>

#include "foundation/msg_svc/transport/layers/session/Asio.hpp"

namespace foundation::msg_svc::transport::layers::session {

/// Has a function called on the thread of an `io_context`, once. What posting takes is kept ready from the start, for
/// whoever has found that there is no memory. Must outlive the context's work.
class LastResort {
  public:
    LastResort(asio::io_context& io, std::function<void()> function) : io_(io), function_(std::move(function)) {}
    LastResort(const LastResort&) = delete;
    LastResort& operator=(const LastResort&) = delete;

    /// From any thread; the first call counts.
    void call() noexcept {
        if (!called_.exchange(true)) {
            asio::post(io_, Posted{this});
        }
    }

  private:
    // Hands out the memory below, once.
    template <class T>
    struct Allocator {
        using value_type = T;

        explicit Allocator(LastResort* resort) noexcept : owner(resort) {}
        template <class Other>
        Allocator(const Allocator<Other>& other) noexcept : owner(other.owner) {}

        T* allocate(std::size_t count) {
            if (count * sizeof(T) > owner->memory_.size()) {
                throw std::bad_alloc();
            }
            return reinterpret_cast<T*>(owner->memory_.data());
        }
        void deallocate(T*, std::size_t) noexcept {}
        bool operator==(const Allocator&) const = default;

        LastResort* owner;
    };

    struct Posted {
        using allocator_type = Allocator<void>;
        allocator_type get_allocator() const noexcept { return allocator_type(resort); }
        void operator()() const { resort->function_(); }

        LastResort* resort;
    };

    asio::io_context& io_;
    std::function<void()> function_;
    std::atomic<bool> called_{false};
    alignas(std::max_align_t) std::array<std::byte, 256> memory_{};
};

}  // namespace foundation::msg_svc::transport::layers::session
