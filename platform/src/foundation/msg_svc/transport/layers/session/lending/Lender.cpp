#include "foundation/msg_svc/transport/layers/session/lending/Lender.hpp"

#include <cstring>
#include <memory>
#include <utility>

namespace foundation::msg_svc::transport::layers::session::lending {

using vantor::carrier::shared_memory::SegmentPool;

Loan::Loan(Lender& lender, const SharedContent& content, Descriptor descriptor) noexcept
    : lender_(&lender), content_(content), descriptor_(std::move(descriptor)) {}

Loan::~Loan() {
    if (descriptor_) {
        lender_->takeBack(content_.number, false);
    }
}

bool Loan::read(const std::function<void(iovec)>& use) const {
    return lender_->read(content_.number, use);
}

Lender::Lender(Role role) : pool_(SegmentPool::ofProcess()), viewer_(pool_.addViewer(role == Role::Client)) {}

Lender::~Lender() {
    close();
}

std::optional<Loan> Lender::lend(framing::DataFrame& frame) {
    const std::size_t size = frame.size();
    if (size < SharedContent::leastSize) {
        return std::nullopt;
    }
    framing::FrameBuffer buffer;
    Loan::Descriptor descriptor;
    if (frame.shareable()) {
        descriptor = pool_.show(frame.data(), viewer_);
    }
    if (!descriptor) {
        char* const copy = pool_.takeForCopy(size, viewer_);
        if (copy == nullptr) {
            return std::nullopt;
        }
        buffer = {std::unique_ptr<char[], std::function<void(char*)>>(
                      copy, [&pool = pool_](char* memory) { pool.giveBack(memory); }),
                  size};
        descriptor = pool_.show(copy, viewer_);
        if (!descriptor) {
            return std::nullopt;
        }
        std::memcpy(copy, frame.data(), size);
    }
    // The frame's own bytes are not needed any more where they were copied.
    framing::FrameBuffer dropped;
    const std::lock_guard lock(mutex_);
    if (!open_) {
        return std::nullopt;
    }
    const std::uint64_t number = ++lastNumber_;
    framing::FrameBuffer& kept = lent_[number];
    kept = frame.releaseBuffer();
    if (buffer.first) {
        dropped = std::exchange(kept, std::move(buffer));
    }
    return Loan(*this, {number, 0, size}, std::move(descriptor));
}

bool Lender::takeBack(std::uint64_t number, bool kept) {
    framing::FrameBuffer buffer;
    const std::lock_guard lock(mutex_);
    const auto found = lent_.find(number);
    if (found == lent_.end()) {
        return false;
    }
    buffer = std::move(found->second);
    lent_.erase(found);
    if (kept) {
        pool_.hide(buffer.first.get());
    }
    return true;
}

bool Lender::read(std::uint64_t number, const std::function<void(iovec)>& use) {
    const std::lock_guard lock(mutex_);
    const auto found = lent_.find(number);
    if (found == lent_.end()) {
        return false;
    }
    use({found->second.first.get(), found->second.second});
    return true;
}

void Lender::close() {
    std::unordered_map<std::uint64_t, framing::FrameBuffer> dropped;
    const std::lock_guard lock(mutex_);
    if (std::exchange(open_, false)) {
        pool_.removeViewer(viewer_);
        dropped.swap(lent_);
    }
}

}  // namespace foundation::msg_svc::transport::layers::session::lending
