#include "krutil/session/Canceller.hpp"

#include <boost/make_shared.hpp>
#include <utility>

#include "cmddistributor/IIPCancelMessage.hpp"
#include "krutil/base/ExitCode.hpp"

namespace krutil_client {

using cmddistributor::IIPCancelReply;

Canceller::Canceller(Conversation& conversation, EngineProcess& engine, Interrupt& interrupt, Requests requests,
                     Say say)
    : conversation_(conversation),
      engine_(engine),
      interrupt_(interrupt),
      requests_(std::move(requests)),
      say_(std::move(say)),
      actionBefore_(interrupt.setAction([this] { interrupted(); })) {}

Canceller::~Canceller() {
    *alive_ = false;
    interrupt_.setAction(std::move(actionBefore_));
}

void Canceller::run(const std::function<bool()>& done) {
    while (!done()) {
        const auto deadline = impatientAt_;
        const auto changed = [&] { return impatientAt_ != deadline || done(); };
        if (!deadline) {
            conversation_.run(changed);
        } else if (!conversation_.runUntil(*deadline, changed)) {
            // An answer on a slow stream comes behind what was said before it.
            if (unanswered_ > 0 && heard_ != conversation_.delivered()) {
                heard_ = conversation_.delivered();
                impatientAt_ = Conversation::Clock::now() + patience;
                continue;
            }
            impatientAt_.reset();
            say_(unanswered_ > 0 ? "the engine does not answer. Press Ctrl-C twice within two seconds to end the engine"
                                 : "the engine has not stopped yet; code that is not Python's may hold it up. Press "
                                   "Ctrl-C twice to end the engine");
        }
    }
}

void Canceller::interrupted() {
    const auto now = Conversation::Clock::now();
    if (asked_ && now - *asked_ <= again) {
        // Before the stream closes, or the child would complain about that on the standard error that it shares.
        const bool child = engine_.isChild();
        engine_.kill();
        throw Failure(ExitCode::Cancelled, child ? "cancelled; the engine was killed"
                                                 : "cancelled; the connection was closed, which ends the session");
    }
    asked_ = now;
    stopping_ = false;
    // The last one first: those that wait must not begin when the one that runs ends.
    const auto requests = requests_();
    for (auto request = requests.rbegin(); request != requests.rend(); ++request) {
        conversation_.send(boost::make_shared<const cmddistributor::IIPCancelMessage>(*request, true),
                           [this, alive = alive_](const Conversation::Reply& reply) {
                               const auto cancel = boost::dynamic_pointer_cast<const IIPCancelReply>(reply);
                               if (*alive && cancel) {
                                   answered(cancel->getStatus());
                               }
                           });
        ++unanswered_;
        heard_ = conversation_.delivered();
        impatientAt_ = now + patience;
    }
}

void Canceller::answered(IIPCancelReply::CancelStatus status) {
    if (--unanswered_ == 0 && !stopping_) {
        // There is nothing left to wait for.
        impatientAt_.reset();
    }
    switch (status) {
        case IIPCancelReply::PENDING_CANCEL:
            stopping_ = true;
            impatientAt_ = Conversation::Clock::now() + patience;
            break;
        case IIPCancelReply::UNABLE_TO_CANCEL_ALREADY_RUNNING:
            say_("the engine does not interrupt this request. Press Ctrl-C twice to end the engine");
            break;
        case IIPCancelReply::UNABLE_TO_CANCEL_ALREADY_DONE:
        case IIPCancelReply::SUCCESSFUL_CANCEL:
            break;
    }
}

}  // namespace krutil_client
