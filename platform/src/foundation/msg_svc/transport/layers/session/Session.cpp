// GCC's thread sanitizer knows no fences. The ones around Asio's handlers only repeat what its queue's mutex gives.
#ifdef __SANITIZE_THREAD__
#define BOOST_ASIO_DISABLE_FENCED_BLOCK
#endif

#include "foundation/msg_svc/transport/layers/session/Session.hpp"

#include <fcntl.h>
#include <poll.h>
#include <pthread.h>
#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <boost/asio/buffer.hpp>
#include <boost/asio/executor_work_guard.hpp>
#include <boost/asio/io_context.hpp>
#include <boost/asio/posix/stream_descriptor.hpp>
#include <boost/asio/post.hpp>
#include <boost/asio/steady_timer.hpp>
#include <boost/core/demangle.hpp>
#include <mutex>
#include <stdexcept>
#include <system_error>
#include <thread>
#include <unordered_set>
#include <utility>
#include <variant>
#include <vector>

#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "foundation/core/posix/SignalsBlocked.hpp"
#include "foundation/korveldata/Array.hpp"
#include "foundation/msg_svc/transport/layers/serialization/SerializerAPI.hpp"
#include "foundation/msg_svc/transport/layers/session/Handshake.hpp"
#include "foundation/msg_svc/transport/layers/session/LevelEvent.hpp"
#include "foundation/msg_svc/transport/layers/session/MessageReader.hpp"
#include "foundation/msg_svc/transport/layers/session/OutgoingMessage.hpp"
#include "foundation/msg_svc/transport/layers/session/OutgoingQueue.hpp"
#include "foundation/msg_svc/transport/layers/session/PrintableText.hpp"
#include "foundation/vantor/carrier/framing/DataFrame.hpp"
#include "krutil/capabilities_api/CapabilitiesChanged.hpp"
#include "krutil/eventmgr/QVMShutdownEvent.hpp"

namespace foundation::msg_svc::transport::layers::session {
namespace {

using core::posix::OwnedDescriptor;
using core::posix::SignalsBlocked;

namespace asio = boost::asio;
using ErrorCode = boost::system::error_code;

template <class T>
using Shared = boost::shared_ptr<const T>;
template <class T>
using RootSerializer = serialization::SerializerAPI<T, Shared<T>, Shared<T>>;

// How long an abort's reason may take to reach a peer that is slow to read, and how long the end of the stream may take
// to show after a write has failed: what the peer said last is often why it closed.
constexpr std::chrono::milliseconds lingerTime{1'000};
constexpr std::chrono::milliseconds writeFailureGrace{1'000};

// Reads between two turns of the event loop.
constexpr int readsInATurn = 16;

std::string errorText(int error) {
    return std::generic_category().message(error);
}

std::string peerName(Role ownRole) {
    return ownRole == Role::Client ? "the engine" : "the client";
}

std::string typeText(const std::type_info& type) {
    return boost::core::demangle(type.name());
}

// Tag of the frames to which the limit of array messages applies; empty for a protocol without arrays.
std::string tagOfArrays(const serialization::Registry& registry) {
    try {
        return registry.find(std::type_index(typeid(korveldata::Array)))->name();
    } catch (const std::out_of_range&) {
        return {};
    }
}

void prepare(int descriptor) {
    const int flags = ::fcntl(descriptor, F_GETFL);
    if (flags < 0 || ::fcntl(descriptor, F_SETFL, flags | O_NONBLOCK) < 0 ||
        ::fcntl(descriptor, F_SETFD, FD_CLOEXEC) < 0) {
        throw StreamLost("cannot use descriptor " + std::to_string(descriptor) + " for a session: " + errorText(errno));
    }
}

// A write to a stream whose reader has gone must fail, not end the process. writev has no flag for that.
void ignoreBrokenPipes() {
    struct sigaction action {};
    if (::sigaction(SIGPIPE, nullptr, &action) == 0 && action.sa_handler == SIG_DFL) {
        ::signal(SIGPIPE, SIG_IGN);
    }
}

}  // namespace

SessionHandler::~SessionHandler() = default;
void SessionHandler::onMessage(framing::StreamID, const Shared<exchange::Message>&) {}
void SessionHandler::onReply(framing::StreamID, const Shared<exchange::Reply>&) {}
void SessionHandler::onEvent(framing::StreamID, const Shared<eventmgr::BaseEvent>&) {}
void SessionHandler::onGoodbye() {}

/// Members are grouped by who may use them: those of the I/O thread, those under the mutex, and those of any thread.
class Session::Impl {
  public:
    Impl(OwnedDescriptor& in, OwnedDescriptor& out, SessionConfig config, Settlement settlement);

    void start(SessionHandler& handler);
    template <class T>
    void send(framing::StreamID stream, const Shared<T>& object, Urgency urgency);
    bool waitFor(const LevelEvent& event, int interrupt) const;
    void sayGoodbye();
    void close(std::chrono::milliseconds patience);
    void abort(const std::string& text);
    void abandonInChild() noexcept;
    framing::StreamID newStreamID();
    Traffic traffic() const;
    void awaitWritten();

    const SessionConfig config;
    const Settlement settlement;
    const std::string arrayTag;
    LevelEvent room;
    LevelEvent written;
    std::atomic<bool> abandoned{false};

  private:
    // Any thread.
    void ensureThread();
    template <class T>
    std::vector<std::unique_ptr<framing::Frame>> serialize(framing::StreamID stream, const Shared<T>& object) const;
    void checkFrames(const std::vector<std::unique_ptr<framing::Frame>>& frames, framing::StreamID stream) const;
    void checkPeerLimits(const std::vector<std::unique_ptr<framing::Frame>>& frames) const;
    // `rule` runs with the mutex held; it may throw, or return false to send nothing.
    template <class Rule>
    void submit(OutgoingPieces message, Rule rule);
    void drop(std::vector<OutgoingPieces>& messages);

    // With the mutex held.
    void admit(framing::StreamID stream, const exchange::Message& message);
    void admit(framing::StreamID stream, const exchange::Reply& reply);
    void admit(framing::StreamID stream, const eventmgr::BaseEvent& event);
    bool mayWrite() const noexcept { return !over_ && !writeFailed_; }
    void updateEvents();

    // I/O thread.
    void read();
    std::array<asio::mutable_buffer, 3> wantedPieces();
    void onRead(ErrorCode error, std::size_t count);
    bool takeRead(const ErrorCode& error, std::size_t count);
    void onEndOfStream();
    void awaitHangUp();
    void take(MessageReader::Item item);
    void takeMessage(std::vector<std::unique_ptr<framing::Frame>> frames);
    template <class T>
    Shared<T> rebuild(const RootSerializer<T>& serializer, std::vector<std::unique_ptr<framing::Frame>> frames) const;
    void armWrite();
    void flush();
    void writeFailed(int error);
    void beginClose(std::chrono::milliseconds patience);
    SessionEnd ownEnd() const;
    bool shutdownWritten() const;
    void violation(const std::string& text);
    void finish(SessionEnd end, const std::string& abortReason);
    void closeDown();

    asio::io_context io_{1};
    asio::executor_work_guard<asio::io_context::executor_type> work_{io_.get_executor()};
    asio::posix::stream_descriptor in_{io_};
    asio::posix::stream_descriptor out_{io_};
    asio::steady_timer timer_{io_};
    MessageReader reader_;
    SessionHandler* handler_ = nullptr;
    bool readingStopped_ = false;
    bool goodbyeReceived_ = false;
    bool shutdownReceived_ = false;
    bool closing_ = false;
    bool finishing_ = false;
    bool down_ = false;
    int writeError_ = 0;
    SessionEnd end_{SessionEnd::Reason::Closed, {}};

    mutable std::mutex mutex_;
    OutgoingQueue queue_;
    std::size_t unwritten_ = 0;
    std::size_t awaited_ = 0;  ///< of these, what was there when somebody began to wait for it
    std::size_t pendingAnswers_ = 0;
    std::unordered_set<framing::StreamID> open_;
    framing::StreamID lastStream_ = 0;
    bool writerAwake_ = false;
    bool writeFailed_ = false;
    bool goodbyeSent_ = false;
    bool shutdownSent_ = false;
    bool over_ = false;

    std::atomic<std::uint64_t> arriving_{0};
    std::atomic<std::uint64_t> arrived_{0};
    std::atomic<bool> abortRequested_{false};
    std::atomic<int> inDescriptor_;
    std::atomic<int> outDescriptor_;
    std::once_flag threadStarted_;
    std::mutex joinMutex_;
    std::thread thread_;
};

Session::Impl::Impl(OwnedDescriptor& in, OwnedDescriptor& out, SessionConfig sessionConfig, Settlement settled)
    : config(std::move(sessionConfig)),
      settlement(std::move(settled)),
      arrayTag(tagOfArrays(*settlement.registry)),
      reader_(config.limits, arrayTag),
      inDescriptor_(in.get()),
      outDescriptor_(out.get()) {
    in_.assign(in.get());
    in.release();
    out_.assign(out.get());
    out.release();
    in_.non_blocking(true);
    updateEvents();
}

void Session::Impl::ensureThread() {
    std::call_once(threadStarted_, [this] {
        const SignalsBlocked blocked;
        thread_ = std::thread([this] {
            ::pthread_setname_np(::pthread_self(), "session-io");
            io_.run();
        });
    });
}

void Session::Impl::start(SessionHandler& handler) {
    asio::post(io_, [this, &handler] {
        handler_ = &handler;
        if (!down_) {
            read();
        } else {
            handler_->onEnd(end_);
        }
    });
    ensureThread();
}

framing::StreamID Session::Impl::newStreamID() {
    const std::lock_guard lock(mutex_);
    do {
        ++lastStream_;
    } while (lastStream_ == 0 || open_.contains(lastStream_));
    return lastStream_;
}

Traffic Session::Impl::traffic() const {
    const std::lock_guard lock(mutex_);
    return {queue_.written(), arriving_, arrived_};
}

// Sending.

template <class T>
std::vector<std::unique_ptr<framing::Frame>> Session::Impl::serialize(framing::StreamID stream,
                                                                      const Shared<T>& object) const {
    const T& referenced = *object;
    const std::type_info& type = typeid(referenced);
    std::shared_ptr<const serialization::SerializerBase> found;
    try {
        found = settlement.registry->find(std::type_index(type));
    } catch (const std::out_of_range&) {
        throw std::out_of_range("Session::send: no serializer is registered for " + typeText(type));
    }
    const auto& serializer = dynamic_cast<const RootSerializer<T>&>(*found);
    const auto collected = std::make_shared<OutgoingMessage>();
    serializer.serialize(object, stream, 1, collected, settlement.registry, serialization::SerializationContext());
    auto frames = collected->takeFrames();
    checkFrames(frames, stream);
    checkPeerLimits(frames);
    return frames;
}

// A serializer that breaks these would make the peer close the session.
void Session::Impl::checkFrames(const std::vector<std::unique_ptr<framing::Frame>>& frames,
                                framing::StreamID stream) const {
    for (std::size_t i = 0; i < frames.size(); ++i) {
        if (!frames[i] || frames[i]->index() != i + 1 || frames[i]->streamID() != stream) {
            throw std::logic_error("Session::send: expected a serializer to write frame " + std::to_string(i + 1) +
                                   " on stream " + std::to_string(stream) + ", got " +
                                   (frames[i] ? "frame " + std::to_string(frames[i]->index()) + " on stream " +
                                                    std::to_string(frames[i]->streamID())
                                              : std::string("none")));
        }
    }
    if (frames.empty() || dynamic_cast<const framing::TaggedFrame*>(frames.back().get()) == nullptr) {
        throw std::logic_error("Session::send: expected a serializer to write a tagged frame last");
    }
}

void Session::Impl::checkPeerLimits(const std::vector<std::unique_ptr<framing::Frame>>& frames) const {
    const Limits& limits = settlement.peer.limits;
    const auto refuse = [&](const char* limit, std::uint64_t accepted, std::uint64_t size, const std::string& what,
                            const char* unit) {
        const std::string& root = dynamic_cast<const framing::TaggedFrame&>(*frames.back()).tag();
        throw LimitExceeded(quoted(root) + " is larger than " + peerName(config.role) + " accepts: its limit \"" +
                            limit + "\" is " + std::to_string(accepted) + " " + unit + ", " + what + " has " +
                            std::to_string(size));
    };
    if (frames.size() > limits.frames) {
        refuse("frames", limits.frames, frames.size(), "the message", "frames");
    }
    std::uint64_t total = 0;
    for (const auto& frame : frames) {
        total += frame->size();
        if (const auto* const tagged = dynamic_cast<const framing::TaggedFrame*>(frame.get())) {
            if (tagged->tag().size() > limits.tag) {
                refuse("tag", limits.tag, tagged->tag().size(), "the tag of frame " + std::to_string(frame->index()),
                       "bytes");
            }
            const bool array = tagged->tag() == arrayTag;
            const std::uint64_t accepted = array ? limits.arrayMessage : limits.taggedFrame;
            if (frame->size() > accepted) {
                refuse(array ? "arrayMessage" : "taggedFrame", accepted, frame->size(),
                       "the content of frame " + std::to_string(frame->index()), "bytes");
            }
            total += tagged->tag().size();
        }
    }
    if (total > limits.message) {
        refuse("message", limits.message, total, "the message", "bytes");
    }
}

void Session::Impl::admit(framing::StreamID stream, const exchange::Message&) {
    if (config.role != Role::Client || goodbyeSent_) {
        throw std::logic_error(goodbyeSent_ ? "Session::send: no exchange can begin after the goodbye"
                                            : "Session::send: only a client begins exchanges");
    }
    if (stream == 0 || !open_.insert(stream).second) {
        throw std::logic_error("Session::send: a new exchange needs a stream ID that is not 0 and not in use, got " +
                               std::to_string(stream));
    }
}

void Session::Impl::admit(framing::StreamID stream, const exchange::Reply&) {
    if (config.role != Role::Engine || shutdownSent_ || open_.erase(stream) == 0) {
        throw std::logic_error(
            "Session::send: a reply needs the stream ID of an exchange that the peer began and "
            "that is still open, got " +
            std::to_string(stream));
    }
}

void Session::Impl::admit(framing::StreamID stream, const eventmgr::BaseEvent& event) {
    if (config.role == Role::Client && typeid(event) != typeid(::krutil::capabilities_api::CapabilitiesChanged)) {
        throw std::logic_error("Session::send: a client sends no events but capability changes, got " +
                               typeText(typeid(event)));
    }
    if (shutdownSent_ || goodbyeSent_) {
        throw std::logic_error(std::string("Session::send: nothing can follow the ") +
                               (shutdownSent_ ? "shutdown event" : "goodbye"));
    }
    // A client cannot know whether the reply is on its way already, so it has no stream but 0.
    if (stream != 0 && (config.role == Role::Client || !open_.contains(stream))) {
        throw std::logic_error(std::string("Session::send: an event needs the stream ID 0") +
                               (config.role == Role::Client ? "" : " or that of an open exchange") + ", got " +
                               std::to_string(stream));
    }
    shutdownSent_ = typeid(event) == typeid(::krutil::eventmgr::QVMShutdownEvent);
}

template <class T>
void Session::Impl::send(framing::StreamID stream, const Shared<T>& object, Urgency urgency) {
    if (abandoned) {
        return;
    }
    if (!object) {
        throw std::invalid_argument("Session::send: expected an object, got a null pointer");
    }
    {
        const std::lock_guard lock(mutex_);
        if (!mayWrite()) {
            return;
        }
    }
    auto frames = serialize(stream, object);
    if (config.trace) {
        for (const auto& frame : frames) {
            config.trace({true, frame == frames.back(), *frame});
        }
    }
    submit(OutgoingPieces(std::move(frames), urgency == Urgency::Answer), [&] {
        admit(stream, *object);
        return true;
    });
}

template <class Rule>
void Session::Impl::submit(OutgoingPieces message, Rule rule) {
    std::vector<OutgoingPieces> done;
    std::size_t answers = 0;
    {
        const std::lock_guard lock(mutex_);
        if (!mayWrite()) {
            return;
        }
        if (!rule()) {
            return;
        }
        if (message.answer() && pendingAnswers_ >= config.maxPendingAnswers) {
            answers = pendingAnswers_ + 1;
        } else {
            const std::size_t bytes = message.bytes();
            const bool answer = message.answer();
            queue_.push(std::move(message));
            const int error = queue_.size() == 1 ? queue_.writeOnce(outDescriptor_, done) : 0;
            if (error != 0 && error != EAGAIN) {
                writeFailed_ = true;
                asio::post(io_, [this, error] { writeFailed(error); });
            }
            if (!queue_.empty()) {
                queue_.back().detachUnshareable();
                unwritten_ += bytes;
                pendingAnswers_ += answer ? 1 : 0;
                updateEvents();
                if (!writerAwake_ && !writeFailed_) {
                    writerAwake_ = true;
                    asio::post(io_, [this] { armWrite(); });
                }
            }
        }
    }
    if (answers != 0) {
        abort(peerName(config.role) + " asks without reading: expected at most " +
              std::to_string(config.maxPendingAnswers) + " answers to be waiting, got " + std::to_string(answers));
    }
}

void Session::Impl::sayGoodbye() {
    if (abandoned) {
        return;
    }
    if (config.role != Role::Client) {
        throw std::logic_error("Session::sayGoodbye: only a client says goodbye");
    }
    submit(OutgoingPieces(FrameKind::Goodbye, {}), [this] { return !std::exchange(goodbyeSent_, true); });
}

// Other threads may go on sending, which must not prolong the wait.
void Session::Impl::awaitWritten() {
    const std::lock_guard lock(mutex_);
    awaited_ = unwritten_;
    updateEvents();
}

void Session::Impl::updateEvents() {
    room.set(over_ || unwritten_ <= config.roomBytes);
    written.set(over_ || awaited_ == 0);
}

// Frames end here, outside the lock, because their deleters are the owners' code. Only then do the bytes stop counting:
// whoever waits for the stream finds the buffers released.
void Session::Impl::drop(std::vector<OutgoingPieces>& messages) {
    if (messages.empty()) {
        return;
    }
    std::size_t bytes = 0;
    std::size_t answers = 0;
    for (const OutgoingPieces& message : messages) {
        bytes += message.bytes();
        answers += message.answer() ? 1 : 0;
    }
    messages.clear();
    const std::lock_guard lock(mutex_);
    unwritten_ -= bytes;
    // Messages are written in the order in which they were handed over, so the awaited ones are the first.
    awaited_ -= std::min(awaited_, bytes);
    pendingAnswers_ -= answers;
    updateEvents();
}

void Session::Impl::armWrite() {
    out_.async_wait(asio::posix::stream_descriptor::wait_write, [this](const ErrorCode& error) {
        if (error == asio::error::operation_aborted || down_) {
            return;
        }
        if (error) {
            writeFailed(error.value());
        } else {
            flush();
        }
    });
}

void Session::Impl::flush() {
    std::vector<OutgoingPieces> done;
    int error = 0;
    bool drained = false;
    {
        const std::lock_guard lock(mutex_);
        if (!queue_.empty()) {
            error = queue_.writeOnce(outDescriptor_, done);
        }
        drained = queue_.empty();
        writerAwake_ = !drained;
    }
    drop(done);
    if (error != 0 && error != EAGAIN) {
        writeFailed(error);
    } else if (!drained) {
        armWrite();
    } else if (finishing_) {
        closeDown();
    } else if (closing_) {
        finish(ownEnd(), {});
    }
}

void Session::Impl::writeFailed(int error) {
    if (down_) {
        return;
    }
    writeError_ = error;
    std::vector<OutgoingPieces> dropped;
    {
        const std::lock_guard lock(mutex_);
        writeFailed_ = true;
        dropped = queue_.takeAll(false);
    }
    drop(dropped);
    const SessionEnd lost{SessionEnd::Reason::Lost, "cannot write to the stream: " + errorText(error)};
    if (finishing_) {
        closeDown();
    } else if (closing_) {
        finish(ownEnd(), {});
    } else if (readingStopped_) {
        finish(lost, {});
    } else {
        timer_.expires_after(writeFailureGrace);
        timer_.async_wait([this, lost](const ErrorCode& waitError) {
            if (!waitError) {
                finish(lost, {});
            }
        });
    }
}

bool Session::Impl::waitFor(const LevelEvent& event, int interrupt) const {
    while (!event.holds() && !abandoned) {
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

// Receiving.

void Session::Impl::read() {
    if (finishing_ || readingStopped_) {
        return;
    }
    in_.async_read_some(wantedPieces(), [this](const ErrorCode& error, std::size_t count) { onRead(error, count); });
}

// A fixed number of buffers, unused ones empty: no allocation for each read.
std::array<asio::mutable_buffer, 3> Session::Impl::wantedPieces() {
    std::array<asio::mutable_buffer, 3> buffers;
    const auto wanted = reader_.buffers();
    std::transform(wanted.begin(), wanted.end(), buffers.begin(),
                   [](const iovec& piece) { return asio::mutable_buffer(piece.iov_base, piece.iov_len); });
    return buffers;
}

// What has arrived since is read without a turn of the event loop in between, but no more than so many times: writes
// and timers wait for that.
void Session::Impl::onRead(ErrorCode error, std::size_t count) {
    for (int reads = 0; takeRead(error, count) && reads < readsInATurn; ++reads) {
        count = in_.read_some(wantedPieces(), error);
        if (error == asio::error::would_block) {
            break;
        }
    }
    read();
}

// False when there is nothing more to read.
bool Session::Impl::takeRead(const ErrorCode& error, std::size_t count) {
    if (finishing_ || error == asio::error::operation_aborted) {
        return false;
    }
    if (error == asio::error::eof || error == asio::error::connection_reset) {
        onEndOfStream();
        return false;
    }
    if (error) {
        finish({SessionEnd::Reason::Lost, "cannot read from the stream: " + error.message()}, {});
        return false;
    }
    try {
        reader_.commit(count);
        while (!finishing_ && !abortRequested_) {
            auto item = reader_.next();
            if (!item) {
                break;
            }
            // Whoever is told of the message finds that it has arrived.
            arriving_ = 0;
            arrived_ = 0;
            take(std::move(*item));
        }
        arrived_ = reader_.contentArrived();
        arriving_ = reader_.contentSize();
    } catch (const std::exception& failure) {
        violation(failure.what());
    } catch (...) {
        violation("the program's handler failed with an exception of an unknown type");
    }
    return !finishing_ && !abortRequested_;
}

void Session::Impl::onEndOfStream() {
    const bool boundary = reader_.atBoundary();
    const bool client = config.role == Role::Client;
    if (boundary && goodbyeReceived_) {
        readingStopped_ = true;
        if (writeError_ != 0) {
            finish({SessionEnd::Reason::Lost, "cannot write to the stream: " + errorText(writeError_)}, {});
        } else {
            awaitHangUp();
        }
        return;
    }
    if (boundary && (client ? shutdownReceived_ : shutdownWritten())) {
        finish({SessionEnd::Reason::Finished, {}}, {});
        return;
    }
    std::string text = "the stream ended " + reader_.position();
    if (boundary) {
        text += client ? ", before the engine's shutdown event" : ", without the client's goodbye";
    }
    if (writeError_ != 0) {
        text += "; writing to it had failed: " + errorText(writeError_);
    }
    finish({SessionEnd::Reason::Lost, text}, {});
}

// A client that has said goodbye may end its direction of the stream. When it has ended both, nobody waits for what is
// to come, which may take for ever.
void Session::Impl::awaitHangUp() {
    out_.async_wait(asio::posix::stream_descriptor::wait_error, [this](const ErrorCode& error) {
        if (error == asio::error::operation_aborted || down_) {
            return;
        }
        if (shutdownWritten()) {
            finish({SessionEnd::Reason::Finished, {}}, {});
        } else {
            finish({SessionEnd::Reason::Lost, "the client has gone before the engine's shutdown event"}, {});
        }
    });
}

void Session::Impl::take(MessageReader::Item item) {
    if (auto* const abort = std::get_if<MessageReader::Abort>(&item)) {
        finish({SessionEnd::Reason::Violation, "the peer closed the session: " + sentence(abort->reason)}, {});
        return;
    }
    if (goodbyeReceived_) {
        throw ProtocolViolation("expected nothing after the client's goodbye, got another frame");
    }
    if (shutdownReceived_) {
        throw ProtocolViolation("expected nothing after the engine's shutdown event, got another frame");
    }
    if (auto* const message = std::get_if<MessageReader::Frames>(&item)) {
        takeMessage(std::move(message->frames));
        return;
    }
    if (config.role != Role::Engine) {
        throw ProtocolViolation("goodbye frame: expected one from clients only, got one from the engine");
    }
    goodbyeReceived_ = true;
    handler_->onGoodbye();
}

template <class T>
Shared<T> Session::Impl::rebuild(const RootSerializer<T>& serializer,
                                 std::vector<std::unique_ptr<framing::Frame>> frames) const {
    const framing::FrameIndex root = frames.size();
    // Indexes of a message start at 1.
    frames.insert(frames.begin(), nullptr);
    const auto message = std::make_unique<message::Message>(std::move(frames));
    const auto refuse = [&](const std::string& why) {
        throw ProtocolViolation("cannot read " + quoted(serializer.name()) + ": " + why);
    };
    Shared<T> object;
    try {
        object = serializer.deserialize(root, message, settlement.registry, serialization::SerializationContext());
    } catch (const std::exception& error) {
        refuse(error.what());
    } catch (...) {
        refuse("exception of an unknown type");
    }
    if (!object) {
        refuse("its serializer returned no object");
    }
    return object;
}

void Session::Impl::takeMessage(std::vector<std::unique_ptr<framing::Frame>> frames) {
    if (config.trace) {
        for (const auto& frame : frames) {
            config.trace({false, frame == frames.back(), *frame});
        }
    }
    const framing::StreamID stream = frames.back()->streamID();
    const auto* const root = dynamic_cast<const framing::TaggedFrame*>(frames.back().get());
    const auto refuse = [&](const std::string& before, const std::string& after) {
        throw ProtocolViolation("message on stream " + std::to_string(stream) + ": " + before +
                                (root != nullptr ? quoted(root->tag()) : std::string()) + after);
    };
    if (root == nullptr) {
        refuse("expected a tagged frame as its last one, got a data frame", {});
    }
    std::shared_ptr<const serialization::SerializerBase> serializer;
    try {
        serializer = settlement.registry->find(root->tag());
    } catch (const std::out_of_range&) {
        refuse("no serializer is registered for its tag ", {});
    }
    const bool client = config.role == Role::Client;
    const auto* const messages = dynamic_cast<const RootSerializer<exchange::Message>*>(serializer.get());
    const auto* const replies = dynamic_cast<const RootSerializer<exchange::Reply>*>(serializer.get());
    const auto* const events = dynamic_cast<const RootSerializer<eventmgr::BaseEvent>*>(serializer.get());
    if (messages == nullptr && replies == nullptr && events == nullptr) {
        refuse({}, " is only ever referred to and cannot be the last frame");
    }
    const bool capabilities = serializer->type() == typeid(::krutil::capabilities_api::CapabilitiesChanged);
    if (client ? messages != nullptr : replies != nullptr || (events != nullptr && !capabilities)) {
        refuse({}, client ? " goes to an engine, not to a client" : " goes to a client, not to an engine");
    }
    bool known = false;
    {
        const std::lock_guard lock(mutex_);
        known = open_.contains(stream);
    }
    if (messages != nullptr && (stream == 0 || known)) {
        refuse({}, " begins an exchange: expected a stream ID that is not 0 and not in use");
    }
    if (replies != nullptr && !known) {
        refuse({}, " is a reply: expected the stream ID of an open exchange");
    }
    if (events != nullptr && stream != 0 && !known) {
        refuse({}, " is an event: expected the stream ID 0 or that of an open exchange");
    }
    if (config.check) {
        for (const auto& frame : frames) {
            if (const auto* const tagged = dynamic_cast<const framing::TaggedFrame*>(frame.get())) {
                config.check(*tagged);
            }
        }
    }
    if (messages != nullptr) {
        const auto message = rebuild(*messages, std::move(frames));
        {
            const std::lock_guard lock(mutex_);
            open_.insert(stream);
        }
        handler_->onMessage(stream, message);
    } else if (replies != nullptr) {
        const auto reply = rebuild(*replies, std::move(frames));
        {
            const std::lock_guard lock(mutex_);
            open_.erase(stream);
        }
        handler_->onReply(stream, reply);
    } else {
        const auto event = rebuild(*events, std::move(frames));
        shutdownReceived_ = serializer->type() == typeid(::krutil::eventmgr::QVMShutdownEvent);
        handler_->onEvent(stream, event);
    }
}

// Ending.

// What close() amounts to.
SessionEnd Session::Impl::ownEnd() const {
    const std::lock_guard lock(mutex_);
    const bool finished =
        !writeFailed_ && (config.role == Role::Client ? shutdownReceived_ : goodbyeReceived_ && shutdownSent_);
    return {finished ? SessionEnd::Reason::Finished : SessionEnd::Reason::Closed, {}};
}

bool Session::Impl::shutdownWritten() const {
    const std::lock_guard lock(mutex_);
    return shutdownSent_ && queue_.empty() && !writeFailed_;
}

void Session::Impl::beginClose(std::chrono::milliseconds patience) {
    if (finishing_) {
        return;
    }
    closing_ = true;
    bool drained = false;
    {
        const std::lock_guard lock(mutex_);
        drained = queue_.empty() || writeFailed_;
    }
    if (drained) {
        finish(ownEnd(), {});
        return;
    }
    timer_.expires_after(patience);
    timer_.async_wait([this](const ErrorCode& error) {
        if (!error) {
            finish({SessionEnd::Reason::Closed, {}}, {});
        }
    });
}

void Session::Impl::close(std::chrono::milliseconds patience) {
    if (abandoned) {
        return;
    }
    ensureThread();
    asio::post(io_, [this, patience] {
        beginClose(patience);
        // The thread outlives the stream until somebody waits for it here, so that a session which ended before it was
        // started still tells its handler.
        work_.reset();
    });
    const std::lock_guard lock(joinMutex_);
    if (thread_.joinable()) {
        thread_.join();
    }
}

void Session::Impl::abort(const std::string& text) {
    if (abandoned) {
        return;
    }
    abortRequested_ = true;
    asio::post(io_, [this, text] { violation(text); });
    ensureThread();
}

void Session::Impl::violation(const std::string& text) {
    finish({SessionEnd::Reason::Violation, text}, text);
}

void Session::Impl::finish(SessionEnd end, const std::string& abortReason) {
    if (finishing_) {
        return;
    }
    finishing_ = true;
    end_ = std::move(end);
    ErrorCode ignored;
    in_.cancel(ignored);
    std::vector<OutgoingPieces> dropped;
    bool lingering = false;
    {
        const std::lock_guard lock(mutex_);
        over_ = true;
        const bool telling = !abortReason.empty() && !writeFailed_;
        dropped = queue_.takeAll(telling);
        if (telling) {
            // A replaced byte takes three, so a quarter of the longest reason always fits.
            OutgoingPieces abort(FrameKind::Abort, sentence(abortReason, MessageReader::longestReason / 4));
            unwritten_ += abort.bytes();
            queue_.push(std::move(abort));
        }
        lingering = !queue_.empty();
        updateEvents();
    }
    drop(dropped);
    if (!lingering) {
        closeDown();
        return;
    }
    timer_.expires_after(lingerTime);
    timer_.async_wait([this](const ErrorCode& error) {
        if (!error) {
            closeDown();
        }
    });
    flush();
}

void Session::Impl::closeDown() {
    if (down_) {
        return;
    }
    down_ = true;
    std::vector<OutgoingPieces> dropped;
    {
        const std::lock_guard lock(mutex_);
        dropped = queue_.takeAll(false);
        inDescriptor_ = -1;
        outDescriptor_ = -1;
    }
    drop(dropped);
    ErrorCode ignored;
    in_.close(ignored);
    out_.close(ignored);
    timer_.cancel();
    if (handler_ != nullptr) {
        handler_->onEnd(end_);
    }
}

void Session::Impl::abandonInChild() noexcept {
    abandoned = true;
    for (const int descriptor : {inDescriptor_.exchange(-1), outDescriptor_.exchange(-1)}) {
        if (descriptor >= 0) {
            ::close(descriptor);
        }
    }
    ::close(room.descriptor());
    ::close(written.descriptor());
}

// The session itself.

Session::Session(std::unique_ptr<Impl> impl) : impl_(std::move(impl)) {}

std::unique_ptr<Session> Session::open(int in, int out, SessionConfig config) {
    OwnedDescriptor ownedIn(in);
    OwnedDescriptor ownedOut(in == out ? -1 : out);
    if (in == out) {
        // The two directions are watched independently, and one descriptor can be watched only once.
        ownedOut.reset(::fcntl(in, F_DUPFD_CLOEXEC, 0));
    }
    prepare(ownedIn.get());
    prepare(ownedOut.get());
    ignoreBrokenPipes();
    config.limits.tag = std::min(config.limits.tag, Limits::longestTag);
    Settlement settlement = shakeHands(ownedIn.get(), ownedOut.get(), config);
    return std::unique_ptr<Session>(
        new Session(std::make_unique<Impl>(ownedIn, ownedOut, std::move(config), std::move(settlement))));
}

Session::~Session() {
    if (impl_->abandoned) {
        // The thread exists only in the parent, and the descriptors' numbers may belong to others by now: nothing in
        // here can be torn down.
        static_cast<void>(impl_.release());
        return;
    }
    impl_->close(std::chrono::milliseconds(0));
}

const Peer& Session::peer() const noexcept {
    return impl_->settlement.peer;
}

const std::unordered_map<std::string, std::string>& Session::features() const noexcept {
    return impl_->settlement.features;
}

const std::shared_ptr<const serialization::Registry>& Session::registry() const noexcept {
    return impl_->settlement.registry;
}

void Session::start(SessionHandler& handler) {
    impl_->start(handler);
}

framing::StreamID Session::newStreamID() {
    return impl_->newStreamID();
}

void Session::send(framing::StreamID stream, const Shared<exchange::Message>& message) {
    impl_->send(stream, message, Urgency::Output);
}

void Session::send(framing::StreamID stream, const Shared<exchange::Reply>& reply, Urgency urgency) {
    impl_->send(stream, reply, urgency);
}

void Session::send(framing::StreamID stream, const Shared<eventmgr::BaseEvent>& event, Urgency urgency) {
    impl_->send(stream, event, urgency);
}

bool Session::waitForRoom(int interrupt) {
    return impl_->waitFor(impl_->room, interrupt);
}

bool Session::waitUntilWritten(int interrupt) {
    impl_->awaitWritten();
    return impl_->waitFor(impl_->written, interrupt);
}

Traffic Session::traffic() const {
    return impl_->traffic();
}

void Session::sayGoodbye() {
    impl_->sayGoodbye();
}

void Session::close(std::chrono::milliseconds patience) {
    impl_->close(patience);
}

void Session::abort(const std::string& text) {
    impl_->abort(text);
}

void Session::abandonInChild() noexcept {
    impl_->abandonInChild();
}

}  // namespace foundation::msg_svc::transport::layers::session
