#include "qvm/requests/Announcer.hpp"

#include <utility>

#include "cmddistributor/IIPStateEvent.hpp"
#include "korvel/lang/diagnostic/IssuedEnabledWarningEvent.hpp"
#include "korvel/lang/diagnostic/IssuedWarningEvent.hpp"
#include "krutil/cmddistributor/IIPReply.hpp"
#include "krutil/eventmgr/QVMShutdownEvent.hpp"
#include "krutil/io/SinkTextEvent.hpp"
#include "krutil/io/TextBaseEvent.hpp"
#include "msg_svc/protobuf/ustring.hpp"

namespace qvm {
namespace {

using cmddistributor::IIPResult;
using cmddistributor::RuntimeException;
using foundation::msg_svc::exchange::IDType;
using foundation::msg_svc::exchange::Reply;
using korvel::lang::diagnostic::IssuedEnabledWarningEvent;
using korvel::lang::diagnostic::IssuedWarningEvent;
using korvel::lang::diagnostic::Warning;
using krutil::cmddistributor::IIPReply;

RuntimeException communicationError(const std::string& text) {
    return {krutil::cmddistributor::inCOMM_ERROR, msg_svc::protobuf::utf8_to_ustring(text), "", "", {}, {}, false};
}

std::u16string cut(const std::u16string& text, std::size_t units) {
    if (text.size() <= units) {
        return text;
    }
    // A surrogate that loses its other half is replaced when the text is written.
    return text.substr(0, units) + u"...";
}

// The same warning in about `units` UTF-16 units, without its arguments and its stack.
Warning shortened(const Warning& warning, std::size_t units) {
    const std::u16string identifier = msg_svc::protobuf::utf8_to_ustring(warning.getIdentifier());
    return {msg_svc::protobuf::ustring_to_utf8(cut(identifier, units / 4)),
            cut(warning.getFormat(), units / 4),
            {},
            cut(warning.getMessage(), units / 2),
            {},
            warning.getWasDisabled(),
            warning.getTime()};
}

}  // namespace

template <class T>
void Announcer::Turn::send(framing::StreamID stream, const boost::shared_ptr<const T>& object,
                           Session::Urgency urgency) {
    if (!isServing()) {
        return;
    }
    announcer_.session_.send(stream, object, urgency);
    if (urgency != Session::Urgency::Held) {
        announcer_.due_ = FlushTimer::never;
    } else if (announcer_.due_ == FlushTimer::never) {
        announcer_.due_ = FlushTimer::Clock::now() + holdTime;
        announcer_.timer_.expect(announcer_.due_);
    }
}

// What may wait for the next message does.
auto Announcer::Turn::patient() const noexcept -> Session::Urgency {
    return urgency_ == Session::Urgency::Output ? Session::Urgency::Held : urgency_;
}

bool Announcer::Turn::publish(framing::StreamID stream, const Event& event) noexcept {
    try {
        send(stream, event, patient());
        return true;
    } catch (const std::exception& error) {
        announcer_.log_.say(std::string("An event cannot be sent: ") + error.what());
        return false;
    }
}

void Announcer::Turn::answer(framing::StreamID stream, const boost::shared_ptr<const Reply>& reply) {
    send(stream, reply, urgency_);
}

void Announcer::Turn::finish(const Request& request, std::unique_ptr<IIPResult> result) {
    raise<cmddistributor::LastIIPEvent>(request);
    // The outputs of a call are sent from where they are, which may change: that does not wait.
    const bool isCall = std::holds_alternative<const cmddistributor::FEvalIIP*>(request.task);
    const auto reply = [&](std::unique_ptr<IIPResult> sent) {
        send(request.stream,
             boost::shared_ptr<const Reply>(boost::make_shared<const IIPReply>(request.id(), std::move(sent))),
             isCall ? urgency_ : patient());
    };
    std::string problem;
    try {
        reply(std::move(result));
        return;
    } catch (const std::exception& error) {
        problem = error.what();
    }
    reply(std::make_unique<IIPResult>(request.id(),
                                      communicationError("The result of this request cannot be sent: " + problem)));
}

void Announcer::Turn::discard(const Request& request, RuntimeException error) {
    raise<cmddistributor::IIPDiscardedEvent>(request);
    finish(request, std::make_unique<IIPResult>(request.id(), std::move(error)));
}

void Announcer::Turn::refuse(const Request& request, const std::string& why) {
    discard(request, communicationError(why));
}

Announcer::Announcer(Session& session, AppendFile& diary, Log& log, FlushTimer& timer)
    : session_(session), diary_(diary), log_(log), timer_(timer), bounds_(session.peer().limits) {}

FlushTimer::Time Announcer::flushDue(FlushTimer::Time now) {
    const std::lock_guard lock(mutex_);
    if (due_ != FlushTimer::never && due_ <= now) {
        due_ = FlushTimer::never;
        session_.sendHeld();
    }
    return due_;
}

void Announcer::announceText(const TextTarget& target, std::u16string text) noexcept {
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
        Event event;
        if (target.shown) {
            event = boost::make_shared<const krutil::io::SinkTextEvent>(target.id, target.type, std::move(text));
        } else {
            event = boost::make_shared<const krutil::io::TextBaseEvent>(target.id, target.type, std::move(text));
        }
        turn().publish(target.stream, event);
    } catch (const std::exception& error) {
        log_.say(std::string("Text cannot be sent: ") + error.what());
    }
}

void Announcer::announceWarning(const Request* request, Warning warning) {
    const framing::StreamID stream = request != nullptr ? request->stream : 0;
    const IDType id = request != nullptr ? request->id() : IDType();
    Turn mine = turn();
    if (!mine.publish(stream, boost::make_shared<const IssuedWarningEvent>(id, warning))) {
        warning = shortened(warning, bounds_.warningUnits);
        mine.publish(stream, boost::make_shared<const IssuedWarningEvent>(id, warning));
    }
    if (!warning.getWasDisabled() &&
        !mine.publish(stream, boost::make_shared<const IssuedEnabledWarningEvent>(id, warning))) {
        mine.publish(stream,
                     boost::make_shared<const IssuedEnabledWarningEvent>(id, shortened(warning, bounds_.warningUnits)));
    }
}

void Announcer::shutDown() {
    {
        Turn last = turn();
        last.publish(0, boost::make_shared<const krutil::eventmgr::QVMShutdownEvent>());
        session_.sendHeld();
        phase_ = next(phase_, SessionStep::ShutDown);
    }
    changed_.notify_all();
}

void Announcer::leave() {
    step(SessionStep::Leave);
}

bool Announcer::end(std::chrono::milliseconds grace) {
    step(SessionStep::End);
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, grace, [this] { return phase_ == SessionPhase::Done; });
}

bool Announcer::awaitEnd(std::chrono::milliseconds grace) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, grace,
                             [this] { return phase_ == SessionPhase::Lost || phase_ == SessionPhase::Done; });
}

void Announcer::step(SessionStep step) {
    {
        const std::lock_guard lock(mutex_);
        phase_ = next(phase_, step);
    }
    changed_.notify_all();
}

}  // namespace qvm
