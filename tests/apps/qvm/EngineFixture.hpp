// A real krutil-qvm process and a real client session to it, for tests of what an engine does.
//
//     EngineProcess engine({"--stdio"});
//     EngineClient client(engine.connection());
//     const Evaluation result = client.eval("print(1 + 1)");
//     EXPECT_EQ(result.output(), "2\n");
//
// Every request's events and its reply are checked for their order as they come (RequestLife.hpp).
#pragma once

#include <sys/types.h>

#include <atomic>
#include <boost/optional.hpp>
#include <chrono>
#include <condition_variable>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "RequestLife.hpp"
#include "capabilities/CapabilityList.hpp"
#include "cmddistributor/CodeType.hpp"
#include "cmddistributor/DebugLoopEvent.hpp"
#include "cmddistributor/IIP.hpp"
#include "cmddistributor/IIPCancelReply.hpp"
#include "cmddistributor/IIPResult.hpp"
#include "cmddistributor/IqmStreamID.hpp"
#include "cmddistributor/RuntimeException.hpp"
#include "foundation/msg_svc/transport/layers/session/Session.hpp"
#include "krutil/cmddistributor/IIPReply.hpp"
#include "krutil/cmddistributor/WhenToDequeue.hpp"
#include "krutil/io/SinkTraits.hpp"
#include "krutil/io/StreamTypeEnum.hpp"

namespace qvm_test {

namespace session = foundation::msg_svc::transport::layers::session;
using foundation::msg_svc::eventmgr::BaseEvent;
using foundation::msg_svc::exchange::IDType;
using foundation::msg_svc::exchange::Reply;
using krutil::io::StreamTypeEnum;

/// How long anything may take before a test gives up.
inline constexpr std::chrono::seconds kPatience{60};

/// The program, started with the given arguments. With --stdio its descriptors 0 and 1 are one end of a socket pair.
/// The destructor kills what still runs.
class EngineProcess {
  public:
    explicit EngineProcess(const std::vector<std::string>& arguments);
    ~EngineProcess();
    EngineProcess(const EngineProcess&) = delete;
    EngineProcess& operator=(const EngineProcess&) = delete;

    pid_t pid() const noexcept { return pid_; }

    /// This end of the socket pair; the caller owns it. Call once.
    int connection();

    /// Waits for the end of the process; returns its exit code, or minus the number of the signal that ended it.
    int wait();

    /// Sends a signal to the process.
    void signal(int number);

    /// Waits until the process's standard error holds `text`; returns all of it so far.
    std::string awaitStderr(const std::string& text);

    /// What there is on the process's standard error now.
    std::string stderrText();

  private:
    void readStderr(int timeoutMilliseconds);

    pid_t pid_ = -1;
    int connection_ = -1;
    int stderr_ = -1;
    std::string stderrText_;
    boost::optional<int> exitCode_;
};

/// A connection to a listening engine.
int connectTo(const std::string& path);

/// One event, as a test looks at it. Texts are UTF-8.
struct Happening {
    std::string kind;  ///< type name without namespace: "IIPStartedEvent", "TextBaseEvent", ...
    IDType id;
    StreamTypeEnum type = StreamTypeEnum::OUTPUT_STREAM;  ///< of a text
    std::string text;
    boost::shared_ptr<const BaseEvent> event;
};

/// All that came back for one request.
struct Evaluation {
    IDType id;
    std::vector<Happening> events;  ///< on the request's stream, in order
    boost::optional<cmddistributor::RuntimeException> error;
    boost::shared_ptr<const krutil::cmddistributor::IIPReply> reply;

    std::string output() const { return text("TextBaseEvent", StreamTypeEnum::OUTPUT_STREAM); }
    std::string errors() const { return text("TextBaseEvent", StreamTypeEnum::ERROR_STREAM); }
    std::string generic() const { return text("TextBaseEvent", StreamTypeEnum::GENERIC_STREAM); }
    std::string shown() const { return text("SinkTextEvent", StreamTypeEnum::OUTPUT_STREAM); }

    /// All texts of one kind, joined.
    std::string text(const std::string& kind, StreamTypeEnum type) const;

    /// Kinds of the events in order. Pieces of one text count as one: a line that takes long to be written comes in
    /// several.
    std::vector<std::string> kinds() const;

    bool discarded() const;
    /// Text of the error; empty for none.
    std::string errorText() const;
    std::string errorId() const { return error ? error->GetID() : std::string(); }
};

/// What a request asks for besides its code.
struct EvalOptions {
    cmddistributor::CodeType codeType = cmddistributor::CodeType::CodeBlockType;
    cmddistributor::IqmStreamID streams = cmddistributor::IqmStreamID::ekIqmCmdWinStream;
    krutil::io::SinkTraits out;
    krutil::io::SinkTraits err;
    krutil::cmddistributor::WhenToDequeue::WhenToDequeue mode = krutil::cmddistributor::WhenToDequeue::DEQUEUE_AT_IDLE;
    bool flushSparingly = false;
    std::string pluginType = "python";
    capabilities::CapabilityList capabilities;  ///< that it needs
};

/// The client's end of a session. All members are for the test's thread.
class EngineClient : private session::SessionHandler {
  public:
    explicit EngineClient(int connection, const session::Limits& limits = {},
                          const capabilities::CapabilityList& capabilities = {});
    ~EngineClient() override;

    /// Sends a request and does not wait.
    IDType enqueue(const std::string& code, const EvalOptions& options = {});
    /// The same for any kind of request.
    IDType enqueue(const boost::shared_ptr<const cmddistributor::IIP>& iip, const EvalOptions& options = {});

    /// Waits for the reply. Throws std::runtime_error when the session ends
    /// or the patience is over before.
    Evaluation await(const IDType& id);

    Evaluation eval(const std::string& code, const EvalOptions& options = {}) { return await(enqueue(code, options)); }

    /// Sends a cancel and does not wait; the result is for awaitCancel().
    session::framing::StreamID startCancel(const IDType& id, bool evenIfRunning = true);
    cmddistributor::IIPCancelReply::CancelStatus awaitCancel(session::framing::StreamID cancel);
    cmddistributor::IIPCancelReply::CancelStatus cancel(const IDType& id, bool evenIfRunning = true) {
        return awaitCancel(startCancel(id, evenIfRunning));
    }

    /// States other capabilities from now on.
    void changeCapabilities(const capabilities::CapabilityList& capabilities);

    /// Waits until the request enters (or leaves) a loop.
    void awaitLoop(const IDType& id, cmddistributor::DebugLoopEvent::State state);
    /// Waits until the request has an event of this kind.
    void awaitKind(const IDType& id, const std::string& kind);

    /// Reads nothing from the next event on, until readOn().
    void stopReading();
    void readOn();

    /// Waits until an event for which `isMeant` holds has come, on whatever stream; returns it.
    Happening awaitEvent(const std::function<bool(const Happening&)>& isMeant);
    /// The same for a text event that contains `part`.
    Happening awaitText(const std::string& part);

    /// Events on stream 0 so far, and their texts joined.
    std::vector<Happening> background();
    std::string backgroundText();

    /// Waits for the end of the session.
    session::SessionEnd awaitEnd();

    /// Says goodbye and waits for the end of the session.
    session::SessionEnd goodbye();

    /// Requests that are sent to stream 1000 go to `number` instead, which may be one that a well-behaved client does
    /// not send (0 to 16,383).
    void replaceStream1000(int number) { streamNumber_ = number; }

    /// Takes so much longer to read each event from now on.
    void slowDown(std::chrono::microseconds time) { slowness_ = time; }

    session::Session& session() { return *session_; }

  private:
    struct Exchange {
        IDType id;
        session_test::RequestLife life;  ///< of a request
        std::vector<Happening> events;
        boost::shared_ptr<const krutil::cmddistributor::IIPReply> reply;
        boost::shared_ptr<const cmddistributor::IIPCancelReply> cancelReply;
    };

    void onReply(session::framing::StreamID stream, const boost::shared_ptr<const Reply>& reply) override;
    void onEvent(session::framing::StreamID stream, const boost::shared_ptr<const BaseEvent>& event) override;
    void onEnd(const session::SessionEnd& end) override;

    template <class Ready>
    void waitUntil(std::unique_lock<std::mutex>& lock, const std::string& what, Ready ready);

    void patch(const session::FrameTrace& trace) const;

    std::unique_ptr<session::Session> session_;
    int streamNumber_ = 1000;
    std::atomic<std::chrono::microseconds> slowness_{std::chrono::microseconds(0)};
    std::mutex mutex_;
    std::condition_variable changed_;
    std::map<session::framing::StreamID, Exchange> exchanges_;
    std::map<IDType, session::framing::StreamID> streams_;
    std::vector<Happening> background_;
    std::vector<Happening> all_;
    bool reading_ = true;
    boost::optional<session::SessionEnd> end_;
};

/// A directory of its own, removed with all that is in it.
class TemporaryDirectory {
  public:
    TemporaryDirectory();
    ~TemporaryDirectory();
    TemporaryDirectory(const TemporaryDirectory&) = delete;
    TemporaryDirectory& operator=(const TemporaryDirectory&) = delete;

    /// Path of a file in it.
    std::string file(const std::string& name) const { return path_ + "/" + name; }
    const std::string& path() const noexcept { return path_; }

  private:
    std::string path_;
};

/// Holds running code up until the test lets it go on.
class Gate {
  public:
    Gate();

    /// Python code that waits for open().
    std::string wait() const { return "open('" + path_ + "').read()"; }

    /// Lets one waiter go on; waits until there is one.
    void open();

  private:
    TemporaryDirectory directory_;
    std::string path_;
};

/// All of a file; empty when there is none.
std::string contentsOf(const std::string& path);

/// An engine on standard input and output, and a client to it.
struct EngineSession {
    explicit EngineSession(std::vector<std::string> arguments = {}, const session::Limits& limits = {},
                           const capabilities::CapabilityList& capabilities = {});

    EngineProcess process;
    EngineClient client;
};

}  // namespace qvm_test
