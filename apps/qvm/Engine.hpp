// One session of the engine, in a process of its own.
//
// Two threads meet here. The session's I/O thread queues what the client sends and never waits. The thread that calls
// run() owns Python, takes requests from the queue and answers them. For each request it raises, on the request's
// stream: started, its output, completed, last, and then the reply; a request that is never run has discarded and last
// instead. Running code may open prompts, which take further requests while it stands still: the running requests are a
// stack. docs/protocol.md tells the order of everything.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <thread>

#include "cmddistributor/IIPCancelMessage.hpp"
#include "cmddistributor/IIPEnqueueMessage.hpp"
#include "cmddistributor/IIPResult.hpp"
#include "foundation/msg_svc/transport/layers/session/Session.hpp"
#include "qvm/Options.hpp"
#include "qvm/process/AppendFile.hpp"
#include "qvm/process/FlushTimer.hpp"
#include "qvm/process/LastWords.hpp"
#include "qvm/process/Log.hpp"
#include "qvm/process/OutputCapture.hpp"
#include "qvm/process/OwnDescriptors.hpp"
#include "qvm/process/Seat.hpp"
#include "qvm/python/EngineServices.hpp"
#include "qvm/python/Interpreter.hpp"
#include "qvm/requests/Announcer.hpp"
#include "qvm/requests/Cancellation.hpp"
#include "qvm/requests/Capabilities.hpp"
#include "qvm/requests/Prompts.hpp"
#include "qvm/requests/Request.hpp"
#include "qvm/requests/RequestQueue.hpp"
#include "qvm/requests/TextOutput.hpp"

namespace qvm {

/// How a session's process ends.
enum class ExitCode : int {
    Ok = 0,
    Usage = 2,
    Lost = 3,       ///< cannot serve, the client went away, or a file lacks what should be in it
    Violation = 4,  ///< the client broke the protocol
    Refused = 5,    ///< protocol, version or features do not match
    Silent = 6,     ///< a client of a listening engine left before it said anything; for the listener only
};

/// See the head of this file.
class Engine : private foundation::msg_svc::transport::layers::session::SessionHandler,
               private EngineServices,
               private PromptHost {
  public:
    /// `seat` is the session's place among those of a listening engine; null for an engine of one session. With it,
    /// run() returns ExitCode::Silent for a client that leaves before it says anything, because the listener counts
    /// these. All three must outlive the object. Throws std::system_error when a file of the options cannot be opened.
    Engine(const Options& options, Log& log, Seat* seat = nullptr);
    ~Engine() override;

    /// Serves one session over the two descriptors, which it takes over, from the handshake to its end. Call once; the
    /// calling thread becomes Python's main thread. When the client is lost while code runs, the process ends here.
    ExitCode run(int in, int out);

  private:
    using Session = foundation::msg_svc::transport::layers::session::Session;
    using SessionEnd = foundation::msg_svc::transport::layers::session::SessionEnd;

    void onMessage(framing::StreamID stream,
                   const boost::shared_ptr<const foundation::msg_svc::exchange::Message>& message) override;
    void onEvent(framing::StreamID stream,
                 const boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent>& event) override;
    void onGoodbye() override;
    void onEnd(const SessionEnd& end) override;
    void enqueue(Announcer::Turn& turn, const Request& request);
    void cancel(Announcer::Turn& turn, framing::StreamID stream, const cmddistributor::IIPCancelMessage& message);

    bool canUse(::capabilities::Capability capability) override;
    PromptEnd prompt(krutil::prompt::InputRequester loop, const FrameChoice& frame,
                     std::optional<std::chrono::steady_clock::time_point> deadline) override;
    PromptEnd readText(std::u16string& text) override;
    bool leavePrompt(PromptEnd end) override;
    void issueWarning(korvel::lang::diagnostic::Warning warning) override;
    void setDebugging(bool on) override;
    int interruptDescriptor() override;
    bool takeInterrupt() override;
    bool repeatInterrupt() override;
    bool drainDescriptors() override;
    void sendAll() override;

    bool interrupted() override;
    void unlocked(const std::function<void()>& wait) override;
    void settle() override { settle(Until::Written); }

    bool open(int in, int out);
    ExitCode finishFiles(ExitCode code);
    void serve();
    void loop();
    std::optional<Request> next();
    bool handle(const Request& request, PyObject* frame);
    Interpreter::Ending runCode(const Request& request, PyObject* frame);
    void endWithout(bool descriptors);
    enum class Until { Room, Written };
    void settle(Until until);
    const Request* requestOfThisThread() const noexcept;
    void echo(const cmddistributor::EvalIIP& evaluation);

    const Options& options_;
    Log& log_;
    Seat* const seat_;
    const std::thread::id mainThread_ = std::this_thread::get_id();
    ExitCode exitCode_ = ExitCode::Ok;                  // of the I/O thread, until close() has joined it
    const std::unique_ptr<apps::Recording> recording_;  // null without one
    AppendFile diary_;
    RequestQueue queue_;
    Cancellation cancellation_;
    Capabilities capabilities_;

    // Of one session, in the order in which they are made.
    std::unique_ptr<Session> session_;
    std::unique_ptr<FlushTimer> timer_;
    std::unique_ptr<Announcer> announcer_;
    std::unique_ptr<TextOutput> output_;
    std::unique_ptr<Prompts> prompts_;
    std::unique_ptr<OutputCapture> capture_;
    std::unique_ptr<Interpreter> python_;
    std::optional<LastWords> lastWords_;
    std::optional<OwnDescriptors> descriptors_;
};

}  // namespace qvm
