// The engine itself: what ties its rooms process/, python/ and requests/ together. It is a little longer than other
// files, because each of its steps hands over to all three.
#include "qvm/Engine.hpp"

#include <unistd.h>

#include <algorithm>
#include <boost/smart_ptr/make_shared.hpp>
#include <chrono>
#include <utility>
#include <variant>

#include "cmddistributor/EvalIIP.hpp"
#include "cmddistributor/FEvalIIP.hpp"
#include "cmddistributor/FEvalResult.hpp"
#include "cmddistributor/IIPCancelReply.hpp"
#include "cmddistributor/IIPStateEvent.hpp"
#include "common/Build.hpp"
#include "common/KrutilSession.hpp"
#include "common/Precheck.hpp"
#include "foundation/core/posix/SignalsBlocked.hpp"
#include "krutil/capabilities_api/CapabilitiesChanged.hpp"
#include "krutil/io/PrintableErrorEvent.hpp"
#include "msg_svc/protobuf/ustring.hpp"
#include "qvm/process/EachSecond.hpp"
#include "qvm/process/ForkedChild.hpp"
#include "qvm/python/EngineModule.hpp"
#include "qvm/python/PythonText.hpp"
#include "qvm/requests/MessageBounds.hpp"

namespace qvm {
namespace {

namespace session_layer = foundation::msg_svc::transport::layers::session;

using capabilities::Capability;
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
using krutil::cmddistributor::inEXECUTION_CTRLC;
using krutil::prompt::InputRequester;
using session_layer::SessionConfig;

// How long a session that has lost its client waits for its own threads before it ends the process.
constexpr std::chrono::milliseconds grace{200};

// The error of a request that was cancelled.
RuntimeException interruption(const std::string& text) {
    return {inEXECUTION_CTRLC, msg_svc::protobuf::utf8_to_ustring(text), "KeyboardInterrupt", "", {}, {}, false};
}

// Each session of a listening engine has a file of its own.
std::unique_ptr<apps::Recording> startRecording(const Options& options, Log& log) {
    if (options.record.file.empty()) {
        return nullptr;
    }
    apps::RecordOptions record = options.record;
    if (!options.stdio) {
        record.file += "." + std::to_string(::getpid());
    }
    return std::make_unique<apps::Recording>(record, [&log](const std::string& sentence) { log.say(sentence); });
}

// A function's result that carries an error would be read without it, so a failed call has a plain one.
std::unique_ptr<IIPResult> resultOf(const Request& request, Interpreter::Ending ending) {
    if (ending.outputs && !ending.error) {
        return std::make_unique<FEvalResult>(request.id(), std::move(*ending.outputs));
    }
    return std::make_unique<IIPResult>(request.id(), std::move(ending.error));
}

}  // namespace

Engine::Engine(const Options& options, Log& log, Seat* seat)
    : options_(options),
      log_(log),
      seat_(seat),
      recording_(startRecording(options, log)),
      diary_(options.diary, [&log](const std::string& sentence) { log.say(sentence); }),
      queue_(options.queue),
      capabilities_({Capability::Debugging, Capability::InteractiveCommandLine, Capability::WebWindow}) {}

Engine::~Engine() {
    if (timer_) {
        timer_->stop();
    }
}

ExitCode Engine::run(int in, int out) {
    apply(options_.session);
    if (!open(in, out)) {
        return finishFiles(exitCode_);
    }
    const MessageBounds bounds(session_->peer().limits);
    ForkGuard guard(*session_);
    timer_ = std::make_unique<FlushTimer>([this](FlushTimer::Time now) {
        // Text first, because it is sent then.
        const FlushTimer::Time text = output_->flushDue(now);
        return std::min(text, announcer_->flushDue(now));
    });
    announcer_ = std::make_unique<Announcer>(*session_, diary_, log_, *timer_);
    TextOutput::Settings settings;
    settings.maxUnits = bounds.textUnits;
    {
        posix::SignalsBlocked blocked;
        output_ = std::make_unique<TextOutput>(
            settings,
            [this](const TextTarget& target, std::u16string text) {
                announcer_->announceText(target, std::move(text));
            },
            [this](FlushTimer::Time due) { timer_->expect(due); });
        PromptHost& host = *this;
        prompts_ = std::make_unique<Prompts>(queue_, *announcer_, *output_, cancellation_, capabilities_, host);
        capture_ = std::make_unique<OutputCapture>(
            [this](int descriptor, const std::u16string& text) {
                output_->write(descriptor == STDERR_FILENO ? TextSource::PlainError : TextSource::PlainOutput, text);
            },
            [this] { announcer_->waitForRoom(); });
        session_->start(*this);
    }
    installEngineModule(*output_, *announcer_, *this);
    try {
        python_ = std::make_unique<Interpreter>(options_.python, bounds);
        lastWords_.emplace(*timer_);
        serve();
    } catch (const std::exception& error) {
        log_.say(std::string("The engine has failed: ") + error.what());
        session_->abort(std::string("The engine has failed: ") + error.what());
    }
    announcer_->leave();
    session_->close();
    return finishFiles(exitCode_);
}

// Says what the files of the session lack. That is in its exit code, where nothing else has gone wrong.
ExitCode Engine::finishFiles(ExitCode code) {
    bool complete = !recording_ || recording_->isComplete();
    complete = diary_.finish() && complete;
    complete = log_.finish() && complete;
    return code == ExitCode::Ok && !complete ? ExitCode::Lost : code;
}

// Shakes hands. Returns false, and sets the exit code, when there is no session.
bool Engine::open(int in, int out) {
    SessionConfig config = apps::krutilSession(session_layer::Role::Engine);
    config.build = apps::buildString("krutil-qvm");
    config.limits = options_.limits;
    config.capabilities = capabilities_.lists().engine;
    config.sharedMemory = !options_.noSharedMemory;
    config.check = apps::precheck(!options_.noPrecheck);
    config.handshakeTimeout = options_.handshakeTimeout;
    if (seat_ != nullptr) {
        config.admission = seat_->admission();
    }
    if (recording_) {
        recording_->beginSession(config.role, config.build);
        config.recorder = recording_.get();
    }
    const auto fail = [this](const std::exception& error, ExitCode code) {
        log_.say(error.what());
        exitCode_ = code;
        return false;
    };
    try {
        session_ = Session::open(in, out, std::move(config));
    } catch (const session_layer::HandshakeRefused& error) {
        if (seat_ != nullptr && seat_->isRefused()) {
            exitCode_ = ExitCode::Refused;
            return false;
        }
        return fail(error, ExitCode::Refused);
    } catch (const session_layer::ProtocolViolation& error) {
        return fail(error, ExitCode::Violation);
    } catch (const session_layer::StreamLost& error) {
        if (seat_ != nullptr && dynamic_cast<const session_layer::PeerSilent*>(&error) != nullptr) {
            exitCode_ = ExitCode::Silent;
            return false;
        }
        return fail(error, ExitCode::Lost);
    }
    if (seat_ != nullptr) {
        seat_->leaveLine();
    }
    log_.note("session with " + session_->peer().build);
    capabilities_.setClient(session_->peer().capabilities);
    return true;
}

void Engine::serve() {
    descriptors_.emplace();
    {
        // A thread that waits with a descriptor that has become another file's spins, or waits for ever.
        const EachSecond watch([this] { endWithout(descriptors_->areOurs()); });
        loop();
    }
    queue_.close();
    for (const Request& request : queue_.takeAll()) {
        announcer_->turn().refuse(request, queue_.refusal(RequestQueue::Put::Closed));
    }
    python_->finish();
    capture_->finish();
    output_->flush();
    announcer_->shutDown();
}

void Engine::loop() {
    while (const std::optional<Request> request = next()) {
        if (request->requeued) {
            announcer_->turn().raise<cmddistributor::IIPReactivatedEvent>(*request);
        }
        if (prompts_->admit(*request) && !handle(*request, nullptr)) {
            return;
        }
        // Replies leave together while more evaluations wait.
        const bool isEvaluation = std::holds_alternative<const EvalIIP*>(request->task);
        settle(isEvaluation && queue_.hasDue(DequeuePoint::Idle) ? Until::Room : Until::Written);
    }
}

// Running code may have closed what the threads of this process wait with, or put other files there. Nothing can be
// sent or waited for then; the client finds its stream at an end.
void Engine::endWithout(bool descriptors) {
    // A session that is over has closed its own, and says so at once.
    if (!descriptors && !announcer_->awaitEnd(grace)) {
        if (std::this_thread::get_id() == mainThread_) {
            sendAll();
        }
        log_.say("Running code has closed descriptors of the engine, so its session cannot go on.");
        ::_exit(static_cast<int>(finishFiles(ExitCode::Lost)));
    }
}

// Outputs are sent from Python's own memory, which the next request might change. And a client that only sends must not
// make this process grow. A cancel ends the wait, so what was returned at a prompt has been copied.
void Engine::settle(Until until) {
    endWithout(descriptors_->areOpen());
    python_->unlocked([this, until] {
        const int interrupt = cancellation_.descriptor();
        until == Until::Room ? announcer_->waitForRoom(interrupt) : announcer_->waitUntilWritten(interrupt);
    });
    python_->dropReleased();
}

void Engine::unlocked(const std::function<void()>& wait) {
    python_->unlocked(wait);
}

std::optional<Request> Engine::next() {
    for (;;) {
        RequestQueue::Wait wait = RequestQueue::Wait::Due;
        if (!queue_.hasDue(DequeuePoint::Idle)) {
            posix::SignalsBlocked blocked;
            python_->handleSignals();
            announcer_->flush();
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
        const Announcer::Turn turn = announcer_->turn();
        // A cancel may have been faster.
        if (std::optional<Request> request = queue_.take(DequeuePoint::Idle)) {
            cancellation_.begin(request->id());
            return request;
        }
    }
}

// Runs a request that cancellation_ knows already. Returns whether the session goes on.
bool Engine::handle(const Request& request, PyObject* frame) {
    announcer_->turn().raise<cmddistributor::IIPStartedEvent>(request);
    output_->begin(request);
    prompts_->begin(request);
    Interpreter::Ending ending = runCode(request, frame);
    prompts_->end();
    const bool goesOn = !ending.exit;
    Announcer::Turn turn = announcer_->turn();
    if (ending.error && !ending.printed.empty()) {
        turn.publish(request.stream, boost::make_shared<const krutil::io::PrintableErrorEvent>(
                                         request.id(), *ending.error, std::move(ending.printed)));
    }
    turn.raise<cmddistributor::IIPCompletedEvent>(request);
    turn.finish(request, resultOf(request, std::move(ending)));
    return goesOn;
}

Interpreter::Ending Engine::runCode(const Request& request, PyObject* frame) {
    Interpreter::Ending ending;
    if (const auto* const call = std::get_if<const FEvalIIP*>(&request.task)) {
        // A cancel of the code that a prompt holds up does not wait for the reply to be read: that code may then change
        // what it returned.
        ending =
            python_->call(**call, prompts_->isInner() ? Interpreter::Outputs::Copied : Interpreter::Outputs::Shared);
    } else {
        const EvalIIP& evaluation = *std::get<const EvalIIP*>(request.task);
        echo(evaluation);
        ending = python_->evaluate(evaluation, fileOf(request), frame);
    }
    if (!prompts_->isInner()) {
        python_->endRequest(ending);
    }
    capture_->finish();
    const bool toldToStop = cancellation_.end();
    if (!prompts_->isInner()) {
        // Nothing runs any more, so nothing is interrupted. Inside a prompt the code that it holds up is still to be.
        python_->handleSignals();
    }
    output_->end();
    if (toldToStop) {
        // The cancel was answered, but the code ended first.
        ending.error = interruption("");
        ending.printed.clear();
    }
    return ending;
}

void Engine::echo(const EvalIIP& evaluation) {
    const bool toOutput = evaluation.getOutTraits().getUseEcho();
    const bool toError = evaluation.getErrTraits().getUseEcho();
    if (!toOutput && !toError) {
        return;
    }
    // Through the wire's encoding and back, which makes any text well-formed.
    const std::u16string text =
        msg_svc::protobuf::utf8_to_ustring(msg_svc::protobuf::ustring_to_utf8(promptedLines(evaluation.getCommand())));
    if (toOutput) {
        output_->write(TextSource::ShownOutput, text);
    }
    if (toError) {
        output_->write(TextSource::ShownError, text);
    }
}

// Services for running code.

const Request* Engine::requestOfThisThread() const noexcept {
    return std::this_thread::get_id() == mainThread_ ? prompts_->current() : nullptr;
}

bool Engine::canUse(Capability capability) {
    return requestOfThisThread() != nullptr && capabilities_.lists().inForce.contains(capability);
}

PromptEnd Engine::prompt(InputRequester loop, const FrameChoice& frame, RequestQueue::Deadline deadline) {
    capture_->drain();
    return prompts_->takeCommands(loop, deadline,
                                  [this, &frame](const Request& inner) { return handle(inner, frame()); });
}

PromptEnd Engine::readText(std::u16string& text) {
    capture_->drain();
    return prompts_->takeText(text);
}

bool Engine::leavePrompt(PromptEnd end) {
    return std::this_thread::get_id() == mainThread_ && prompts_->leave(end);
}

void Engine::issueWarning(Warning warning) {
    output_->flush();
    announcer_->announceWarning(requestOfThisThread(), std::move(warning));
}

void Engine::setDebugging(bool on) {
    const Request* const request = requestOfThisThread();
    output_->flush();
    // In one turn, so that the last event tells what holds, whichever threads change it.
    Announcer::Turn turn = announcer_->turn();
    const Capabilities::Lists before = capabilities_.lists();
    capabilities_.setEngine(Capability::Debugging, on);
    const Capabilities::Lists now = capabilities_.lists();
    if (now.engine != before.engine) {
        turn.publish(0, boost::make_shared<const CapabilitiesChanged>(
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

void Engine::sendAll() {
    output_->flush();
    announcer_->flush();
}

// Whether running code is to go on with an exception, which is set.
bool Engine::interrupted() {
    if (cancellation_.takeInterrupt()) {
        PyErr_SetNone(PyExc_KeyboardInterrupt);
        return true;
    }
    return PyErr_CheckSignals() != 0;
}

// What the session's I/O thread hands over.

void Engine::onMessage(framing::StreamID stream, const boost::shared_ptr<const Message>& message) {
    const auto enqueued = boost::dynamic_pointer_cast<const IIPEnqueueMessage>(message);
    {
        Announcer::Turn turn = announcer_->turn(Session::Urgency::Answer);
        if (!turn.isServing()) {
            return;
        }
        if (enqueued) {
            enqueue(turn, arrivedRequest(stream, enqueued));
        } else if (const auto* const cancelled = dynamic_cast<const IIPCancelMessage*>(message.get())) {
            cancel(turn, stream, *cancelled);
        } else {
            throw session_layer::ProtocolViolation("The engine cannot act on a message of this kind.");
        }
    }
    if (enqueued) {
        queue_.wake();
    }
}

void Engine::enqueue(Announcer::Turn& turn, const Request& request) {
    if (const RequestQueue::Put put = queue_.put(request); put != RequestQueue::Put::Taken) {
        turn.refuse(request, queue_.refusal(put));
    }
}

void Engine::cancel(Announcer::Turn& turn, framing::StreamID stream, const IIPCancelMessage& message) {
    IIPCancelReply::CancelStatus status = IIPCancelReply::UNABLE_TO_CANCEL_ALREADY_DONE;
    if (const std::optional<Request> waiting = queue_.remove(message.getID())) {
        turn.discard(*waiting, interruption("The request was cancelled before it was started."));
        status = IIPCancelReply::SUCCESSFUL_CANCEL;
    } else {
        switch (cancellation_.cancel(message.getID(), message.getEvenIfRunning())) {
            case Cancellation::Effect::NotRunning:
                break;
            case Cancellation::Effect::LeftRunning:
                status = IIPCancelReply::UNABLE_TO_CANCEL_ALREADY_RUNNING;
                break;
            case Cancellation::Effect::Interrupted:
                status = IIPCancelReply::PENDING_CANCEL;
                break;
        }
    }
    turn.answer(stream, boost::shared_ptr<const Reply>(boost::make_shared<const IIPCancelReply>(status)));
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
    switch (end.reason) {
        case SessionEnd::Reason::Finished:
        case SessionEnd::Reason::Closed:
            break;
        case SessionEnd::Reason::Lost:
            exitCode_ = ExitCode::Lost;
            break;
        case SessionEnd::Reason::Violation:
            exitCode_ = ExitCode::Violation;
            break;
    }
    if (end.text.empty()) {
        log_.note("session ended");
    } else {
        log_.say(end.text);
    }
    queue_.close();
    // Nobody listens any more, so running code is not waited for.
    if (!announcer_->end(grace)) {
        ::_exit(static_cast<int>(finishFiles(exitCode_)));
    }
}

}  // namespace qvm
