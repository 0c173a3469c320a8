// Signs of life on a stream that is idle.
#pragma once

#include <chrono>

#include "foundation/msg_svc/transport/layers/session/Asio.hpp"
#include "foundation/msg_svc/transport/layers/session/Exchanges.hpp"
#include "foundation/msg_svc/transport/layers/session/Outgoing.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionConfig.hpp"

namespace foundation::msg_svc::transport::layers::session {

/// Sends them where both ends have settled on that: a client at each interval, an engine for each that has come. So
/// there is something for a proxy to see in both directions, and only the client needs a timer. One thread, that of the
/// I/O context.
class KeepAlive {
  public:
    /// `settled`: whether there are any. All references must outlive the object.
    KeepAlive(asio::io_context& io, const SessionConfig& config, bool settled, SharedExchanges& exchanges,
              Outgoing& outgoing)
        : timer_(io),
          interval_(config.keepAlive),
          settled_(settled),
          role_(config.role),
          exchanges_(exchanges),
          outgoing_(outgoing) {}

    bool isSettled() const noexcept { return settled_; }

    /// To be called once, when the session begins.
    void start();

    /// To be called for each that has come.
    void answer();

    void stop() { timer_.cancel(); }

  private:
    void send(bool answer);

    asio::steady_timer timer_;
    const std::chrono::milliseconds interval_;
    const bool settled_;
    const Role role_;
    SharedExchanges& exchanges_;
    Outgoing& outgoing_;
};

}  // namespace foundation::msg_svc::transport::layers::session
