// The running requests, and the prompts that hold them up.
//
// A prompt of a running request takes further requests while that one stands still, and these may open prompts of their
// own. So running requests are a stack, and each may have one open prompt. A prompt takes all requests that are due for
// it as one batch. docs/protocol.md tells which these are, and the order of the events.
#pragma once

#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "capabilities/Capability.hpp"
#include "krutil/prompt/InputRequester.hpp"
#include "qvm/requests/Announcer.hpp"
#include "qvm/requests/Cancellation.hpp"
#include "qvm/requests/Capabilities.hpp"
#include "qvm/requests/Request.hpp"
#include "qvm/requests/RequestQueue.hpp"
#include "qvm/requests/TextOutput.hpp"

namespace qvm {

/// How a prompt ended.
enum class PromptEnd {
    Continued,   ///< the code goes on: it was answered, or told to
    Quit,        ///< the code is to be ended
    Exit,        ///< the session is to be ended
    EndOfInput,  ///< there will be no answer
    Withdrawn,   ///< the client cannot be asked any more
    Raised,      ///< the code is to go on with an exception, which is set
};

/// What prompts need of whoever runs the code.
class PromptHost {
  public:
    virtual ~PromptHost() = default;

    /// Whether running code is to go on with an exception, which is set then.
    virtual bool interrupted() = 0;

    /// Calls `wait` while the other threads of the running code go on.
    virtual void unlocked(const std::function<void()>& wait) = 0;

    /// Called after each request that a prompt has taken: waits until the client has read what came of it, or an
    /// interrupt comes.
    virtual void settle() = 0;
};

/// See the head of this file. All members are for the thread that runs code. The objects that the constructor takes
/// must outlive this one.
class Prompts {
  public:
    /// Runs a request; returns whether the session goes on.
    using Run = std::function<bool(const Request&)>;

    Prompts(RequestQueue& queue, Announcer& announcer, TextOutput& output, Cancellation& cancellation,
            const Capabilities& capabilities, PromptHost& host);

    /// `request` runs from now on, until end(). It must live so long.
    void begin(const Request& request) { levels_.push_back({&request, nullptr}); }

    /// The request that began last has ended.
    void end() { levels_.pop_back(); }

    /// Whether the request that began last runs inside a prompt of another one.
    bool isInner() const noexcept { return levels_.size() > 1; }

    /// The request whose code runs; null when none does, or when a prompt holds it up.
    const Request* current() const noexcept;

    /// Refuses a request that needs what the client or the engine lacks; such a request has ended. Returns whether it
    /// may be run.
    bool admit(const Request& request);

    /// Holds current() up and gives `run` the requests that come, until one of them has ended the prompt.
    PromptEnd takeCommands(krutil::prompt::InputRequester loop, RequestQueue::Deadline deadline, const Run& run);

    /// Holds current() up until a request brings a line of text, which goes to `text`.
    PromptEnd takeText(std::u16string& text);

    /// Closes the innermost prompt for commands when the request that runs there has ended. Returns false when there is
    /// no such prompt.
    bool leave(PromptEnd end);

  private:
    // What a prompt does with a request that it has taken.
    using Take = std::function<void(const Request&)>;

    struct Prompt {
        krutil::prompt::InputRequester loop;
        DequeuePoint point;
        RequestQueue::Deadline deadline;
        Take take{};
        std::optional<PromptEnd> end{};
    };

    struct Level {
        const Request* request;
        Prompt* prompt;  // null while the request's code runs
    };

    PromptEnd hold(Prompt& prompt);
    PromptEnd attend(Prompt& prompt, unsigned batch);
    bool takeBatch(Prompt& prompt, unsigned batch);
    std::optional<Request> next(unsigned batch);
    void takeLine(Prompt& prompt, const Request& request, std::u16string& text);

    RequestQueue& queue_;
    Announcer& announcer_;
    TextOutput& output_;
    Cancellation& cancellation_;
    const Capabilities& capabilities_;
    PromptHost& host_;
    std::vector<Level> levels_;
};

}  // namespace qvm
