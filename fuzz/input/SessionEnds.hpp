// Ends of sessions, and the sockets that they speak through.
#pragma once

#include <sys/socket.h>

#include <chrono>
#include <condition_variable>
#include <mutex>

#include "common/KrutilSession.hpp"
#include "common/Precheck.hpp"
#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "foundation/msg_svc/transport/layers/session/Session.hpp"
#include "input/Require.hpp"

namespace fuzz {

namespace eventmgr = foundation::msg_svc::eventmgr;
namespace exchange = foundation::msg_svc::exchange;
namespace session = foundation::msg_svc::transport::layers::session;
using foundation::core::posix::OwnedDescriptor;

struct SocketPair {
    explicit SocketPair(int flags = 0) {
        int ends[2] = {-1, -1};
        require(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | flags, 0, ends) == 0, "there are sockets");
        near.reset(ends[0]);
        far.reset(ends[1]);
    }

    OwnedDescriptor near;
    OwnedDescriptor far;
};

/// An end as the programs open it, with small limits, so that a search does not spend its time on filling buffers.
inline session::SessionConfig configOf(session::Role role) {
    session::SessionConfig config = apps::krutilSession(role);
    config.handshakeTimeout = std::chrono::seconds(10);
    config.check = apps::precheck(true);
    config.limits.taggedFrame = 1U << 20;
    config.limits.arrayMessage = 1U << 20;
    config.limits.message = 4U << 20;
    config.keepAlive = std::chrono::hours(1);
    return config;
}

/// What one end of a session sees. Each session that is started must end, and once.
class Witness final : public session::SessionHandler {
  public:
    void onMessage(session::framing::StreamID, const boost::shared_ptr<const exchange::Message>&) override {
        ++arrived_;
    }
    void onReply(session::framing::StreamID, const boost::shared_ptr<const exchange::Reply>&) override { ++arrived_; }
    void onEvent(session::framing::StreamID, const boost::shared_ptr<const eventmgr::BaseEvent>&) override {
        ++arrived_;
    }
    void onGoodbye() override { note(goodbye_); }
    void onEnd(const session::SessionEnd&) override {
        require(!ended_, "a session ends once");
        note(ended_);
    }

    /// Waits until the client has said goodbye, or the session has ended: an engine that was told goodbye ends when its
    /// host closes it.
    void waitForLastWord() {
        waitFor([this] { return goodbye_ || ended_; });
    }
    void waitForEnd() {
        waitFor([this] { return ended_; });
    }

    /// Messages, replies and events. To be asked when the session has ended.
    unsigned arrived() const noexcept { return arrived_; }

  private:
    void note(bool& fact) {
        const std::lock_guard lock(mutex_);
        fact = true;
        changed_.notify_all();
    }
    template <class Condition>
    void waitFor(const Condition& holds) {
        std::unique_lock lock(mutex_);
        require(changed_.wait_for(lock, std::chrono::seconds(20), holds), "a session ends with its stream");
    }

    unsigned arrived_ = 0;  // written by the session's thread alone, and read behind its end
    std::mutex mutex_;
    std::condition_variable changed_;
    bool goodbye_ = false;
    bool ended_ = false;
};

}  // namespace fuzz
