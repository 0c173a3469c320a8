// What an engine's end of a session says, as its client hears it. Both ends are in this process.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "apps/qvm/requests/TestRequests.hpp"
#include "platform/session/support/TestSessions.hpp"
#include "qvm/process/AppendFile.hpp"
#include "qvm/process/Log.hpp"
#include "qvm/requests/Announcer.hpp"
#include "support/TemporaryDirectory.hpp"

namespace qvm_test {

/// A client, its session with this process, and the announcer of that session.
class ServedClient {
  public:
    /// `limits` are the client's.
    explicit ServedClient(const foundation::msg_svc::transport::layers::session::Limits& limits = {});
    ~ServedClient() { timer_.stop(); }
    ServedClient(const ServedClient&) = delete;
    ServedClient& operator=(const ServedClient&) = delete;

    /// A request that the client has sent and the engine's end has received, so that its exchange is open.
    qvm::Request send(const RequestParts& parts);

    qvm::Announcer& announcer() noexcept { return announcer_; }

    /// Shuts the session down. Returns a line for each object that the client has received before the shutdown event:
    /// the stream, and what it is. Fails the test for an event that does not carry the identifier of its stream's
    /// request.
    std::vector<std::string> received();

    /// What the announcer has put into the diary and the log. Lines of the log begin with the time.
    std::string diary() const;
    std::string log() const;

  private:
    class Client : public testing_sessions::Recorder {
      public:
        void onReply(qvm::framing::StreamID stream,
                     const boost::shared_ptr<const foundation::msg_svc::exchange::Reply>& reply) override;
        void onEvent(qvm::framing::StreamID stream,
                     const boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent>& event) override;
    };
    class Engine : public testing_sessions::Recorder {
      public:
        void onMessage(qvm::framing::StreamID stream,
                       const boost::shared_ptr<const foundation::msg_svc::exchange::Message>& message) override;
    };

    test_support::TemporaryDirectory files_;
    qvm::Log log_{files_.file("log")};
    qvm::AppendFile diary_{files_.file("diary"), [this](const std::string& sentence) { log_.say(sentence); }};
    Client clientSaw_;
    Engine engineSaw_;
    testing_sessions::OpenedPair opened_;
    qvm::FlushTimer timer_{[this](qvm::FlushTimer::Time now) { return announcer_.flushDue(now); }};
    qvm::Announcer announcer_;
};

}  // namespace qvm_test
