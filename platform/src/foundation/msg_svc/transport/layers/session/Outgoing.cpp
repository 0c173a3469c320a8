#include "foundation/msg_svc/transport/layers/session/Outgoing.hpp"

#include <poll.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <system_error>
#include <utility>

#include "foundation/msg_svc/transport/layers/session/Session.hpp"

namespace foundation::msg_svc::transport::layers::session {

Outgoing::Outgoing(asio::io_context& io, core::posix::OwnedDescriptor& descriptor, std::size_t roomBytes,
                   SessionRecorder* recorder, Owner& owner)
    : io_(io), stream_(io), owner_(owner), roomBytes_(roomBytes), recorder_(recorder), descriptor_(descriptor.get()) {
    stream_.assign(descriptor.get());
    descriptor.release();
    updateEvents();
}

Outgoing::Total Outgoing::totalOf(const std::vector<OutgoingPieces>& messages) {
    Total total;
    for (const OutgoingPieces& message : messages) {
        total.bytes += message.bytes();
        total.answers += message.answer() ? 1 : 0;
    }
    return total;
}

std::vector<OutgoingPieces> Outgoing::push(OutgoingPieces&& message, Hold hold) {
    std::vector<OutgoingPieces> done;
    const std::lock_guard lock(mutex_);
    if (!isOpen()) {
        return done;
    }
    const bool held = hold == Hold::Yes || (hold == Hold::WithOthers && !queue_.empty());
    answersOwed_ += message.answer() ? 1 : 0;
    enqueue(std::move(message));
    if (!writerAwake_ && (!held || unwritten_ >= Session::heldBytes)) {
        write(done);
    }
    if (!queue_.empty()) {
        queue_.back().detachUnshareable();
    }
    uncount(totalOf(done));
    return done;
}

// With the mutex held: the order of what is recorded is the order on the wire.
void Outgoing::enqueue(OutgoingPieces&& message) {
    if (recorder_ != nullptr) {
        message.record(*recorder_);
    }
    unwritten_ += message.bytes();
    queue_.push(std::move(message));
}

// With the mutex held.
void Outgoing::write(std::vector<OutgoingPieces>& written) {
    const int error = queue_.writeOnce(descriptor_, written);
    if (error != 0 && error != EAGAIN) {
        state_ = State::Failed;
        asio::post(io_, [this, error] { fail(error); });
    } else if (!queue_.empty()) {
        writerAwake_ = true;
        asio::post(io_, [this] { armWrite(); });
    }
}

void Outgoing::sendHeld() {
    std::vector<OutgoingPieces> done;
    {
        const std::lock_guard lock(mutex_);
        if (isOpen() && !writerAwake_ && !queue_.empty()) {
            write(done);
        }
    }
    drop(done);
}

bool Outgoing::waitForRoom(int interrupt) {
    if (!room_.holds()) {
        sendHeld();
    }
    return waitFor(room_, interrupt);
}

bool Outgoing::waitUntilWritten(int interrupt) {
    sendHeld();
    {
        // Other threads may go on sending, which must not prolong the wait.
        const std::lock_guard lock(mutex_);
        awaited_ = unwritten_;
        updateEvents();
    }
    return waitFor(allWritten_, interrupt);
}

bool Outgoing::waitFor(const LevelEvent& event, int interrupt) {
    while (!event.holds()) {
        std::array<pollfd, 2> polled{pollfd{event.descriptor(), POLLIN, 0}, pollfd{interrupt, POLLIN, 0}};
        if (::poll(polled.data(), polled.size(), -1) < 0) {
            if (errno == EINTR) {
                continue;
            }
            throw std::system_error(errno, std::generic_category(), "Session: waiting for the stream");
        }
        if (polled[0].revents == 0 && polled[1].revents != 0) {
            return false;
        }
    }
    return true;
}

std::uint64_t Outgoing::written() const {
    const std::lock_guard lock(mutex_);
    return queue_.written();
}

bool Outgoing::isDrained() const {
    const std::lock_guard lock(mutex_);
    return queue_.empty() && !hasFailed();
}

void Outgoing::updateEvents() {
    const bool over = state_ == State::Finishing || state_ == State::Closed;
    room_.set(over || unwritten_ <= roomBytes_);
    allWritten_.set(over || awaited_ == 0);
}

// With the mutex held.
void Outgoing::uncount(Total written) {
    unwritten_ -= written.bytes;
    // Messages are written in the order in which they were handed over, so the awaited ones are the first.
    awaited_ -= std::min(awaited_, written.bytes);
    answersOwed_ -= written.answers;
    updateEvents();
}

// Only when the frames are gone do their bytes stop counting: whoever waits for the stream finds the buffers released.
void Outgoing::drop(std::vector<OutgoingPieces>& messages) {
    if (messages.empty()) {
        return;
    }
    const Total total = totalOf(messages);
    messages.clear();
    const std::lock_guard lock(mutex_);
    uncount(total);
}

void Outgoing::armWrite() {
    stream_.async_wait(asio::posix::stream_descriptor::wait_write, [this](const ErrorCode& error) {
        if (error == asio::error::operation_aborted || state_ == State::Closed) {
            return;
        }
        if (error) {
            fail(error.value());
        } else {
            flush();
        }
    });
}

void Outgoing::flush() {
    std::vector<OutgoingPieces> done;
    int error = 0;
    bool all = false;
    {
        const std::lock_guard lock(mutex_);
        if (!queue_.empty()) {
            error = queue_.writeOnce(descriptor_, done);
        }
        all = queue_.empty();
        writerAwake_ = !all;
    }
    drop(done);
    if (error != 0 && error != EAGAIN) {
        fail(error);
        return;
    }
    if (!all) {
        armWrite();
    }
    owner_.onWritten(all);
}

void Outgoing::fail(int error) {
    std::vector<OutgoingPieces> dropped;
    {
        const std::lock_guard lock(mutex_);
        if (state_ == State::Closed) {
            return;
        }
        state_ = State::Failed;
        dropped = queue_.takeAll(false);
    }
    drop(dropped);
    owner_.onWriteFailed(error);
}

bool Outgoing::finish(std::optional<OutgoingPieces> lastWord) {
    std::vector<OutgoingPieces> dropped;
    bool left = false;
    {
        const std::lock_guard lock(mutex_);
        const bool telling = lastWord && !hasFailed();
        dropped = queue_.takeAll(telling);
        if (telling) {
            enqueue(std::move(*lastWord));
        }
        if (!hasFailed()) {
            state_ = State::Finishing;
        }
        left = !queue_.empty();
        updateEvents();
    }
    drop(dropped);
    return left;
}

void Outgoing::awaitHangUp() {
    stream_.async_wait(asio::posix::stream_descriptor::wait_error, [this](const ErrorCode& error) {
        if (error != asio::error::operation_aborted && state_ != State::Closed) {
            owner_.onHangUp();
        }
    });
}

void Outgoing::close() {
    {
        const std::lock_guard lock(mutex_);
        state_ = State::Closed;
        descriptor_ = -1;
        updateEvents();
    }
    // One by one, because that takes no memory, which may be why the session ends.
    const auto takeLast = [this] {
        const std::lock_guard lock(mutex_);
        return queue_.takeLast();
    };
    while (std::optional<OutgoingPieces> dropped = takeLast()) {
        const Total total{dropped->bytes(), dropped->answer() ? 1U : 0U};
        dropped.reset();
        const std::lock_guard lock(mutex_);
        uncount(total);
    }
    ErrorCode ignored;
    stream_.close(ignored);
}

void Outgoing::abandonInChild() noexcept {
    if (const int descriptor = descriptor_.exchange(-1); descriptor >= 0) {
        ::close(descriptor);
    }
    ::close(room_.descriptor());
    ::close(allWritten_.descriptor());
}

}  // namespace foundation::msg_svc::transport::layers::session
