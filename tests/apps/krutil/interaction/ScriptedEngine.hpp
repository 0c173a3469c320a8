// An engine in the test's own process, behind a Unix socket.
#pragma once

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <boost/make_shared.hpp>
#include <condition_variable>
#include <filesystem>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <utility>

#include "cmddistributor/EvalIIP.hpp"
#include "cmddistributor/IIPEnqueueMessage.hpp"
#include "common/KrutilSession.hpp"
#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "foundation/msg_svc/transport/layers/session/Session.hpp"
#include "krutil/cmddistributor/IIPReply.hpp"
#include "krutil/eventmgr/QVMShutdownEvent.hpp"
#include "support/TemporaryDirectory.hpp"

namespace krutil_client {

/// Serves one session and does what a test wants with each message, on the session's I/O thread.
class ScriptedEngine : private foundation::msg_svc::transport::layers::session::SessionHandler {
  public:
    using StreamID = foundation::msg_svc::transport::layers::session::framing::StreamID;
    using IDType = foundation::msg_svc::exchange::IDType;
    using Event = foundation::msg_svc::eventmgr::BaseEvent;
    using Reply = foundation::msg_svc::exchange::Reply;
    using Action =
        std::function<void(ScriptedEngine&, StreamID, const foundation::msg_svc::exchange::Message& message)>;

    explicit ScriptedEngine(Action action) : action_(std::move(action)) {
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        path_.copy(address.sun_path, sizeof address.sun_path - 1);
        listener_.reset(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
        if (::bind(listener_.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0 ||
            ::listen(listener_.get(), 1) != 0) {
            throw std::runtime_error("no socket at " + path_);
        }
        thread_ = std::thread([this] { serve(); });
    }

    ~ScriptedEngine() override {
        // Wakes a thread that still waits for a connection.
        ::shutdown(listener_.get(), SHUT_RDWR);
        stop();
        waitForEnd();
    }

    /// Returns once the session has ended, after which the test may read what its action wrote.
    void waitForEnd() {
        if (thread_.joinable()) {
            thread_.join();
        }
    }

    const std::string& path() const { return path_; }

    const capabilities::CapabilityList& clientCapabilities() const { return clientCapabilities_; }

    template <class EventT, class... Arguments>
    void event(StreamID stream, Arguments&&... arguments) {
        session_->send(stream, boost::shared_ptr<const Event>(
                                   boost::make_shared<const EventT>(std::forward<Arguments>(arguments)...)));
    }

    void reply(StreamID stream, const boost::shared_ptr<const Reply>& reply) { session_->send(stream, reply); }

    /// Answers a request, with an error or without.
    void answer(StreamID stream, const IDType& id,
                const boost::optional<cmddistributor::RuntimeException>& error = boost::none) {
        reply(stream, boost::make_shared<const krutil::cmddistributor::IIPReply>(
                          id, std::make_unique<cmddistributor::IIPResult>(id, error)));
    }

  private:
    void serve() {
        const int stream = ::accept4(listener_.get(), nullptr, nullptr, SOCK_CLOEXEC);
        if (stream < 0) {
            return;
        }
        namespace session = foundation::msg_svc::transport::layers::session;
        session_ = session::Session::open(stream, stream, apps::krutilSession(session::Role::Engine));
        clientCapabilities_ = session_->peer().capabilities;
        session_->start(*this);
        std::unique_lock lock(mutex_);
        changed_.wait(lock, [this] { return over_; });
        lock.unlock();
        session_->close();
    }

    void stop() {
        const std::lock_guard lock(mutex_);
        over_ = true;
        changed_.notify_all();
    }

    void onMessage(StreamID stream,
                   const boost::shared_ptr<const foundation::msg_svc::exchange::Message>& message) override {
        action_(*this, stream, *message);
    }

    void onEvent(StreamID, const boost::shared_ptr<const Event>&) override {}

    void onGoodbye() override {
        event<krutil::eventmgr::QVMShutdownEvent>(0);
        stop();
    }

    void onEnd(const foundation::msg_svc::transport::layers::session::SessionEnd&) override { stop(); }

    const Action action_;
    const test_support::TemporaryDirectory directory_;
    const std::string path_ = directory_.file("socket");
    foundation::core::posix::OwnedDescriptor listener_;
    std::unique_ptr<foundation::msg_svc::transport::layers::session::Session> session_;
    capabilities::CapabilityList clientCapabilities_;
    std::mutex mutex_;
    std::condition_variable changed_;
    bool over_ = false;
    std::thread thread_;
};

}  // namespace krutil_client
