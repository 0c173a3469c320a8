#include "qvm/requests/Prompts.hpp"

#include <algorithm>
#include <chrono>
#include <memory>
#include <string_view>
#include <utility>

#include "cmddistributor/DebugLoopEvent.hpp"
#include "cmddistributor/IIPStateEvent.hpp"
#include "foundation/core/posix/SignalsBlocked.hpp"

namespace qvm {
namespace {

using namespace krutil::cmddistributor::WhenToDequeue;
using capabilities::Capability;
using cmddistributor::DebugLoopEvent;
using foundation::core::posix::SignalsBlocked;
using krutil::prompt::InputRequester;

// The answer at an input prompt that is none.
constexpr std::u16string_view endOfInput = u"\u0004";

DequeuePoint pointOf(InputRequester loop) {
    switch (loop) {
        case InputRequester::mnINPUT_PROMPT:
            return DequeuePoint::InputPrompt;
        case InputRequester::mnDEBUG_PROMPT:
            return DequeuePoint::DebugPrompt;
        case InputRequester::mnPAUSE_PROMPT:
            return DequeuePoint::Pause;
        default:
            return DequeuePoint::Prompt;
    }
}

// What the client must be able to do to answer there.
Capability neededAt(DequeuePoint point) {
    return point == DequeuePoint::DebugPrompt ? Capability::Debugging : Capability::InteractiveCommandLine;
}

}  // namespace

Prompts::Prompts(RequestQueue& queue, Announcer& announcer, TextOutput& output, Cancellation& cancellation,
                 const Capabilities& capabilities, PromptHost& host)
    : queue_(queue),
      announcer_(announcer),
      output_(output),
      cancellation_(cancellation),
      capabilities_(capabilities),
      host_(host) {}

const Request* Prompts::current() const noexcept {
    return levels_.empty() || levels_.back().prompt != nullptr ? nullptr : levels_.back().request;
}

bool Prompts::admit(const Request& request) {
    const std::string why = capabilities_.lacking(request.message->getCapabilities());
    if (why.empty()) {
        return true;
    }
    cancellation_.end();
    announcer_.turn().refuse(request, why);
    return false;
}

PromptEnd Prompts::takeCommands(InputRequester loop, RequestQueue::Deadline deadline, const Run& run) {
    Prompt prompt{loop, pointOf(loop), deadline};
    prompt.take = [&prompt, &run](const Request& request) {
        const bool endsPause =
            prompt.point == DequeuePoint::Pause && request.message->getDequeueMode() != DEQUEUE_AT_PPE;
        if (!run(request)) {
            prompt.end = PromptEnd::Exit;
        } else if (endsPause && !prompt.end) {
            prompt.end = PromptEnd::Continued;
        }
    };
    const PromptEnd end = hold(prompt);
    // A pause has nothing to quit: the code behind it goes on.
    return end == PromptEnd::Quit && prompt.point == DequeuePoint::Pause ? PromptEnd::Continued : end;
}

PromptEnd Prompts::takeText(std::u16string& text) {
    Prompt prompt{InputRequester::mnINPUT_PROMPT, DequeuePoint::InputPrompt, {}};
    prompt.take = [this, &prompt, &text](const Request& request) { takeLine(prompt, request, text); };
    return hold(prompt);
}

bool Prompts::leave(PromptEnd end) {
    const auto open =
        std::find_if(levels_.rbegin(), levels_.rend(), [](const Level& each) { return each.prompt != nullptr; });
    if (open == levels_.rend() || open->prompt->point == DequeuePoint::InputPrompt) {
        return false;
    }
    open->prompt->end = end;
    return true;
}

PromptEnd Prompts::hold(Prompt& prompt) {
    const Request& outer = *levels_.back().request;
    const auto loopEvent = [&](DebugLoopEvent::State state) {
        return boost::make_shared<const DebugLoopEvent>(outer.id(), state, prompt.loop);
    };
    const auto batch = static_cast<unsigned>(levels_.size());
    output_.suspend();
    {
        Announcer::Turn turn = announcer_.turn();
        turn.raise<cmddistributor::IIPSuspendedEvent>(outer);
        turn.publish(outer.stream, loopEvent(DebugLoopEvent::ENTER));
    }
    levels_.back().prompt = &prompt;
    const PromptEnd end = attend(prompt, batch);
    levels_.back().prompt = nullptr;
    {
        Announcer::Turn turn = announcer_.turn();
        for (const Request& left : queue_.closeBatch(batch)) {
            turn.raise<cmddistributor::IIPRequeuedEvent>(left);
        }
        turn.publish(outer.stream, loopEvent(DebugLoopEvent::EXIT));
        turn.raise<cmddistributor::IIPResumedEvent>(outer);
    }
    output_.end();
    return end;
}

PromptEnd Prompts::attend(Prompt& prompt, unsigned batch) {
    while (!prompt.end) {
        // What the client sent while it could be asked is an answer still.
        const bool withdrawn = !capabilities_.lists().client.contains(neededAt(prompt.point));
        const RequestQueue::Deadline deadline = withdrawn ? std::chrono::steady_clock::now() : prompt.deadline;
        RequestQueue::Wait came = RequestQueue::Wait::Interrupted;
        {
            const SignalsBlocked blocked;
            if (host_.interrupted()) {
                return PromptEnd::Raised;
            }
            announcer_.flush();
            host_.unlocked(
                [&] { came = queue_.wait(prompt.point, cancellation_.descriptor(), deadline, blocked.before()); });
        }
        if (host_.interrupted()) {
            return PromptEnd::Raised;
        }
        switch (came) {
            case RequestQueue::Wait::Closed:
                return prompt.point == DequeuePoint::InputPrompt ? PromptEnd::EndOfInput : PromptEnd::Quit;
            case RequestQueue::Wait::TimedOut:
                return withdrawn ? PromptEnd::Withdrawn : PromptEnd::Continued;
            case RequestQueue::Wait::Interrupted:
                break;
            case RequestQueue::Wait::Due:
                if (!takeBatch(prompt, batch)) {
                    return PromptEnd::Raised;
                }
                break;
        }
    }
    return *prompt.end;
}

// Gives the prompt what is due now, until it ends. Returns false when the code is to go on with an exception.
bool Prompts::takeBatch(Prompt& prompt, unsigned batch) {
    {
        Announcer::Turn turn = announcer_.turn();
        for (const Request& again : queue_.takeBatch(batch, prompt.point)) {
            turn.raise<cmddistributor::IIPReactivatedEvent>(again);
        }
    }
    while (!prompt.end) {
        const std::optional<Request> request = next(batch);
        if (!request) {
            break;
        }
        if (admit(*request)) {
            prompt.take(*request);
        }
        host_.settle();
        if (host_.interrupted()) {
            return false;
        }
    }
    return true;
}

std::optional<Request> Prompts::next(unsigned batch) {
    const Announcer::Turn turn = announcer_.turn();
    std::optional<Request> request = queue_.takeOfBatch(batch);
    if (request) {
        cancellation_.begin(request->id());
    }
    return request;
}

void Prompts::takeLine(Prompt& prompt, const Request& request, std::u16string& text) {
    const auto* const line = std::get_if<const cmddistributor::EvalIIP*>(&request.task);
    if (line == nullptr) {
        cancellation_.end();
        announcer_.turn().refuse(request, "An input prompt takes a line of text, not a function call.");
        return;
    }
    text = (*line)->getCommand();
    prompt.end = text == endOfInput ? PromptEnd::EndOfInput : PromptEnd::Continued;
    Announcer::Turn turn = announcer_.turn();
    cancellation_.end();
    turn.raise<cmddistributor::IIPStartedEvent>(request);
    turn.raise<cmddistributor::IIPCompletedEvent>(request);
    turn.finish(request, std::make_unique<cmddistributor::IIPResult>(request.id(), boost::none));
}

}  // namespace qvm
