// A client that asks a real engine and waits for the answers, as a program does that has nothing else to do.
#pragma once

#include <atomic>
#include <boost/shared_ptr.hpp>
#include <condition_variable>
#include <cstddef>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "cmddistributor/IIP.hpp"
#include "foundation/korveldata/Array.hpp"
#include "foundation/msg_svc/transport/layers/session/Session.hpp"
#include "krutil/session/EngineProcess.hpp"

namespace bench {

namespace session = foundation::msg_svc::transport::layers::session;

/// Bytes that an exchange takes on the stream.
struct Bytes {
    std::size_t there = 0;
    std::size_t back = 0;
};

/// A session with an engine, which ends with the object. For one thread.
class EngineClient : private session::SessionHandler {
  public:
    using Request = boost::shared_ptr<const cmddistributor::IIP>;
    using Arrays = std::vector<foundation::korveldata::Array>;

    /// A request to evaluate code, which may be sent any number of times.
    static Request evaluation(const std::string& code);

    /// With `counting`, bytes() counts what is sent and received, which takes time. With `sharedMemory`, large arrays
    /// stay where both ends see them.
    explicit EngineClient(krutil_client::EngineProcess engine, const session::Limits& limits = {},
                          bool counting = false, bool sharedMemory = false);
    /// The same with an engine of its own, which is given `arguments` besides "--stdio".
    explicit EngineClient(const std::vector<std::string>& arguments = {}, const session::Limits& limits = {},
                          bool counting = false, bool sharedMemory = false);
    ~EngineClient() override;

    /// Sends a request, and does not wait.
    void send(const Request& request);
    /// The same for a request to evaluate code.
    void send(const std::string& code) { send(evaluation(code)); }
    /// The same for a call of a function of the session, which returns as many outputs.
    void send(const std::string& function, Arrays arguments, unsigned long outputs = 0);
    /// Waits until all that was sent is answered. Throws std::runtime_error for a request that failed.
    void awaitAll();
    /// Sends and waits. Throws what both throw, and when what the code prints is not `expected`.
    void evaluate(const Request& request, const std::string& expected);
    void evaluate(const std::string& code, const std::string& expected) { evaluate(evaluation(code), expected); }
    /// The same for a request that must fail with an error of this name.
    void fail(const std::string& code, const std::string& identifier);

    /// Sends a call and waits for its outputs. Throws what both throw.
    Arrays call(const std::string& function, Arrays arguments, unsigned long outputs);

    /// Since it was asked last; the session must count.
    Bytes takeBytes();

  private:
    void onReply(session::framing::StreamID stream,
                 const boost::shared_ptr<const foundation::msg_svc::exchange::Reply>& reply) override;
    void onEvent(session::framing::StreamID stream,
                 const boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent>& event) override;
    void onEnd(const session::SessionEnd& end) override;

    void awaitReplies();

    krutil_client::EngineProcess engine_;
    std::atomic<std::size_t> sent_{0};

    // Written by the session's thread before `answered_`, which this thread waits for.
    std::u16string text_;
    std::string failure_;  // identifier of the error of the last request that failed
    boost::shared_ptr<const foundation::msg_svc::exchange::Reply> lastReply_;
    std::atomic<std::size_t> there_{0};
    std::atomic<std::size_t> back_{0};
    // A wait of an atomic would yield the core several times first, and the engine may be on the same one.
    std::mutex mutex_;
    std::condition_variable changed_;
    std::size_t answered_ = 0;
    bool over_ = false;

    std::unique_ptr<session::Session> session_;
};

}  // namespace bench
