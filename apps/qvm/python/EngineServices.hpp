// What running code asks of the engine, besides writing text.
#pragma once

#include <Python.h>

#include <chrono>
#include <functional>
#include <optional>
#include <string>

#include "capabilities/Capability.hpp"
#include "korvel/lang/diagnostic/Warning.hpp"
#include "krutil/prompt/InputRequester.hpp"
#include "qvm/requests/Prompts.hpp"

namespace qvm {

/// Calls come from Python code and hold the interpreter lock; they never come in a forked child. prompt(), readText(),
/// takeInterrupt() and repeatInterrupt() are for the main thread, the rest for any. What they send may be more than the
/// client reads: the caller waits for room afterwards.
class EngineServices {
  public:
    virtual ~EngineServices() = default;

    /// Whether the calling code belongs to a request that runs, on the main thread, and the capability is in force.
    virtual bool canUse(::capabilities::Capability capability) = 0;

    /// The frame in which the next command is evaluated; null for the session's namespace. The prompt keeps it alive.
    using FrameChoice = std::function<PyObject*()>;

    /// Holds the running request up at a prompt for commands. Needs canUse().
    virtual PromptEnd prompt(krutil::prompt::InputRequester loop, const FrameChoice& frame,
                             std::optional<std::chrono::steady_clock::time_point> deadline) = 0;

    /// Holds the running request up until the client answers with text, which goes to `text`. Needs canUse().
    virtual PromptEnd readText(std::u16string& text) = 0;

    /// Closes the innermost prompt for commands when the request that runs there has ended. Returns false when there is
    /// no such prompt.
    virtual bool leavePrompt(PromptEnd end) = 0;

    /// Publishes a warning, and once more when it is enabled.
    virtual void issueWarning(korvel::lang::diagnostic::Warning warning) = 0;

    /// Whether the engine offers a debugger.
    virtual void setDebugging(bool on) = 0;

    /// Readable when the main thread has an interrupt to take; -1 on other threads.
    virtual int interruptDescriptor() = 0;

    /// Whether the request that runs is to be interrupted; each interrupt is given once, to the main thread.
    virtual bool takeInterrupt() = 0;

    /// Python has dropped an interrupt that takeInterrupt() gave, so it is given again. Returns false when the request
    /// that runs was given none.
    virtual bool repeatInterrupt() = 0;

    /// Sends whatever is held, as far as the stream takes it.
    virtual void sendAll() = 0;

    /// Hands on what was written to descriptors 1 and 2. Returns whether that was anything.
    virtual bool drainDescriptors() = 0;
};

}  // namespace qvm
