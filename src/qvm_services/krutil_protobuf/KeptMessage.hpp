// Messages that threads keep from one write to the next, so that sub-messages and strings need not be allocated again.
#pragma once

#include <cstddef>
#include <memory>

namespace krutil::protobuf_serializer {

/// A message to fill and write. Each thread keeps one of each class `Proto`; it holds what was written last, so whoever
/// fills it sets every field. When the kept one is in use already, because an object being written contains another
/// of its type, the message is a fresh one.
///
/// What a kept message occupies grows with what was written through it. So after `mostBytes` it is given up for a fresh
/// one, at once if a single message is that large. It is destroyed when its thread ends; threads that are ending use
/// fresh ones. A thread that keeps one keeps this library loaded.
///
/// Lives for one serialize call, on one thread.
template <class Proto>
class KeptMessage {
  public:
    /// Serialized bytes that one kept message is used for, at most.
    static constexpr std::size_t mostBytes = 1U << 18;

    KeptMessage() : message_(slot.message) {
        slot.message = nullptr;
        if (message_ == nullptr) {
            message_ = new Proto();
        }
    }

    ~KeptMessage() { delete message_; }

    KeptMessage(const KeptMessage&) = delete;
    KeptMessage& operator=(const KeptMessage&) = delete;

    Proto& operator*() const noexcept { return *message_; }

    /// Keeps the message for the next call, now that it was written; without this it is destroyed.
    void keep() noexcept {
        if (slot.message != nullptr || slot.threadEnds) {
            return;
        }
        slot.bytes += static_cast<std::size_t>(message_->GetCachedSize());
        if (slot.bytes > mostBytes) {
            slot.bytes = 0;
            return;
        }
        static thread_local const DestroyAtThreadEnd registered;
        slot.message = message_;
        message_ = nullptr;
    }

  private:
    // Needs no destructor, so that it can be used as long as its thread runs, by destructors of other thread-local
    // objects too.
    struct Slot {
        Proto* message = nullptr;
        std::size_t bytes = 0;
        bool threadEnds = false;
    };

    struct DestroyAtThreadEnd {
        ~DestroyAtThreadEnd() {
            delete slot.message;
            slot = {nullptr, 0, true};
        }
    };

    static inline thread_local constinit Slot slot{};

    Proto* message_;
};

}  // namespace krutil::protobuf_serializer
