#include "qvm/Engine.hpp"

#include <pthread.h>
#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <boost/smart_ptr/make_shared.hpp>
#include <chrono>
#include <utility>

#include "cmddistributor/EvalIIP.hpp"
#include "cmddistributor/FEvalIIP.hpp"
#include "cmddistributor/FEvalResult.hpp"
#include "cmddistributor/IIPCancelReply.hpp"
#include "cmddistributor/IIPStateEvent.hpp"
#include "common/Build.hpp"
#include "common/Precheck.hpp"
#include "foundation/core/posix/SignalsBlocked.hpp"
#include "korvel/lang/diagnostic/IssuedEnabledWarningEvent.hpp"
#include "korvel/lang/diagnostic/IssuedWarningEvent.hpp"
#include "krutil/capabilities_api/CapabilitiesChanged.hpp"
#include "krutil/cmddistributor/IIPReply.hpp"
#include "krutil/eventmgr/QVMShutdownEvent.hpp"
#include "krutil/io/PrintableErrorEvent.hpp"
#include "krutil/io/SinkTextEvent.hpp"
#include "krutil/io/TextBaseEvent.hpp"
#include "msg_svc/protobuf/ustring.hpp"
#include "qvm/process/ForkedChild.hpp"
#include "qvm/python/EngineModule.hpp"
#include "qvm/python/WarningRecord.hpp"

namespace qvm {
namespace {

namespace session_layer = foundation::msg_svc::transport::layers::session;

using namespace krutil::cmddistributor::WhenToDequeue;
using capabilities::Capability;
using cmddistributor::DebugLoopEvent;
using cmddistributor::EvalIIP;
using cmddistributor::FEvalIIP;
using cmddistributor::FEvalResult;
using cmddistributor::IIPCancelMessage;
using cmddistributor::IIPCancelReply;
using cmddistributor::IIPEnqueueMessage;
using cmddistributor::IIPResult;
using cmddistributor::RuntimeException;
using foundation::msg_svc::eventmgr::BaseEvent;
using foundation::msg_svc::exchange::Message;
using foundation::msg_svc::exchange::Reply;
using korvel::lang::diagnostic::Warning;
using krutil::capabilities_api::CapabilitiesChanged;
using krutil::cmddistributor::IIPReply;
using krutil::cmddistributor::inCOMM_ERROR;
using krutil::cmddistributor::inEXECUTION_CTRLC;
using krutil::prompt::InputRequester;
using session_layer::SessionConfig;

// How long a session that has lost its client waits for its own threads before it ends the process.
constexpr std::chrono::milliseconds kGrace{200};

RuntimeException communicationError(const std::string& text) {
    return {inCOMM_ERROR, msg_svc::protobuf::utf8_to_ustring(text), "", "", {}, {}, false};
}

// The error of a request that was cancelled.
RuntimeException interruption(const std::string& text) {
    return {inEXECUTION_CTRLC, msg_svc::protobuf::utf8_to_ustring(text), "KeyboardInterrupt", "", {}, {}, false};
}

// The answer at an input prompt that is none.
constexpr std::u16string_view kEndOfInput = u"\u0004";

// What the client must be able to do to answer there.
Capability neededAt(DequeuePoint point) {
    return point == DequeuePoint::DebugPrompt ? Capability::Debugging : Capability::InteractiveCommandLine;
}

// The command as a person would have typed it at Python's prompt.
std::u16string promptedLines(const std::u16string& command) {
    std::u16string text;
    std::size_t begin = 0;
    do {
        const std::size_t end = std::min(command.find(u'\n', begin), command.size());
        text += begin == 0 ? u">>> " : u"... ";
        text.append(command, begin, end - begin);
        text += u'\n';
        begin = end + 1;
    } while (begin < command.size());
    return text;
}

}  // namespace

Engine::Engine(const Options& options, Log& log)
    : options_(options),
      log_(log),
      diary_(options.diary),
      queue_(options.queue),
      capabilities_({Capability::Debugging, Capability::InteractiveCommandLine}) {}

Engine::~Engine() = default;

ExitCode Engine::run(int in, int out) {
    SessionConfig config;
    config.role = session_layer::Role::Engine;
    config.build = apps::buildString("krutil-qvm");
    config.limits = options_.limits;
    config.capabilities = capabilities_.lists().engine;
    if (!options_.noPrecheck) {
        config.check = apps::precheck;
    }
    config.handshakeTimeout = options_.handshakeTimeout;
    try {
        session_ = Session::open(in, out, std::move(config));
    } catch (const session_layer::HandshakeRefused& error) {
        log_.say(error.what());
        return ExitCode::Refused;
    } catch (const session_layer::ProtocolViolation& error) {
        log_.say(error.what());
        return ExitCode::Violation;
    } catch (const session_layer::StreamLost& error) {
        log_.say(error.what());
        return ExitCode::Lost;
    }
    log_.note("session with " + session_->peer().build);

    capabilities_.setClient(session_->peer().capabilities);

    ForkGuard guard(*session_);
    TextOutput::Settings settings;
    // A UTF-16 unit is at most three bytes on the wire; the rest of an event is small.
    settings.maxUnits = static_cast<std::size_t>(
        std::clamp<std::uint64_t>(session_->peer().limits.taggedFrame / 8, 16, settings.maxUnits));
    {
        posix::SignalsBlocked blocked;
        output_ = std::make_unique<TextOutput>(
            settings, [this](const TextTarget& target, std::u16string text) { emitText(target, std::move(text)); });
        capture_ = std::make_unique<OutputCapture>(
            [this](int descriptor, const std::u16string& text) {
                output_->write(descriptor == STDERR_FILENO ? TextSource::PlainError : TextSource::PlainOutput, text);
            },
            [this] { session_->waitForRoom(); });
        session_->start(*this);
    }
    installEngineModule(*output_, *session_, *this);
    try {
        serve();
    } catch (const std::exception& error) {
        log_.say(std::string("The engine has failed: ") + error.what());
        session_->abort(std::string("The engine has failed: ") + error.what());
    }
    {
        std::lock_guard lock(exchangeMutex_);
        leaving_ = true;
    }
    exchangeChanged_.notify_all();
    session_->close();
    return exitCode_;
}

void Engine::serve() {
    python_ = std::make_unique<Interpreter>(recordBounds());
    descriptors_.emplace();
    loop();
    queue_.close();
    for (const Request& request : queue_.takeAll()) {
        refuse(request, "The session ended before this request was started.", Session::Urgency::Output);
    }
    python_->finish();
    capture_->finish();
    output_->flush();
    std::lock_guard lock(exchangeMutex_);
    session_->send(0, boost::shared_ptr<const BaseEvent>(boost::make_shared<krutil::eventmgr::QVMShutdownEvent>()));
    shutdownSent_ = true;
}

void Engine::loop() {
    while (const std::optional<Request> request = next()) {
        if (request->requeued) {
            raise<cmddistributor::IIPReactivatedEvent>(*request);
        }
        if (!handle(*request, nullptr)) {
            return;
        }
        settle();
    }
}

// Running code may have closed what the threads of this process wait with. Nothing can be sent or waited for then; the
// client finds its stream at an end.
void Engine::checkDescriptors() {
    if (descriptors_->areOpen()) {
        return;
    }
    // A session that is over has closed its own, and says so at once.
    std::unique_lock lock(exchangeMutex_);
    if (!exchangeChanged_.wait_for(lock, kGrace, [this] { return sessionOver_; })) {
        log_.say("Running code has closed descriptors of the engine, so its session cannot go on.");
        ::_exit(static_cast<int>(ExitCode::Lost));
    }
}

// Outputs are sent from Python's own memory, which the next request might change. And a client that only sends must not
// make this process grow. A cancel ends the wait, so what was returned at a prompt has been copied.
void Engine::settle() {
    python_->unlocked([this] { session_->waitUntilWritten(cancellation_.descriptor()); });
    python_->dropReleased();
}

std::optional<Request> Engine::next() {
    while (true) {
        RequestQueue::Wait wait = RequestQueue::Wait::Interrupted;
        {
            posix::SignalsBlocked blocked;
            python_->handleSignals();
            python_->unlocked(
                [&] { wait = queue_.wait(DequeuePoint::Idle, python_->releasedDescriptor(), {}, blocked.before()); });
        }
        python_->handleSignals();
        if (wait == RequestQueue::Wait::Closed) {
            return std::nullopt;
        }
        if (wait == RequestQueue::Wait::Interrupted) {
            python_->dropReleased();
            continue;
        }
        std::lock_guard lock(exchangeMutex_);
        // A cancel may have been faster.
        if (std::optional<Request> request = queue_.take(DequeuePoint::Idle)) {
            cancellation_.begin(request->id());
            return request;
        }
    }
}

bool Engine::refused(const Request& request) {
    const cmddistributor::IIP* const iip = request.message->getIIP().get();
    std::string why = capabilities_.lacking(request.message->getCapabilities());
    if (dynamic_cast<const EvalIIP*>(iip) == nullptr && dynamic_cast<const FEvalIIP*>(iip) == nullptr) {
        why = "This engine evaluates code and calls functions only.";
    }
    if (why.empty()) {
        return false;
    }
    cancellation_.end();
    refuse(request, why, Session::Urgency::Output);
    return true;
}

// Runs a request that cancellation_ knows already. Returns whether the session goes on.
bool Engine::handle(const Request& request, PyObject* frame) {
    if (refused(request)) {
        return true;
    }
    raise<cmddistributor::IIPStartedEvent>(request);
    output_->begin(request);
    running_.push_back(&request);
    bool exit = false;
    std::unique_ptr<IIPResult> result = runCode(request, frame, exit);
    running_.pop_back();
    raise<cmddistributor::IIPCompletedEvent>(request);
    raise<cmddistributor::LastIIPEvent>(request);
    reply(request, std::move(result), Session::Urgency::Output);
    return !exit;
}

std::unique_ptr<IIPResult> Engine::runCode(const Request& request, PyObject* frame, bool& exit) {
    Interpreter::CallOutcome outcome;
    const auto* const call = dynamic_cast<const FEvalIIP*>(request.message->getIIP().get());
    if (call != nullptr) {
        // A cancel of the code that a prompt holds up does not wait for the reply to be read: that code may then change
        // what it returned.
        const bool atPrompt = running_.size() > 1;
        outcome = python_->call(*call, atPrompt ? Interpreter::Outputs::Copied : Interpreter::Outputs::Shared);
    } else {
        echo(request);
        static_cast<Interpreter::Outcome&>(outcome) =
            python_->evaluate(dynamic_cast<const EvalIIP&>(*request.message->getIIP()), frame);
    }
    checkDescriptors();
    capture_->finish();
    const bool toldToStop = cancellation_.end();
    if (running_.size() == 1) {
        // Nothing runs any more, so nothing is interrupted. Inside a prompt the code that it holds up is still to be.
        python_->handleSignals();
    }
    output_->end();
    exit = outcome.exit;
    if (toldToStop) {
        // The cancel was answered, but the code ended first.
        outcome.error = interruption("");
        outcome.printed.clear();
    }
    if (outcome.error && !outcome.printed.empty()) {
        publish(request.stream, boost::make_shared<const krutil::io::PrintableErrorEvent>(request.id(), *outcome.error,
                                                                                          std::move(outcome.printed)));
    }
    // A function's result that carries an error would be read without it, so a failed call has a plain one.
    if (call == nullptr || outcome.error || exit) {
        return std::make_unique<IIPResult>(request.id(), std::move(outcome.error));
    }
    return std::make_unique<FEvalResult>(request.id(), std::move(outcome.outputs));
}

PromptEnd Engine::prompt(InputRequester loop, PyObject* frame, RequestQueue::Deadline deadline) {
    const DequeuePoint point = loop == InputRequester::mnDEBUG_PROMPT   ? DequeuePoint::DebugPrompt
                               : loop == InputRequester::mnPAUSE_PROMPT ? DequeuePoint::Pause
                                                                        : DequeuePoint::Prompt;
    Prompt opened{*current(), point, frame, nullptr, deadline};
    const PromptEnd end = hold(opened, loop);
    return end == PromptEnd::Quit && point == DequeuePoint::Pause ? PromptEnd::Continued : end;
}

PromptEnd Engine::readText(std::u16string& text) {
    Prompt opened{*current(), DequeuePoint::InputPrompt, nullptr, &text};
    return hold(opened, InputRequester::mnINPUT_PROMPT);
}

PromptEnd Engine::hold(Prompt& prompt, InputRequester loop) {
    const Request& outer = prompt.outer;
    const auto raiseLoop = [&](DebugLoopEvent::State state) {
        publish(outer.stream, boost::make_shared<const DebugLoopEvent>(outer.id(), state, loop));
    };
    capture_->drain();
    output_->suspend();
    raise<cmddistributor::IIPSuspendedEvent>(outer);
    raiseLoop(DebugLoopEvent::ENTER);
    prompts_.push_back(&prompt);
    const PromptEnd end = attend(prompt);
    {
        std::lock_guard lock(exchangeMutex_);
        for (const Request& left : queue_.closeBatch(static_cast<unsigned>(prompts_.size()))) {
            raise<cmddistributor::IIPRequeuedEvent>(left);
        }
    }
    prompts_.pop_back();
    raiseLoop(DebugLoopEvent::EXIT);
    raise<cmddistributor::IIPResumedEvent>(outer);
    output_->end();
    return end;
}

PromptEnd Engine::attend(Prompt& prompt) {
    const auto batch = static_cast<unsigned>(prompts_.size());
    while (!prompt.end) {
        // What the client sent while it could be asked is an answer still.
        const bool withdrawn = !capabilities_.lists().client.contains(neededAt(prompt.point));
        const RequestQueue::Deadline deadline = withdrawn ? std::chrono::steady_clock::now() : prompt.deadline;
        RequestQueue::Wait wait = RequestQueue::Wait::Interrupted;
        {
            posix::SignalsBlocked blocked;
            if (interrupted()) {
                return PromptEnd::Raised;
            }
            python_->unlocked(
                [&] { wait = queue_.wait(prompt.point, cancellation_.descriptor(), deadline, blocked.before()); });
        }
        if (interrupted()) {
            return PromptEnd::Raised;
        }
        switch (wait) {
            case RequestQueue::Wait::Closed:
                return prompt.text != nullptr ? PromptEnd::EndOfInput : PromptEnd::Quit;
            case RequestQueue::Wait::TimedOut:
                return withdrawn ? PromptEnd::Withdrawn : PromptEnd::Continued;
            case RequestQueue::Wait::Interrupted:
                continue;
            case RequestQueue::Wait::Due:
                break;
        }
        {
            std::lock_guard lock(exchangeMutex_);
            for (const Request& again : queue_.takeBatch(batch, prompt.point)) {
                raise<cmddistributor::IIPReactivatedEvent>(again);
            }
        }
        while (!prompt.end) {
            std::optional<Request> request;
            {
                std::lock_guard lock(exchangeMutex_);
                request = queue_.takeOfBatch(batch);
                if (!request) {
                    break;
                }
                cancellation_.begin(request->id());
            }
            answer(prompt, *request);
            if (interrupted()) {
                return PromptEnd::Raised;
            }
        }
    }
    return *prompt.end;
}

void Engine::answer(Prompt& prompt, const Request& request) {
    if (prompt.text == nullptr) {
        const WhenToDequeue mode = request.message->getDequeueMode();
        const bool admitted = !refused(request);
        if (admitted && !handle(request, prompt.frame)) {
            prompt.end = PromptEnd::Exit;
        } else if (admitted && prompt.point == DequeuePoint::Pause && !prompt.end && mode != DEQUEUE_AT_PPE) {
            prompt.end = PromptEnd::Continued;
        }
        settle();
        return;
    }
    const auto* const eval = dynamic_cast<const EvalIIP*>(request.message->getIIP().get());
    if (eval == nullptr) {
        cancellation_.end();
        refuse(request, "An input prompt takes a line of text, not a function call.", Session::Urgency::Output);
        return;
    }
    if (refused(request)) {
        return;
    }
    *prompt.text = eval->getCommand();
    prompt.end = *prompt.text == kEndOfInput ? PromptEnd::EndOfInput : PromptEnd::Continued;
    raise<cmddistributor::IIPStartedEvent>(request);
    cancellation_.end();
    raise<cmddistributor::IIPCompletedEvent>(request);
    raise<cmddistributor::LastIIPEvent>(request);
    reply(request, std::make_unique<IIPResult>(request.id(), boost::none), Session::Urgency::Output);
}

// Whether running code is to go on with an exception, which is set.
bool Engine::interrupted() {
    if (cancellation_.takeInterrupt()) {
        PyErr_SetNone(PyExc_KeyboardInterrupt);
        return true;
    }
    return PyErr_CheckSignals() != 0;
}

const Request* Engine::current() const noexcept {
    const bool held = !prompts_.empty() && !running_.empty() && &prompts_.back()->outer == running_.back();
    return running_.empty() || held ? nullptr : running_.back();
}

bool Engine::canUse(Capability capability) {
    return std::this_thread::get_id() == mainThread_ && current() != nullptr &&
           capabilities_.lists().inForce.contains(capability);
}

bool Engine::leavePrompt(PromptEnd end) {
    if (std::this_thread::get_id() != mainThread_ || prompts_.empty() || prompts_.back()->text != nullptr) {
        return false;
    }
    prompts_.back()->end = end;
    return true;
}

void Engine::issueWarning(Warning warning) {
    output_->flush();
    const std::size_t units = session_->peer().limits.taggedFrame / 8;
    if (!raiseWarning<korvel::lang::diagnostic::IssuedWarningEvent>(warning)) {
        warning = shortened(warning, units);
        raiseWarning<korvel::lang::diagnostic::IssuedWarningEvent>(warning);
    }
    if (!warning.getWasDisabled() && !raiseWarning<korvel::lang::diagnostic::IssuedEnabledWarningEvent>(warning)) {
        raiseWarning<korvel::lang::diagnostic::IssuedEnabledWarningEvent>(shortened(warning, units));
    }
}

template <class EventT>
bool Engine::raiseWarning(const Warning& warning) {
    const Request* const request = std::this_thread::get_id() == mainThread_ ? current() : nullptr;
    using foundation::msg_svc::exchange::IDType;
    // Threads of running code may issue warnings to the very end.
    std::lock_guard lock(exchangeMutex_);
    return shutdownSent_ ||
           publish(request != nullptr ? request->stream : 0,
                   boost::make_shared<const EventT>(request != nullptr ? request->id() : IDType(), warning));
}

void Engine::setDebugging(bool on) {
    const Capabilities::Lists before = capabilities_.lists();
    capabilities_.setEngine(Capability::Debugging, on);
    const Capabilities::Lists now = capabilities_.lists();
    if (now.engine == before.engine) {
        return;
    }
    const Request* const request = std::this_thread::get_id() == mainThread_ ? current() : nullptr;
    output_->flush();
    std::lock_guard lock(exchangeMutex_);
    if (!shutdownSent_) {
        publish(0, boost::make_shared<const CapabilitiesChanged>(
                       before.inForce, now.engine, now.client,
                       request != nullptr ? request->message->getCapabilities() : Capabilities::List()));
    }
}

int Engine::interruptDescriptor() {
    return std::this_thread::get_id() == mainThread_ ? cancellation_.descriptor() : -1;
}

bool Engine::takeInterrupt() {
    return cancellation_.takeInterrupt();
}

bool Engine::repeatInterrupt() {
    return std::this_thread::get_id() == mainThread_ && cancellation_.repeatInterrupt();
}

bool Engine::drainDescriptors() {
    return capture_->drain();
}

void Engine::echo(const Request& request) {
    const auto& eval = dynamic_cast<const EvalIIP&>(*request.message->getIIP());
    const bool toOutput = eval.getOutTraits().getUseEcho();
    const bool toError = eval.getErrTraits().getUseEcho();
    if (!toOutput && !toError) {
        return;
    }
    // Through the wire's encoding and back, which makes any text well-formed.
    const std::u16string text =
        msg_svc::protobuf::utf8_to_ustring(msg_svc::protobuf::ustring_to_utf8(promptedLines(eval.getCommand())));
    if (toOutput) {
        output_->write(TextSource::ShownOutput, text);
    }
    if (toError) {
        output_->write(TextSource::ShownError, text);
    }
}

void Engine::refuse(const Request& request, const std::string& why, Session::Urgency urgency) {
    discard(request, communicationError(why), urgency);
}

void Engine::discard(const Request& request, RuntimeException error, Session::Urgency urgency) {
    raise<cmddistributor::IIPDiscardedEvent>(request, urgency);
    raise<cmddistributor::LastIIPEvent>(request, urgency);
    reply(request, std::make_unique<IIPResult>(request.id(), std::move(error)), urgency);
}

void Engine::reply(const Request& request, std::unique_ptr<IIPResult> result, Session::Urgency urgency) {
    const auto send = [&](std::unique_ptr<IIPResult> carried) {
        const boost::shared_ptr<const Reply> message =
            boost::make_shared<const IIPReply>(request.id(), std::move(carried));
        session_->send(request.stream, message, urgency);
    };
    std::string problem;
    try {
        send(std::move(result));
        return;
    } catch (const std::exception& error) {
        problem = error.what();
    }
    send(std::make_unique<IIPResult>(request.id(),
                                     communicationError("The result of this request cannot be sent: " + problem)));
}

template <class EventT>
void Engine::raise(const Request& request, Session::Urgency urgency) noexcept {
    publish(request.stream, boost::make_shared<const EventT>(request.id()), urgency);
}

// Returns false for an event that cannot be sent: whatever it is, the reply is to come.
bool Engine::publish(framing::StreamID stream, const boost::shared_ptr<const BaseEvent>& event,
                     Session::Urgency urgency) noexcept {
    try {
        session_->send(stream, event, urgency);
        return true;
    } catch (const std::exception& error) {
        log_.say(std::string("An event cannot be sent: ") + error.what());
        return false;
    }
}

void Engine::emitText(const TextTarget& target, std::u16string text) noexcept {
    try {
        if (target.diary || target.log) {
            const std::string utf8 = msg_svc::protobuf::ustring_to_utf8(text);
            if (target.diary) {
                diary_.append(utf8);
            }
            if (target.log) {
                log_.note("text of " + toString(target.id) + ": " + utf8);
            }
        }
        boost::shared_ptr<const BaseEvent> event;
        if (target.shown) {
            event = boost::make_shared<const krutil::io::SinkTextEvent>(target.id, target.type, std::move(text));
        } else {
            event = boost::make_shared<const krutil::io::TextBaseEvent>(target.id, target.type, std::move(text));
        }
        // Threads of running code may write to the very end.
        std::lock_guard lock(exchangeMutex_);
        if (!shutdownSent_) {
            session_->send(target.stream, event);
        }
    } catch (const std::exception& error) {
        log_.say(std::string("Text cannot be sent: ") + error.what());
    }
}

RecordBounds Engine::recordBounds() const noexcept {
    RecordBounds bounds;
    bounds.totalBytes =
        static_cast<std::size_t>(std::min<std::uint64_t>(bounds.totalBytes, session_->peer().limits.taggedFrame / 2));
    return bounds;
}

void Engine::onMessage(framing::StreamID stream, const boost::shared_ptr<const Message>& message) {
    std::lock_guard lock(exchangeMutex_);
    if (shutdownSent_) {
        return;
    }
    if (const auto enqueued = boost::dynamic_pointer_cast<const IIPEnqueueMessage>(message)) {
        enqueue(stream, enqueued);
    } else if (const auto* const cancelled = dynamic_cast<const IIPCancelMessage*>(message.get())) {
        cancel(stream, *cancelled);
    } else {
        throw session_layer::ProtocolViolation("The engine cannot act on a message of this kind.");
    }
}

void Engine::enqueue(framing::StreamID stream, const boost::shared_ptr<const IIPEnqueueMessage>& message) {
    const Request request{stream, message};
    const RequestQueue::Bounds& bounds = queue_.bounds();
    switch (queue_.put(request)) {
        case RequestQueue::Put::Taken:
            break;
        case RequestQueue::Put::TooMany:
            refuse(request,
                   "The engine's queue is full: " + std::to_string(bounds.count) +
                       " requests wait already, which is the engine's bound. Send this one again when some are done.",
                   Session::Urgency::Answer);
            break;
        case RequestQueue::Put::TooLarge:
            refuse(request,
                   "The engine's queue is full: with this request, those that wait would hold more than " +
                       std::to_string(bounds.bytes) +
                       " bytes, which is the engine's bound. Send it again when some are done, or send less at a time.",
                   Session::Urgency::Answer);
            break;
        case RequestQueue::Put::Closed:
            refuse(request, "The session ended before this request was started.", Session::Urgency::Answer);
            break;
    }
}

// The lock is held, so the request does not change its state meanwhile.
void Engine::cancel(framing::StreamID stream, const IIPCancelMessage& message) {
    IIPCancelReply::CancelStatus status = IIPCancelReply::UNABLE_TO_CANCEL_ALREADY_DONE;
    if (const std::optional<Request> waiting = queue_.remove(message.getID())) {
        discard(*waiting, interruption("The request was cancelled before it was started."), Session::Urgency::Answer);
        status = IIPCancelReply::SUCCESSFUL_CANCEL;
    } else {
        switch (cancellation_.cancel(message.getID(), message.getEvenIfRunning())) {
            case Cancellation::Outcome::NotRunning:
                break;
            case Cancellation::Outcome::Running:
                status = IIPCancelReply::UNABLE_TO_CANCEL_ALREADY_RUNNING;
                break;
            case Cancellation::Outcome::Interrupted:
                status = IIPCancelReply::PENDING_CANCEL;
                break;
        }
    }
    session_->send(stream, boost::shared_ptr<const Reply>(boost::make_shared<const IIPCancelReply>(status)),
                   Session::Urgency::Answer);
}

void Engine::onEvent(framing::StreamID, const boost::shared_ptr<const BaseEvent>& event) {
    if (const auto* const changed = dynamic_cast<const CapabilitiesChanged*>(event.get())) {
        capabilities_.setClient(changed->getClientCapabilities());
        // A prompt looks whether the client can still answer.
        queue_.interruptWait();
    }
}

void Engine::onGoodbye() {
    queue_.end();
}

void Engine::onEnd(const SessionEnd& end) {
    ExitCode code = ExitCode::Ok;
    switch (end.reason) {
        case SessionEnd::Reason::Finished:
        case SessionEnd::Reason::Closed:
            break;
        case SessionEnd::Reason::Lost:
            code = ExitCode::Lost;
            break;
        case SessionEnd::Reason::Violation:
            code = ExitCode::Violation;
            break;
    }
    if (end.text.empty()) {
        log_.note("session ended");
    } else {
        log_.say(end.text);
    }
    queue_.close();
    std::unique_lock lock(exchangeMutex_);
    exitCode_ = code;
    sessionOver_ = true;
    exchangeChanged_.notify_all();
    // Nobody listens any more, so running code is not waited for.
    if (!exchangeChanged_.wait_for(lock, kGrace, [this] { return leaving_; })) {
        ::_exit(static_cast<int>(code));
    }
}

}  // namespace qvm
