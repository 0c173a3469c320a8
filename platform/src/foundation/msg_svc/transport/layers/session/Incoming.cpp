#include "foundation/msg_svc/transport/layers/session/Incoming.hpp"

#include <unistd.h>

#include <cerrno>
#include <stdexcept>
#include <system_error>
#include <utility>
#include <variant>

#include "foundation/msg_svc/transport/layers/session/StreamDescriptors.hpp"

namespace foundation::msg_svc::transport::layers::session {
namespace {

// Reads between two turns of the event loop.
constexpr int readsInATurn = 16;

}  // namespace

Incoming::Incoming(asio::io_context& io, core::posix::OwnedDescriptor& descriptor, const SessionConfig& config,
                   std::shared_ptr<const serialization::Registry> registry, const std::string& arrayTag,
                   SharedExchanges& exchanges, const Outgoing& outgoing, lending::SharedMemory* shared,
                   KeepAlive& keepAlive, Owner& owner)
    : config_(config),
      outgoing_(outgoing),
      shared_(shared),
      keepAlive_(keepAlive),
      owner_(owner),
      stream_(io),
      reader_(config.limits, arrayTag, shared == nullptr ? nullptr : &shared->borrower, config.recorder,
              keepAlive.isSettled()),
      intake_(config, std::move(registry), arrayTag, exchanges),
      keptMemory_(io, config.keepMemory),
      descriptor_(descriptor.get()) {
    stream_.assign(descriptor.get());
    descriptor.release();
}

void Incoming::start(SessionHandler& handler) {
    handler_ = &handler;
    if (state_ == State::Waiting) {
        state_ = State::Reading;
        awaitBytes();
    }
}

void Incoming::resume() {
    if (state_ == State::HeldBack && !owesTooMuch()) {
        state_ = State::Reading;
        // Messages may be complete that were read before.
        takeItems();
        awaitBytes();
    }
}

void Incoming::stop() {
    if (state_ != State::Stopped) {
        reader_.recordUnfinished();
    }
    state_ = State::Stopped;
    ErrorCode ignored;
    stream_.cancel(ignored);
}

void Incoming::close() {
    state_ = State::Stopped;
    descriptor_ = -1;
    keptMemory_.stop();
    ErrorCode ignored;
    stream_.close(ignored);
}

void Incoming::abandonInChild() noexcept {
    if (const int descriptor = descriptor_.exchange(-1); descriptor >= 0) {
        ::close(descriptor);
    }
}

// Bytes.

void Incoming::awaitBytes() {
    if (state_ != State::Reading) {
        return;
    }
    stream_.async_wait(asio::posix::stream_descriptor::wait_read, [this](const ErrorCode& error) {
        if (state_ != State::Reading || error == asio::error::operation_aborted) {
            return;
        }
        // A file is always readable, and cannot be waited for.
        if (error && error != asio::error::operation_not_supported) {
            owner_.onReadFailed(error.message());
            return;
        }
        readAvailable();
        awaitBytes();
    });
}

// What has arrived since is read without a turn of the event loop in between, but no more than so many times: writes
// and timers wait for that.
void Incoming::readAvailable() {
    for (int reads = 0; isReading() && reads < readsInATurn && read(); ++reads) {
    }
}

// Returns whether there may be more.
bool Incoming::read() {
    const auto pieces = reader_.buffers();
    ssize_t count = 0;
    try {
        count = shared_ == nullptr ? readSome(descriptor_, pieces) : shared_->borrower.read(descriptor_, pieces);
    } catch (const std::bad_alloc&) {
        throw;
    } catch (const std::exception& failure) {
        owner_.onViolation(failure.what());
        return false;
    }
    if (count < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
        return false;
    }
    if (count == 0 || (count < 0 && errno == ECONNRESET)) {
        owner_.onEndOfStream();
        return false;
    }
    if (count < 0) {
        owner_.onReadFailed(std::generic_category().message(errno));
        return false;
    }
    const auto got = static_cast<std::size_t>(count);
    std::size_t wanted = 0;
    for (const iovec& piece : pieces) {
        wanted += piece.iov_len;
    }
    reader_.commit(got);
    takeItems();
    return got == wanted;
}

void Incoming::takeItems() {
    try {
        while (isReading()) {
            auto item = reader_.next();
            if (!item) {
                break;
            }
            // Whoever is told of the message finds that it has arrived.
            contentSize_ = 0;
            contentArrived_ = 0;
            take(std::move(*item));
            if (state_ == State::Reading && owesTooMuch()) {
                state_ = State::HeldBack;
            }
        }
        contentArrived_ = reader_.contentArrived();
        contentSize_ = reader_.contentSize();
        keptMemory_.watch();
    } catch (const std::bad_alloc&) {
        // No fault of the peer's, and no room for a sentence.
        throw;
    } catch (const std::exception& failure) {
        owner_.onViolation(failure.what());
    } catch (...) {
        owner_.onViolation("the program's handler failed with an exception of an unknown type");
    }
}

// Messages.

void Incoming::take(MessageReader::Item item) {
    if (auto* const abort = std::get_if<MessageReader::Abort>(&item)) {
        owner_.onPeerAbort(abort->reason);
        return;
    }
    if (const auto* const returned = std::get_if<MessageReader::Returned>(&item)) {
        if (!shared_->lender.takeBack(returned->number, returned->kept)) {
            throw ProtocolViolation("return frame: expected the number of a content that is lent, got " +
                                    std::to_string(returned->number));
        }
        return;
    }
    if (std::holds_alternative<MessageReader::KeepAlive>(item)) {
        intake_.takeKeepAlive();
        keepAlive_.answer();
    } else if (std::holds_alternative<MessageReader::Goodbye>(item)) {
        intake_.takeGoodbye(*handler_);
    } else {
        intake_.takeMessage(std::move(std::get<MessageReader::Frames>(item).frames), *handler_);
    }
}

}  // namespace foundation::msg_svc::transport::layers::session
