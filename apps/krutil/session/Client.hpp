// What every command of the program works with: an engine, a session with it, and a printer.
#pragma once

#include <boost/shared_ptr.hpp>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "cmddistributor/IIP.hpp"
#include "foundation/msg_svc/eventmgr/EventMgr.hpp"
#include "krutil/base/ExitCode.hpp"
#include "krutil/base/Interrupt.hpp"
#include "krutil/base/Options.hpp"
#include "krutil/base/Output.hpp"
#include "krutil/cmddistributor/IIPReply.hpp"
#include "krutil/cmddistributor/WhenToDequeue.hpp"
#include "krutil/display/Printer.hpp"
#include "krutil/session/Conversation.hpp"
#include "krutil/session/EngineProcess.hpp"
#include "krutil/session/Tracer.hpp"

namespace krutil_client {

/// What came of a request.
struct Answer {
    ExitCode exitCode;  ///< Ok, CodeError or Cancelled
    boost::shared_ptr<const krutil::cmddistributor::IIPReply> reply;
};

/// Starts or reaches the engine, sends requests, and ends in good order. Failures of the engine or the session come out
/// as Failure, with a sentence that says which. Main thread only.
class Client {
  public:
    /// `interactive` tells the engine that there is a person who can be asked and who can use a debugger. `printer`,
    /// `err` and `interrupt` must outlive the object. Blocks until the handshake is done. Throws Failure, Cancelled.
    Client(const ConnectionOptions& connection, const DisplayOptions& display, Printer& printer, const Output& out,
           Output& err, Interrupt& interrupt, bool interactive);
    ~Client();
    Client(const Client&) = delete;
    Client& operator=(const Client&) = delete;

    foundation::msg_svc::eventmgr::EventMgr& events() noexcept { return events_; }
    Conversation& conversation() noexcept { return *conversation_; }
    EngineProcess& engine() noexcept { return engine_; }

    /// Traits of the sinks that this program shows a request's output and errors in.
    krutil::io::SinkTraits outTraits(const SinkOptions& options) const;
    krutil::io::SinkTraits errTraits(const SinkOptions& options) const;

    /// Sends a request and shows what comes, up to how it ended; what else the reply holds is the caller's to show.
    /// `name` is UTF-8. Throws Failure and what printing and Ctrl-C throw.
    Answer request(const boost::shared_ptr<const cmddistributor::IIP>& iip,
                   krutil::cmddistributor::WhenToDequeue::WhenToDequeue when, const std::string& name, bool sparingly);

    /// The requests that have not been answered, the innermost one last: requests nest at prompts.
    const std::vector<foundation::msg_svc::exchange::IDType>& unanswered() const noexcept { return unanswered_; }

    /// Whether requests from now on are timed.
    void setTiming(bool on) noexcept { timing_ = on; }
    bool timing() const noexcept { return timing_; }

    /// Tells the engine whether the person here uses a debugger; nothing is sent when that changes nothing.
    void setDebugging(bool on);

    /// Throws the Failure that tells how a session ended early. `when` follows on the sentence.
    [[noreturn]] void lost(const SessionOver& over, const std::string& when) { fail(over.end(), when); }

    /// Ends the session because the engine broke the protocol: throws a Failure with `text`.
    [[noreturn]] void violated(const std::string& text);

    /// Says goodbye, waits until the engine has gone, and ends one that does not go. Returns what a person should know
    /// about how it went, empty when all is well. Throws Failure when the engine broke the protocol meanwhile.
    std::string finish();

  private:
    std::unique_ptr<Conversation> openConversation(const ConnectionOptions& connection, bool interactive);
    void say(const std::string& sentence);
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
    std::vector<foundation::msg_svc::exchange::IDType> unanswered_;
    capabilities::CapabilityList capabilities_;
    capabilities::CapabilityList engineCapabilities_;
    std::unique_ptr<Tracer> tracer_;
    EngineProcess engine_;
    std::unique_ptr<Conversation> conversation_;
};

}  // namespace krutil_client
