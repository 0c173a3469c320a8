#include "krutil/session/Client.hpp"

#include <unistd.h>

#include <algorithm>
#include <boost/make_shared.hpp>
#include <functional>
#include <stdexcept>
#include <utility>

#include "cmddistributor/EvalIIP.hpp"
#include "cmddistributor/IIPCancelMessage.hpp"
#include "cmddistributor/IIPCancelReply.hpp"
#include "common/Build.hpp"
#include "common/KrutilSession.hpp"
#include "common/Precheck.hpp"
#include "krutil/capabilities_api/CapabilitiesChanged.hpp"
#include "krutil/display/Pictures.hpp"
#include "krutil/io/SinkTextEvent.hpp"
#include "krutil/io/TextBaseEvent.hpp"
#include "msg_svc/protobuf/ustring.hpp"

namespace krutil_client {
namespace {

namespace session = foundation::msg_svc::transport::layers::session;
using namespace std::chrono_literals;

// How long a child may take to end after its stream did, before the sentence about it is said without.
constexpr auto patienceForEnd = 2s;
// How long an engine may take to shut down after the goodbye.
constexpr auto patienceForGoodbye = 5s;
// How long a stream may stay open after the child that was to serve it has ended, because another process holds it.
constexpr auto patienceForStream = 1s;

// How an engine exits whose session has gone well, but not the writing of its files.
constexpr int incompleteFiles = 3;

bool isTls(const ConnectionOptions& options) {
    return options.socket && options.socket->starts_with("tls://");
}

capabilities::CapabilityList capabilitiesHere(const ConnectionOptions& options, bool interactive) {
    capabilities::CapabilityList list{capabilities::Capability::WebWindow};
    if (interactive) {
        list |= capabilities::Capability::InteractiveCommandLine;
        list |= capabilities::Capability::Debugging;
    }
    // A shell command may lead to another machine.
    if (!options.engine && !isTls(options)) {
        list |= capabilities::Capability::LocalClient;
    }
    return list;
}

}  // namespace

EngineProcess findEngine(const ConnectionOptions& options) {
    if (isTls(options)) {
        TlsAddress address = parseTlsAddress(*options.socket);
        address.certificate = options.certificate;
        address.key = options.key;
        address.authorities = options.authorities;
        return EngineProcess::connect(address);
    }
    if (!options.certificate.empty() || !options.key.empty() || !options.authorities.empty()) {
        throw Failure(ExitCode::Usage, "--cert, --key and --ca go with --connect tls://HOST:PORT");
    }
    if (options.socket) {
        return EngineProcess::connect(*options.socket);
    }
    if (options.engine) {
        return EngineProcess::startCommand(*options.engine);
    }
    try {
        return EngineProcess::start(defaultEngineCommand());
    } catch (const Failure& failure) {
        throw Failure(failure.code(), std::string(failure.what()) + "; name another one with --engine");
    }
}

Client::Client(const ConnectionOptions& connection, const DisplayOptions& display, Printer& printer, const Output& out,
               Output& err, Interrupt& interrupt, bool interactive, const Watchers& watchers)
    : printer_(printer),
      interrupt_(interrupt),
      err_(err),
      outTerminal_(out.isTerminal()),
      timing_(display.timing),
      throughShell_(connection.engine.has_value()),
      begin_(Conversation::Clock::now()),
      engine_(findEngine(connection)) {
    const auto noteTime = [this](const auto&) {
        if (!firstText_) {
            firstText_ = Conversation::Clock::now();
        }
    };
    events_.subscribe<krutil::io::TextBaseEvent>(noteTime);
    events_.subscribe<krutil::io::SinkTextEvent>([this, noteTime](const krutil::io::SinkTextEvent& event) {
        noteTime(event);
        picturesAnnounced_ = picturesAnnounced_ || pictureLine(event.getText());
    });
    events_.subscribe<krutil::capabilities_api::CapabilitiesChanged>(
        [this](const krutil::capabilities_api::CapabilitiesChanged& event) {
            engineCapabilities_ = event.getQvmCapabilities();
        });
    printer_.subscribe(events_);
    conversation_ = openConversation(connection, interactive, watchers);
    engine_.takeTerminalBack();
    conversation_->watch(engine_.watch(), [this] {
        // The end of the stream follows, and is what ends a request; unless another process holds the stream.
        const bool idle = requests_.unanswered().empty();
        try {
            if (conversation_->runUntil(Conversation::Clock::now() + patienceForStream,
                                        [this, idle] { return !idle && requests_.unanswered().empty(); })) {
                return;
            }
        } catch (const SessionOver&) {
            return;
        }
        failLost("its stream stayed open", idle ? "while it was idle" : "before it answered");
    });
    engineCapabilities_ = conversation_->session().peer().capabilities;
    ready_ = Conversation::Clock::now() - begin_;
    printer_.connected(conversation_->session().peer(), conversation_->session().features());
}

Client::~Client() {
    // After finish() the child has gone. Without it the session was given up, and a child that is killed before its
    // stream closes does not complain about that on the standard error that it shares with this program.
    engine_.kill();
    conversation_.reset();
}

std::unique_ptr<Conversation> Client::openConversation(const ConnectionOptions& connection, bool interactive,
                                                       const Watchers& watchers) {
    session::SessionConfig config = apps::krutilSession(session::Role::Client);
    config.build = apps::buildString("krutil");
    config.limits = connection.limits;
    capabilities_ = capabilitiesHere(connection, interactive);
    config.capabilities = capabilities_;
    config.handshakeTimeout = connection.handshakeTimeout;
    config.sharedMemory = !connection.noSharedMemory && !isTls(connection);
    config.check = apps::precheck(!connection.noPrecheck);
    if (connection.engine || isTls(connection)) {
        config.keepAlive = connection.keepAlive;
    }
    if (watchers.tracer != nullptr) {
        config.trace = std::ref(*watchers.tracer);
    }
    if (watchers.recording != nullptr) {
        watchers.recording->beginSession(config.role, config.build);
        config.recorder = watchers.recording;
    }
    try {
        return std::make_unique<Conversation>(engine_.takeStream(), std::move(config), events_, interrupt_);
    } catch (const session::HandshakeRefused& error) {
        interrupt_.dispatch();
        throw Failure(ExitCode::Refused, error.what());
    } catch (const session::StrayText& error) {
        interrupt_.dispatch();
        throw Failure(ExitCode::Violation,
                      throughShell_ ? "the command of --engine printed " + error.text() +
                                          " before the session began. Perhaps a start-up script of the shell there, "
                                          "such as .bashrc, prints on standard output: let it do so in interactive "
                                          "shells only, or on standard error"
                                    : error.what());
    } catch (const session::ProtocolViolation& error) {
        interrupt_.dispatch();
        throw Failure(ExitCode::Violation, error.what());
    } catch (const session::StreamLost& error) {
        // Ctrl-C during the handshake ends it by shutting the stream down.
        interrupt_.dispatch();
        if (engine_.hasTerminal()) {
            const auto end = engine_.waitForEnd(patienceForEnd);
            if (end && end->wasInterrupted()) {
                throw Cancelled();
            }
        }
        // An engine that was too slow may end now, for want of a stream; that is not what went wrong.
        if (Conversation::Clock::now() - begin_ >= connection.handshakeTimeout) {
            throw Failure(ExitCode::Stream, error.what());
        }
        failLost(error.what(), "before the session began");
    }
}

krutil::io::SinkTraits Client::outTraits(const SinkOptions& options) const {
    return {false, options.hotlinks && outTerminal_, outTerminal_, options.diary, options.echo, options.log};
}

krutil::io::SinkTraits Client::errTraits(const SinkOptions& options) const {
    return {false, options.hotlinks && err_.isTerminal(), err_.isTerminal(), options.diary, options.echo, options.log};
}

boost::shared_ptr<const cmddistributor::IIP> Client::evaluation(const std::string& code, cmddistributor::CodeType type,
                                                                const SinkOptions& options) const {
    return boost::make_shared<const cmddistributor::EvalIIP>("python", cmddistributor::IqmStreamID::ekIqmCmdWinStream,
                                                             nullptr, outTraits(options), errTraits(options),
                                                             msg_svc::protobuf::utf8_to_ustring(code), type);
}

boost::shared_ptr<const cmddistributor::IIPEnqueueMessage> Client::messageOf(
    const NewRequest& request, const foundation::msg_svc::exchange::IDType& id) {
    return boost::make_shared<const cmddistributor::IIPEnqueueMessage>(
        request.iip, id, krutil::contextmgr::QcrID{0}, boost::none, nullptr, request.when,
        msg_svc::protobuf::utf8_to_ustring(request.name), capabilities::CapabilityList{}, nullptr, request.sparingly);
}

Client::Sent Client::send(const NewRequest& request) {
    const auto sent = std::make_shared<SentRequest>();
    sent->id = foundation::msg_svc::exchange::IDType::random();
    sent->name = request.name;
    const auto message = messageOf(request, sent->id);
    // Requests at prompts are a part of the one that they hold up.
    const bool timed = timing_ && request.when == krutil::cmddistributor::WhenToDequeue::DEQUEUE_AT_IDLE;
    Timing timing;
    if (timed) {
        timing.ready = std::exchange(ready_, std::nullopt);
        firstText_.reset();
    }
    const auto begin = Conversation::Clock::now();
    try {
        conversation_->send(message, [this, sent, timed, timing, begin](const Conversation::Reply& reply) {
            Timing whole = timing;
            whole.answered = Conversation::Clock::now() - begin;
            if (firstText_) {
                whole.firstOutput = *firstText_ - begin;
            }
            answered(*sent, reply);
            if (timed) {
                printer_.timed(whole);
            }
        });
    } catch (const session::LimitExceeded& error) {
        throw Failure(ExitCode::Usage, error.what());
    }
    requests_.add(sent);
    return sent;
}

void Client::answered(SentRequest& request, const Conversation::Reply& answer) {
    const auto reply = boost::dynamic_pointer_cast<const krutil::cmddistributor::IIPReply>(answer);
    if (!reply || (reply->getResult() && reply->getResult()->id != request.id)) {
        violated(!reply ? "the engine answered a request with something that is no answer to it"
                        : "the engine answered a request with the result of another one");
    }
    const auto* error =
        reply->getResult() && reply->getResult()->getException() ? &*reply->getResult()->getException() : nullptr;
    const bool cancelled = error != nullptr && error->getExecutionStatus() == krutil::cmddistributor::inEXECUTION_CTRLC;
    requests_.remove(request);
    request.answer = {error == nullptr ? ExitCode::Ok : cancelled ? ExitCode::Cancelled : ExitCode::CodeError, reply};
    printer_.replied({request.id, error, request.errorPrinted || request.withdrawn});
}

void Client::wait(const std::vector<Sent>& requests, const std::function<bool()>& done) {
    try {
        cancelling(requests).run(done);
    } catch (const SessionOver& over) {
        fail(over.end(), "before it answered");
    }
}

Answer Client::request(const NewRequest& request) {
    const Sent sent = send(request);
    wait({sent}, [&sent] { return sent->answer.has_value(); });
    showPictures();
    return *sent->answer;
}

void Client::showPictures() {
    if (showPictures_ && std::exchange(picturesAnnounced_, false)) {
        showPictures_();
    }
}

Canceller Client::cancelling(std::vector<Sent> requests) {
    const auto unanswered = [requests = std::move(requests)] {
        std::vector<foundation::msg_svc::exchange::IDType> ids;
        for (const Sent& request : requests) {
            if (!request->answer) {
                ids.push_back(request->id);
            }
        }
        return ids;
    };
    return Canceller(*conversation_, engine_, interrupt_, unanswered,
                     [this](const std::string& sentence) { say(sentence); });
}

void Client::cancel(const Sent& request) {
    using cmddistributor::IIPCancelReply;
    conversation_->send(
        boost::make_shared<const cmddistributor::IIPCancelMessage>(request->id, true),
        [this, request](const Conversation::Reply& reply) {
            const auto* const cancel = dynamic_cast<const IIPCancelReply*>(reply.get());
            if (cancel != nullptr && cancel->getStatus() == IIPCancelReply::UNABLE_TO_CANCEL_ALREADY_RUNNING) {
                say("the engine does not interrupt request " + std::to_string(request->number));
            }
        });
}

void Client::withdraw(const Sent& request) {
    if (const auto listed = requests_.find(request->id)) {
        listed->withdrawn = true;
        conversation_->send(boost::make_shared<const cmddistributor::IIPCancelMessage>(request->id, false),
                            [](const Conversation::Reply&) {});
    }
}

void Client::setDebugging(bool on) {
    const auto before = capabilities_;
    if (on) {
        capabilities_ |= capabilities::Capability::Debugging;
    } else {
        capabilities_ = capabilities_.without({capabilities::Capability::Debugging});
    }
    if (capabilities_ != before) {
        const auto inForce = before.without(before.without(engineCapabilities_));
        conversation_->session().send(
            0, boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent>(
                   boost::make_shared<const krutil::capabilities_api::CapabilitiesChanged>(
                       inForce, engineCapabilities_, capabilities_, capabilities::CapabilityList{})));
    }
}

void Client::violated(const std::string& text) {
    conversation_->session().abort(text);
    throw Failure(ExitCode::Violation, text);
}

void Client::awaitAnswers(Leave leave, Conversation::Clock::time_point deadline) {
    const auto none = [this] { return requests_.unanswered().empty(); };
    const std::vector<Sent> left(requests_.unanswered().begin(), requests_.unanswered().end());
    if (leave == Leave::WhenAnswered) {
        const auto waited = std::count_if(left.begin(), left.end(), [](const Sent& each) { return !each->withdrawn; });
        if (waited > 0) {
            say("waits for " + std::to_string(waited) + (waited == 1 ? " request" : " requests") +
                "; Ctrl-C cancels what is left");
        }
        wait(left, none);
        return;
    }
    for (auto request = left.rbegin(); request != left.rend(); ++request) {
        cancel(*request);
    }
    try {
        conversation_->runUntil(deadline, none);
    } catch (const SessionOver&) {
        // There is nothing left to cancel.
    }
}

std::string Client::finish(Leave leave) {
    awaitAnswers(leave, Conversation::Clock::now() + patienceForGoodbye);
    conversation_->watch(-1, nullptr);
    const auto deadline = Conversation::Clock::now() + patienceForGoodbye;
    std::optional<Conversation::SessionEnd> ended;
    try {
        ended = conversation_->finish(patienceForGoodbye);
    } catch (const SessionOver& over) {
        ended = over.end();
    }
    if (ended && ended->reason == Conversation::SessionEnd::Reason::Violation) {
        fail(*ended, "after it answered");
    }
    conversation_.reset();
    const bool lost = ended && ended->reason == Conversation::SessionEnd::Reason::Lost;
    if (!engine_.isChild()) {
        return !ended ? "the engine did not end after it answered; the connection was closed"
               : lost ? "the engine was lost after it answered: " + ended->text
                      : std::string();
    }
    const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - Conversation::Clock::now());
    const auto end = engine_.waitForEnd(std::max(left, std::chrono::milliseconds(0)));
    if (!end) {
        engine_.kill();
        return "the engine did not end after it answered, and was killed";
    }
    if (!lost && !end->signalled && end->number == incompleteFiles) {
        engineFilesComplete_ = false;
        return "the engine " + end->text() + " after it answered: a diary, log or recording of it is not complete";
    }
    return lost || end->signalled ? "the engine " + end->text() + " after it answered" : std::string();
}

void Client::say(const std::string& sentence) {
    err_.write("krutil: " + sentence + "\n");
}

void Client::fail(const Conversation::SessionEnd& end, const std::string& when) {
    switch (end.reason) {
        case Conversation::SessionEnd::Reason::Violation:
            throw Failure(ExitCode::Violation, end.text);
        case Conversation::SessionEnd::Reason::Lost:
            failLost(end.text, when);
        case Conversation::SessionEnd::Reason::Finished:
        case Conversation::SessionEnd::Reason::Closed:
            break;
    }
    throw Failure(ExitCode::Stream, "the engine ended the session " + when);
}

void Client::failLost(const std::string& text, const std::string& when) {
    if (const std::string why = engine_.connectionFailure(); !why.empty()) {
        throw Failure(ExitCode::Stream, "the TLS connection to the engine failed " + when + ": " + why);
    }
    if (const auto end = engine_.waitForEnd(patienceForEnd)) {
        if (throughShell_ && !end->signalled && end->number == 0) {
            // Relays end like this when the stream behind them does. An engine ends like this after its last event
            // only.
            throw Failure(ExitCode::Stream, "the stream to the engine was cut " + when + ": " + text +
                                                "; the command of --engine exited with code 0, as relays do");
        }
        constexpr int notFound = 127;
        const bool missing = throughShell_ && !end->signalled && end->number == notFound;
        throw Failure(ExitCode::Stream,
                      "the engine " + end->text() + (missing ? " (the shell did not find the command) " : " ") + when);
    }
    throw Failure(ExitCode::Stream, "the engine was lost " + when + ": " + text);
}

}  // namespace krutil_client
