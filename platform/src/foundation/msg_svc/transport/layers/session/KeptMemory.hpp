// Memory of large arrays that the process keeps for others, and for how long.
#pragma once

#include <chrono>

#include "foundation/msg_svc/transport/layers/session/Asio.hpp"

namespace foundation::msg_svc::transport::layers::session {

/// Has BufferAllocator give back what nobody has used for a while, as long as the process has large memory at all. One
/// thread, that of the I/O context.
class KeptMemory {
  public:
    KeptMemory(asio::io_context& io, std::chrono::milliseconds keep) : timer_(io), keep_(keep) {}

    /// To be called after messages: they are the reason for large memory.
    void watch();

    void stop();

  private:
    asio::steady_timer timer_;
    const std::chrono::milliseconds keep_;
    bool watching_ = false;
};

}  // namespace foundation::msg_svc::transport::layers::session
