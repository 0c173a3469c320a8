// A session and how it ends. Somewhat long, because each way to its end is told beside the others.

#include "foundation/msg_svc/transport/layers/session/Session.hpp"

#include <algorithm>
#include <atomic>
#include <mutex>
#include <stdexcept>
#include <system_error>
#include <type_traits>
#include <utility>
#include <vector>

#include "foundation/msg_svc/transport/layers/session/Asio.hpp"
#include "foundation/msg_svc/transport/layers/session/Exchanges.hpp"
#include "foundation/msg_svc/transport/layers/session/Handshake.hpp"
#include "foundation/msg_svc/transport/layers/session/Incoming.hpp"
#include "foundation/msg_svc/transport/layers/session/IoThread.hpp"
#include "foundation/msg_svc/transport/layers/session/LastResort.hpp"
#include "foundation/msg_svc/transport/layers/session/ObjectWriter.hpp"
#include "foundation/msg_svc/transport/layers/session/Outgoing.hpp"
#include "foundation/msg_svc/transport/layers/session/PrintableText.hpp"
#include "foundation/msg_svc/transport/layers/session/RefusalTexts.hpp"
#include "foundation/msg_svc/transport/layers/session/StreamDescriptors.hpp"

namespace foundation::msg_svc::transport::layers::session {
namespace {

template <class T>
using Shared = boost::shared_ptr<const T>;

// How long an abort's reason may take to reach a peer that is slow to read, and how long the end of the stream may take
// to show after a write has failed: what the peer said last is often why it closed.
constexpr std::chrono::milliseconds lingerTime{1'000};
constexpr std::chrono::milliseconds writeFailureGrace{1'000};

template <class T>
Saying sayingOf(const T& object, const SessionConfig& config) {
    if constexpr (std::is_same_v<T, eventmgr::BaseEvent>) {
        return sayingOfEvent(typeid(object), config);
    } else {
        return std::is_same_v<T, exchange::Reply> ? Saying::Reply : Saying::Message;
    }
}

}  // namespace

/// Owns the I/O thread and the parts, and decides how the session ends.
class Session::Impl final : private Incoming::Owner, private Outgoing::Owner {
  public:
    Impl(StreamDescriptors& stream, SessionConfig config, Settlement settlement);

    void start(SessionHandler& handler);
    template <class T>
    void send(framing::StreamID stream, const Shared<T>& object, Urgency urgency);
    void sayGoodbye();
    void sendHeld();
    bool waitForRoom(int interrupt);
    bool waitUntilWritten(int interrupt);
    void close(std::chrono::milliseconds patience);
    void abort(const std::string& text);
    void abandonInChild() noexcept;
    framing::StreamID newStreamID();
    Traffic traffic() const;

    const SessionConfig config;
    const Settlement settlement;
    std::atomic<bool> abandoned{false};

  private:
    // How far the session has come to its end. It goes forward only.
    enum class Stage {
        Open,
        Closing,  // close() was called; what is unwritten is being written
        Ending,   // why it ends is decided; an abort may still be on its way out
        Down,     // the descriptors are closed, and the handler knows
    };

    // Any thread. `say` runs with the mutex of the exchanges held; it may throw, or return false to send nothing.
    template <class Say>
    void submit(OutgoingPieces message, Outgoing::Hold hold, Say say);
    template <class Write>
    auto orEnd(Write write);
    bool isDone(Role role) const;

    // I/O thread.
    void onViolation(const std::string& text) override { finish({SessionEnd::Reason::Violation, text}, text); }
    void onPeerAbort(const std::string& reason) override;
    void onEndOfStream() override;
    void onReadFailed(const std::string& why) override;
    void onWritten(bool all) override;
    void onWriteFailed(int error) override;
    void onHangUp() override;
    bool advance(Stage next);
    void beginClose(std::chrono::milliseconds patience);
    SessionEnd ownEnd() const;
    bool shutdownWritten() const { return isDone(Role::Engine) && outgoing_.isDrained(); }
    void lose(const std::string& text) { finish({SessionEnd::Reason::Lost, text}, {}); }
    void finish(SessionEnd end, const std::string& abortReason);
    void closeDown();
    void onOutOfMemory();

    const ObjectWriter writer_;
    SharedExchanges exchanges_;
    asio::io_context io_{1};
    IoThread thread_{io_};
    asio::steady_timer timer_{io_};
    Outgoing outgoing_;
    const std::unique_ptr<lending::SharedMemory> shared_;  // null without shared memory
    KeepAlive keepAlive_;
    Incoming incoming_;
    LastResort lastResort_;

    // Of the I/O thread.
    SessionHandler* handler_ = nullptr;
    Stage stage_ = Stage::Open;
    int writeError_ = 0;
    SessionEnd end_{SessionEnd::Reason::Closed, {}};
    SessionEnd outOfMemory_{SessionEnd::Reason::Lost, "there is no memory left for the session"};
};

Session::Impl::Impl(StreamDescriptors& stream, SessionConfig sessionConfig, Settlement settled)
    : config(std::move(sessionConfig)),
      settlement(std::move(settled)),
      writer_(settlement.registry,
              PeerLimits(settlement.peer.limits, config.role == Role::Client ? "the engine" : "the client",
                         settlement.arrayTag, config.check)),
      exchanges_(config.role),
      outgoing_(io_, stream.out, config.roomBytes, config.recorder, *this),
      shared_(settlement.sharedMemory ? std::make_unique<lending::SharedMemory>(config.role, outgoing_) : nullptr),
      keepAlive_(io_, config, settlement.keepAlive, exchanges_, outgoing_),
      incoming_(io_, stream.in, config, settlement.registry, settlement.arrayTag, exchanges_, outgoing_, shared_.get(),
                keepAlive_, *this),
      lastResort_(io_, [this] { onOutOfMemory(); }) {
    // Here and not when it is needed, because an end of the session must not fail.
    thread_.start([this] { onOutOfMemory(); });
}

void Session::Impl::start(SessionHandler& handler) {
    asio::post(io_, [this, &handler] {
        handler_ = &handler;
        if (stage_ == Stage::Down) {
            handler_->onEnd(end_);
        } else {
            incoming_.start(handler);
            keepAlive_.start();
        }
    });
}

framing::StreamID Session::Impl::newStreamID() {
    const std::lock_guard lock(exchanges_.mutex);
    return exchanges_.exchanges.newStreamID();
}

bool Session::Impl::isDone(Role role) const {
    const std::lock_guard lock(exchanges_.mutex);
    return exchanges_.exchanges.isDone(role);
}

Traffic Session::Impl::traffic() const {
    return {outgoing_.written(), incoming_.contentSize(), incoming_.contentArrived()};
}

// Sending.

template <class T>
void Session::Impl::send(framing::StreamID stream, const Shared<T>& object, Urgency urgency) {
    if (abandoned) {
        return;
    }
    if (!object) {
        throw std::invalid_argument("Session::send: expected an object, got a null pointer");
    }
    if (!outgoing_.isOpen()) {
        return;
    }
    auto frames = writer_.write(stream, object);
    if (config.trace) {
        for (const auto& frame : frames) {
            config.trace({true, frame == frames.back(), *frame});
        }
    }
    const Outgoing::Hold hold = urgency == Urgency::Held ? Outgoing::Hold::Yes : Outgoing::Hold::No;
    submit(OutgoingPieces(std::move(frames), urgency == Urgency::Answer, shared_ ? &shared_->lender : nullptr), hold,
           [&] {
               const T& referenced = *object;
               const Saying saying = sayingOf(referenced, config);
               if (const auto refusal = exchanges_.exchanges.send(saying, stream)) {
                   throw std::logic_error("Session::send: " +
                                          refusalToSend(*refusal, saying, config.role, stream, typeid(referenced)));
               }
               if (saying == Saying::Shutdown && shared_) {
                   // Nothing follows it. The end of the session gives back what is left.
                   shared_->borrower.close();
               }
               return true;
           });
}

// What was said and not written cannot be taken back, so a session without memory for it is over.
template <class Write>
auto Session::Impl::orEnd(Write write) {
    try {
        return write();
    } catch (const std::bad_alloc&) {
        lastResort_.call();
        throw;
    }
}

template <class Say>
void Session::Impl::submit(OutgoingPieces message, Outgoing::Hold hold, Say say) {
    // Dropped when the lock is released.
    std::vector<OutgoingPieces> done;
    const std::lock_guard lock(exchanges_.mutex);
    if (outgoing_.isOpen() && say()) {
        orEnd([&] { done = outgoing_.push(std::move(message), hold); });
    }
}

void Session::Impl::sendHeld() {
    if (!abandoned) {
        orEnd([this] { outgoing_.sendHeld(); });
    }
}

bool Session::Impl::waitForRoom(int interrupt) {
    return abandoned || orEnd([&] { return outgoing_.waitForRoom(interrupt); });
}

bool Session::Impl::waitUntilWritten(int interrupt) {
    return abandoned || orEnd([&] { return outgoing_.waitUntilWritten(interrupt); });
}

void Session::Impl::sayGoodbye() {
    if (abandoned) {
        return;
    }
    submit(OutgoingPieces(FrameKind::Goodbye, {}), Outgoing::Hold::No, [this] {
        const auto refusal = exchanges_.exchanges.send(Saying::Goodbye, 0);
        if (refusal == Refusal::WrongSpeaker) {
            throw std::logic_error("Session::sayGoodbye: " +
                                   refusalToSend(*refusal, Saying::Goodbye, config.role, 0, typeid(void)));
        }
        return !refusal;
    });
}

// What the parts tell.

void Session::Impl::onPeerAbort(const std::string& reason) {
    finish({SessionEnd::Reason::Violation, "the peer closed the session: " + sentence(reason)}, {});
}

void Session::Impl::onReadFailed(const std::string& why) {
    lose("cannot read from the stream: " + why);
}

void Session::Impl::onEndOfStream() {
    const bool boundary = incoming_.atBoundary();
    const bool client = config.role == Role::Client;
    if (boundary && !client && isDone(Role::Client)) {
        // A client that has said goodbye may end its direction of the stream. When it has ended both, nobody waits for
        // what is to come, which may take for ever.
        incoming_.stop();
        if (writeError_ != 0) {
            lose(cannotWrite(writeError_));
        } else {
            outgoing_.awaitHangUp();
        }
        return;
    }
    if (boundary && (client ? isDone(Role::Engine) : shutdownWritten())) {
        finish({SessionEnd::Reason::Finished, {}}, {});
        return;
    }
    std::string text = "the stream ended " + incoming_.position();
    if (boundary) {
        text += client ? ", before the engine's shutdown event" : ", without the client's goodbye";
    }
    if (writeError_ != 0) {
        text += "; writing to it had failed: " + std::generic_category().message(writeError_);
    }
    lose(text);
}

void Session::Impl::onHangUp() {
    if (shutdownWritten()) {
        finish({SessionEnd::Reason::Finished, {}}, {});
    } else {
        lose("the client has gone before the engine's shutdown event");
    }
}

void Session::Impl::onWritten(bool all) {
    if (all && stage_ == Stage::Ending) {
        closeDown();
    } else if (all && stage_ == Stage::Closing) {
        finish(ownEnd(), {});
    } else {
        incoming_.resume();
    }
}

void Session::Impl::onWriteFailed(int error) {
    writeError_ = error;
    const std::string text = cannotWrite(error);
    if (stage_ == Stage::Ending) {
        closeDown();
    } else if (stage_ == Stage::Closing) {
        finish(ownEnd(), {});
    } else if (incoming_.isStopped()) {
        lose(text);
    } else {
        timer_.expires_after(writeFailureGrace);
        timer_.async_wait([this, text](const ErrorCode& waitError) {
            if (!waitError) {
                lose(text);
            }
        });
        incoming_.resume();
    }
}

// Ending.

// Whether the session goes on to that stage now.
bool Session::Impl::advance(Stage next) {
    if (stage_ >= next) {
        return false;
    }
    stage_ = next;
    return true;
}

// What close() amounts to. An engine that could not write its last event has lost its client, whichever of the two is
// noticed first.
SessionEnd Session::Impl::ownEnd() const {
    const bool client = config.role == Role::Client;
    if (!client && writeError_ != 0) {
        return {SessionEnd::Reason::Lost, cannotWrite(writeError_)};
    }
    const bool saidAll = isDone(Role::Engine) && (client || isDone(Role::Client));
    return {saidAll && !outgoing_.hasFailed() ? SessionEnd::Reason::Finished : SessionEnd::Reason::Closed, {}};
}

void Session::Impl::beginClose(std::chrono::milliseconds patience) {
    if (!advance(Stage::Closing) && stage_ != Stage::Closing) {
        return;
    }
    outgoing_.sendHeld();
    if (outgoing_.isDrained() || outgoing_.hasFailed()) {
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
    asio::post(io_, [this, patience] {
        beginClose(patience);
        // The thread outlives the stream until somebody waits for it here, so that a session which ended before it was
        // started still tells its handler.
        thread_.release();
    });
    thread_.join();
}

void Session::Impl::abort(const std::string& text) {
    if (abandoned) {
        return;
    }
    incoming_.silence();
    asio::post(io_, [this, text] { onViolation(text); });
}

void Session::Impl::finish(SessionEnd end, const std::string& abortReason) {
    if (!advance(Stage::Ending)) {
        return;
    }
    end_ = std::move(end);
    incoming_.stop();
    outgoing_.sendHeld();
    std::optional<OutgoingPieces> abort;
    if (!abortReason.empty()) {
        // A replaced byte takes three, so a quarter of the longest reason always fits.
        abort.emplace(FrameKind::Abort, sentence(abortReason, MessageReader::longestReason / 4));
    }
    if (!outgoing_.finish(std::move(abort))) {
        closeDown();
        return;
    }
    timer_.expires_after(lingerTime);
    timer_.async_wait([this](const ErrorCode& error) {
        if (!error) {
            closeDown();
        }
    });
    outgoing_.flush();
}

void Session::Impl::closeDown() {
    if (!advance(Stage::Down)) {
        return;
    }
    incoming_.close();
    outgoing_.close();
    if (shared_) {
        shared_->close();
    }
    timer_.cancel();
    keepAlive_.stop();
    if (handler_ != nullptr) {
        handler_->onEnd(end_);
    }
}

// Whatever the thread had to do is not done. What is left to do takes no memory.
void Session::Impl::onOutOfMemory() {
    if (advance(Stage::Ending)) {
        end_ = std::move(outOfMemory_);
    }
    closeDown();
}

void Session::Impl::abandonInChild() noexcept {
    abandoned = true;
    incoming_.abandonInChild();
    outgoing_.abandonInChild();
    if (shared_) {
        shared_->borrower.abandonInChild();
    }
}

// The session itself.

Session::Session(std::unique_ptr<Impl> impl) : impl_(std::move(impl)) {}

std::unique_ptr<Session> Session::open(int in, int out, SessionConfig config) {
    StreamDescriptors stream = StreamDescriptors::takeOver(in, out);
    config.limits.tag = std::min(config.limits.tag, Limits::longestTag);
    Settlement settlement = shakeHands(stream.in.get(), stream.out.get(), config);
    return std::unique_ptr<Session>(
        new Session(std::make_unique<Impl>(stream, std::move(config), std::move(settlement))));
}

void Session::refuse(int socket, const SessionConfig& config, const std::string& refusal) {
    refuseUnheard(core::posix::OwnedDescriptor(socket), config, refusal);
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

void Session::sendHeld() {
    impl_->sendHeld();
}

bool Session::waitForRoom(int interrupt) {
    return impl_->waitForRoom(interrupt);
}

bool Session::waitUntilWritten(int interrupt) {
    return impl_->waitUntilWritten(interrupt);
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
