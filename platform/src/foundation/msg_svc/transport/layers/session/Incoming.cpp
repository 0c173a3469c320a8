#include "foundation/msg_svc/transport/layers/session/Incoming.hpp"

#include <unistd.h>

#include <algorithm>
#include <stdexcept>
#include <utility>
#include <variant>

#include "foundation/msg_svc/transport/layers/message/Message.hpp"
#include "foundation/msg_svc/transport/layers/session/PrintableText.hpp"
#include "foundation/msg_svc/transport/layers/session/RefusalTexts.hpp"
#include "foundation/vantor/carrier/framing/TaggedFrame.hpp"

namespace foundation::msg_svc::transport::layers::session {
namespace {

// Reads between two turns of the event loop.
constexpr int readsInATurn = 16;

}  // namespace

Incoming::Incoming(asio::io_context& io, core::posix::OwnedDescriptor& descriptor, const SessionConfig& config,
                   std::shared_ptr<const serialization::Registry> registry, const std::string& arrayTag,
                   SharedExchanges& exchanges, const Outgoing& outgoing, Owner& owner)
    : config_(config),
      registry_(std::move(registry)),
      exchanges_(exchanges),
      outgoing_(outgoing),
      owner_(owner),
      stream_(io),
      reader_(config.limits, arrayTag),
      arrayTag_(arrayTag),
      descriptor_(descriptor.get()) {
    stream_.assign(descriptor.get());
    descriptor.release();
    stream_.non_blocking(true);
}

void Incoming::start(SessionHandler& handler) {
    handler_ = &handler;
    if (state_ == State::Waiting) {
        state_ = State::Reading;
        read();
    }
}

void Incoming::resume() {
    if (state_ == State::HeldBack && !owesTooMuch()) {
        state_ = State::Reading;
        // Messages may be complete that were read before.
        onRead({}, 0);
    }
}

void Incoming::stop() {
    state_ = State::Stopped;
    ErrorCode ignored;
    stream_.cancel(ignored);
}

void Incoming::close() {
    state_ = State::Stopped;
    descriptor_ = -1;
    ErrorCode ignored;
    stream_.close(ignored);
}

void Incoming::abandonInChild() noexcept {
    if (const int descriptor = descriptor_.exchange(-1); descriptor >= 0) {
        ::close(descriptor);
    }
}

// Bytes.

void Incoming::read() {
    if (state_ == State::Reading) {
        stream_.async_read_some(wantedPieces(),
                                [this](const ErrorCode& error, std::size_t count) { onRead(error, count); });
    }
}

// A fixed number of buffers, unused ones empty: no allocation for each read.
std::array<asio::mutable_buffer, 3> Incoming::wantedPieces() {
    std::array<asio::mutable_buffer, 3> buffers;
    const auto wanted = reader_.buffers();
    std::transform(wanted.begin(), wanted.end(), buffers.begin(),
                   [](const iovec& piece) { return asio::mutable_buffer(piece.iov_base, piece.iov_len); });
    return buffers;
}

// What has arrived since is read without a turn of the event loop in between, but no more than so many times: writes
// and timers wait for that.
void Incoming::onRead(ErrorCode error, std::size_t count) {
    for (int reads = 0; takeRead(error, count) && reads < readsInATurn; ++reads) {
        count = stream_.read_some(wantedPieces(), error);
        if (error == asio::error::would_block) {
            break;
        }
    }
    read();
}

// False when there is nothing more to read.
bool Incoming::takeRead(const ErrorCode& error, std::size_t count) {
    if (state_ != State::Reading || error == asio::error::operation_aborted) {
        return false;
    }
    if (error == asio::error::eof || error == asio::error::connection_reset) {
        owner_.onEndOfStream();
        return false;
    }
    if (error) {
        owner_.onReadFailed(error.message());
        return false;
    }
    try {
        reader_.commit(count);
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
    } catch (const std::exception& failure) {
        owner_.onViolation(failure.what());
    } catch (...) {
        owner_.onViolation("the program's handler failed with an exception of an unknown type");
    }
    return isReading();
}

// Messages.

void Incoming::take(MessageReader::Item item) {
    if (auto* const abort = std::get_if<MessageReader::Abort>(&item)) {
        owner_.onPeerAbort(abort->reason);
        return;
    }
    std::optional<Refusal> refusal;
    const bool goodbye = std::holds_alternative<MessageReader::Goodbye>(item);
    {
        const std::lock_guard lock(exchanges_.mutex);
        refusal = goodbye ? exchanges_.exchanges.receive(Saying::Goodbye, 0) : exchanges_.exchanges.receiveAnything();
    }
    if (refusal) {
        throw ProtocolViolation(refusalToReceive(*refusal, Saying::Goodbye, config_.role, 0, {}));
    }
    if (goodbye) {
        handler_->onGoodbye();
    } else {
        takeMessage(std::move(std::get<MessageReader::Frames>(item).frames));
    }
}

void Incoming::takeMessage(Frames frames) {
    if (config_.trace) {
        for (const auto& frame : frames) {
            config_.trace({false, frame == frames.back(), *frame});
        }
    }
    const framing::StreamID stream = frames.back()->streamID();
    const auto* const root = dynamic_cast<const framing::TaggedFrame*>(frames.back().get());
    const auto refuse = [stream](const std::string& why) {
        throw ProtocolViolation("message on stream " + std::to_string(stream) + ": " + why);
    };
    if (root == nullptr) {
        refuse("expected a tagged frame as its last one, got a data frame");
    }
    std::shared_ptr<const serialization::SerializerBase> serializer;
    try {
        serializer = registry_->find(root->tag());
    } catch (const std::out_of_range&) {
        refuse("no serializer is registered for its tag " + quoted(root->tag()));
    }
    const auto* const messages = dynamic_cast<const RootSerializer<exchange::Message>*>(serializer.get());
    const auto* const replies = dynamic_cast<const RootSerializer<exchange::Reply>*>(serializer.get());
    const auto* const events = dynamic_cast<const RootSerializer<eventmgr::BaseEvent>*>(serializer.get());
    if (messages == nullptr && replies == nullptr && events == nullptr) {
        refuse(quoted(root->tag()) + " is only ever referred to and cannot be the last frame");
    }
    const Saying saying = messages != nullptr  ? Saying::Message
                          : replies != nullptr ? Saying::Reply
                                               : sayingOfEvent(serializer->type(), config_);
    std::optional<Refusal> refusal;
    {
        const std::lock_guard lock(exchanges_.mutex);
        refusal = exchanges_.exchanges.receive(saying, stream);
    }
    if (refusal) {
        throw ProtocolViolation(refusalToReceive(*refusal, saying, config_.role, stream, root->tag()));
    }
    if (config_.check) {
        for (const auto& frame : frames) {
            if (const auto* const tagged = dynamic_cast<const framing::TaggedFrame*>(frame.get())) {
                config_.check(*tagged);
            }
        }
    }
    if (messages != nullptr) {
        handler_->onMessage(stream, rebuild(*messages, std::move(frames)));
    } else if (replies != nullptr) {
        handler_->onReply(stream, rebuild(*replies, std::move(frames)));
    } else {
        handler_->onEvent(stream, rebuild(*events, std::move(frames)));
    }
}

// Objects.

template <class T>
boost::shared_ptr<const T> Incoming::rebuild(const RootSerializer<T>& serializer, Frames frames) {
    const framing::FrameIndex root = frames.size();
    notes_.take(frames);
    // Indexes of a message start at 1.
    frames.insert(frames.begin(), nullptr);
    const auto message = std::make_unique<message::Message>(std::move(frames));
    const auto refuse = [&](const std::string& why) {
        throw ProtocolViolation("cannot read " + quoted(serializer.name()) + ": " + why);
    };
    boost::shared_ptr<const T> object;
    try {
        object = serializer.deserialize(root, message, registry_, serialization::SerializationContext());
    } catch (const std::exception& error) {
        refuse(notes_.explain(error, *registry_, arrayTag_));
    } catch (...) {
        refuse("exception of an unknown type");
    }
    if (!object) {
        refuse("its serializer returned no object");
    }
    return object;
}

}  // namespace foundation::msg_svc::transport::layers::session
