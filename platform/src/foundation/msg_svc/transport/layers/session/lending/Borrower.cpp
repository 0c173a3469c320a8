#include "foundation/msg_svc/transport/layers/session/lending/Borrower.hpp"

#include <pthread.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <iterator>
#include <mutex>
#include <new>
#include <string>
#include <utility>
#include <vector>

#include "foundation/msg_svc/transport/layers/session/Outgoing.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionError.hpp"
#include "foundation/msg_svc/transport/layers/session/lending/DescriptorPassing.hpp"
#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"
#include "foundation/vantor/carrier/shared_memory/ReceivedMemory.hpp"

namespace foundation::msg_svc::transport::layers::session::lending {

using framing::BufferAllocator;
using vantor::carrier::shared_memory::MemoryRefused;
using vantor::carrier::shared_memory::ReceivedMemory;

namespace {

// Changes with each fork of this process. Counted before and after it: what is mapped in between by another thread may
// be in the child as well.
std::atomic<unsigned> forks{0};

void countFork() {
    forks.fetch_add(1);
}

void watchForks() {
    static const bool watched = ::pthread_atfork(&countFork, &countFork, &countFork) == 0;
    if (!watched) {
        throw std::bad_alloc();
    }
}

}  // namespace

// What the borrower and its buffers share.
class Borrower::Core {
  public:
    explicit Core(Outgoing& outgoing) : outgoing_(&outgoing) {}

    void giveBack(std::uint64_t number, bool kept) {
        // Dropped when the lock is released.
        std::vector<OutgoingPieces> done;
        if (abandoned_) {
            return;
        }
        const std::lock_guard lock(mutex_);
        if (outgoing_ != nullptr) {
            // The peer needs its memory for the next message only, so this does not wake it up by itself.
            done = outgoing_->push(OutgoingPieces::giveBack(number, kept), Outgoing::Hold::WithOthers);
        }
    }

    void close() noexcept {
        const std::lock_guard lock(mutex_);
        outgoing_ = nullptr;
    }

    void abandon() noexcept { abandoned_ = true; }

  private:
    std::atomic<bool> abandoned_{false};
    std::mutex mutex_;
    Outgoing* outgoing_;
};

struct Borrower::Borrowed {
    std::shared_ptr<Core> core;
    std::uint64_t number;
    unsigned forksBefore;
    ReceivedMemory memory;

    static void drop(void* borrowed) noexcept {
        std::shared_ptr<Core> core;
        std::uint64_t number = 0;
        unsigned forksBefore = 0;
        {
            const std::unique_ptr<Borrowed> last(static_cast<Borrowed*>(borrowed));
            core = std::move(last->core);
            number = last->number;
            forksBefore = last->forksBefore;
        }
        // Only now that the memory is unmapped can no further fork have it.
        const bool kept = forksBefore != forks;
        try {
            core->giveBack(number, kept);
        } catch (const std::bad_alloc&) {
            // The peer keeps it to the end of the session.
        }
    }
};

Borrower::Borrower(Outgoing& outgoing) : core_(std::make_shared<Core>(outgoing)) {
    watchForks();
}

Borrower::~Borrower() {
    close();
}

ssize_t Borrower::read(int socket, std::span<const iovec> pieces) {
    std::vector<core::posix::OwnedDescriptor> came;
    const ssize_t count = receiveWithDescriptors(socket, pieces, came);
    const int error = errno;
    if (descriptors_.size() + came.size() > mostDescriptorsKept) {
        throw ProtocolViolation("expected at most " + std::to_string(mostDescriptorsKept) +
                                " descriptors ahead of the frames that need them, got " +
                                std::to_string(descriptors_.size() + came.size()));
    }
    std::move(came.begin(), came.end(), std::back_inserter(descriptors_));
    errno = error;
    return count;
}

framing::FrameBuffer Borrower::borrow(const SharedContent& content) {
    if (descriptors_.empty()) {
        throw MemoryRefused("expected a descriptor, got none");
    }
    const core::posix::OwnedDescriptor descriptor = std::move(descriptors_.front());
    descriptors_.pop_front();
    if (content.size < SharedContent::leastSize) {
        throw MemoryRefused("expected " + std::to_string(SharedContent::leastSize) + " bytes or more, got " +
                            std::to_string(content.size));
    }
    const unsigned forksBefore = forks;
    auto borrowed = std::make_unique<Borrowed>(
        Borrowed{core_, content.number, forksBefore, ReceivedMemory(descriptor.get(), content.offset, content.size)});
    char* const bytes = BufferAllocator::adopt(borrowed->memory.data(), content.size, &Borrowed::drop, borrowed.get(),
                                               framing::Adoption::Foreign);
    static_cast<void>(borrowed.release());
    return {std::unique_ptr<char[], std::function<void(char*)>>(bytes, &BufferAllocator::release), content.size};
}

void Borrower::close() noexcept {
    core_->close();
}

void Borrower::abandonInChild() noexcept {
    core_->abandon();
}

}  // namespace foundation::msg_svc::transport::layers::session::lending
