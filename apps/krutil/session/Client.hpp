// What every command of the program works with: an engine, a session with it, and a printer.
#pragma once

#include <boost/shared_ptr.hpp>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "cmddistributor/CodeType.hpp"
#include "cmddistributor/IIP.hpp"
#include "cmddistributor/IIPEnqueueMessage.hpp"
#include "foundation/msg_svc/eventmgr/EventMgr.hpp"
#include "krutil/base/Interrupt.hpp"
#include "krutil/base/Options.hpp"
#include "krutil/base/Output.hpp"
#include "krutil/cmddistributor/WhenToDequeue.hpp"
#include "krutil/display/Printer.hpp"
#include "krutil/session/Canceller.hpp"
#include "krutil/session/Conversation.hpp"
#include "krutil/session/EngineProcess.hpp"
#include "krutil/session/RequestList.hpp"
#include "krutil/session/Tracer.hpp"

namespace krutil_client {

/// A request to be sent.
struct NewRequest {
    boost::shared_ptr<const cmddistributor::IIP> iip;
    std::string name;  ///< for lists of requests; UTF-8
    krutil::cmddistributor::WhenToDequeue::WhenToDequeue when = krutil::cmddistributor::WhenToDequeue::DEQUEUE_AT_IDLE;
    bool sparingly = false;
};

/// What becomes of requests without an answer when the client leaves.
enum class Leave {
    WhenAnswered,  ///< they are waited for
    AtOnce,        ///< they are cancelled
};

/// The engine that the options name, started or connected to. Throws Failure.
EngineProcess findEngine(const ConnectionOptions& options);

/// What sees all that a session sends and receives; null where nobody wants it. They must outlive the session.
struct Watchers {
    apps::Recording* recording = nullptr;
    Tracer* tracer = nullptr;
};

/// Starts or reaches the engine, sends requests, and ends in good order. Failures of the engine or the session come out
/// as Failure, with a sentence that says which. Main thread only.
class Client {
  public:
    /// `interactive` tells the engine that there is a person who can be asked and who can use a debugger. `printer`,
    /// `err` and `interrupt` must outlive the object. Blocks until the handshake is done. Throws Failure, Cancelled.
    Client(const ConnectionOptions& connection, const DisplayOptions& display, Printer& printer, const Output& out,
           Output& err, Interrupt& interrupt, bool interactive, const Watchers& watchers = {});
    ~Client();
    Client(const Client&) = delete;
    Client& operator=(const Client&) = delete;

    foundation::msg_svc::eventmgr::EventMgr& events() noexcept { return events_; }
    Conversation& conversation() noexcept { return *conversation_; }
    EngineProcess& engine() noexcept { return engine_; }

    /// Traits of the sinks that this program shows a request's output and errors in.
    krutil::io::SinkTraits outTraits(const SinkOptions& options) const;
    krutil::io::SinkTraits errTraits(const SinkOptions& options) const;

    /// A request to evaluate `code`, which is UTF-8.
    boost::shared_ptr<const cmddistributor::IIP> evaluation(const std::string& code, cmddistributor::CodeType type,
                                                            const SinkOptions& options) const;

    /// The message that enqueues a request under this identifier.
    static boost::shared_ptr<const cmddistributor::IIPEnqueueMessage> messageOf(
        const NewRequest& request, const foundation::msg_svc::exchange::IDType& id);

    using Sent = std::shared_ptr<const SentRequest>;

    /// Sends a request. What comes of it is shown whenever the program waits, up to how it ended; what else the reply
    /// holds is the caller's to show. Throws Failure: Usage for one that is larger than the engine accepts.
    Sent send(const NewRequest& request);

    /// Delivers until `done` returns true. Ctrl-C cancels those of `requests` that have no answer. Throws Failure and
    /// what printing and Ctrl-C throw.
    void wait(const std::vector<Sent>& requests, const std::function<bool()>& done);

    /// Sends a request and waits for its answer; then pictures are shown. Throws what both throw, and what showing
    /// throws.
    Answer request(const NewRequest& request);

    /// How pictures are shown: `show` asks the engine for them. Called while nothing is printed.
    void setShowPictures(std::function<void()> show) { showPictures_ = std::move(show); }

    /// Has the pictures shown that have been announced since the last time, if there are any. request() does so by
    /// itself; it is for who waits in another way. The engine must be idle, or at a prompt that takes code.
    void showPictures();

    /// While the object lives, Ctrl-C cancels those of `requests` that have no answer.
    Canceller cancelling(std::vector<Sent> requests);

    /// Asks the engine to cancel a request, even if it runs. A person is told if it does not.
    void cancel(const Sent& request);

    /// Takes back a request that came too late, unless the engine has begun it: nobody waits for its answer.
    void withdraw(const Sent& request);

    /// The requests without an answer.
    const RequestList& requests() const noexcept { return requests_; }

    /// What the two ends can do, as far as they have said.
    const capabilities::CapabilityList& capabilities() const noexcept { return capabilities_; }
    const capabilities::CapabilityList& engineCapabilities() const noexcept { return engineCapabilities_; }

    /// Shows a sentence to the person.
    void say(const std::string& sentence);

    /// Whether requests from now on are timed.
    void setTiming(bool on) noexcept { timing_ = on; }
    bool timing() const noexcept { return timing_; }

    /// Tells the engine whether the person here uses a debugger; nothing is sent when that changes nothing.
    void setDebugging(bool on);

    /// Throws the Failure that tells how a session ended early. `when` follows on the sentence.
    [[noreturn]] void lost(const SessionOver& over, const std::string& when) { fail(over.end(), when); }

    /// Ends the session because the engine broke the protocol: throws a Failure with `text`.
    [[noreturn]] void violated(const std::string& text);

    /// Ends the session in good order. All cancels precede the goodbye, and nothing follows it. Requests that are to be
    /// answered are waited for as long as they take; after that, and for those that are cancelled, an engine that takes
    /// longer than some seconds to go is ended. Returns what a person should know about how it went, empty when all is
    /// well. Throws Failure when an answer does not come or the engine breaks the protocol meanwhile, and what Ctrl-C
    /// throws.
    std::string finish(Leave leave = Leave::WhenAnswered);

    /// Whether the diary, log and recording of a child have all that belongs into them; known after finish().
    bool engineFilesComplete() const noexcept { return engineFilesComplete_; }

  private:
    std::unique_ptr<Conversation> openConversation(const ConnectionOptions& connection, bool interactive,
                                                   const Watchers& watchers);
    void answered(SentRequest& request, const Conversation::Reply& answer);
    void awaitAnswers(Leave leave, Conversation::Clock::time_point deadline);
    [[noreturn]] void fail(const Conversation::SessionEnd& end, const std::string& when);
    [[noreturn]] void failLost(const std::string& text, const std::string& when);

    Printer& printer_;
    Interrupt& interrupt_;
    Output& err_;
    bool outTerminal_;
    bool timing_;
    bool throughShell_;
    Conversation::Clock::time_point begin_;
    std::optional<Timing::Duration> ready_;  ///< until the first request has told it
    foundation::msg_svc::eventmgr::EventMgr events_;
    std::optional<Conversation::Clock::time_point> firstText_;
    RequestList requests_{events_};
    std::function<void()> showPictures_;
    bool engineFilesComplete_ = true;
    bool picturesAnnounced_ = false;
    capabilities::CapabilityList capabilities_;
    capabilities::CapabilityList engineCapabilities_;
    EngineProcess engine_;
    std::unique_ptr<Conversation> conversation_;
};

}  // namespace krutil_client
