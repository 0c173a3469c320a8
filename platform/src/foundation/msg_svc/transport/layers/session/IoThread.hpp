// The thread on which a session reads, and writes what the stream did not take at once.
#pragma once

#include <functional>
#include <mutex>
#include <thread>

#include "foundation/msg_svc/transport/layers/session/Asio.hpp"

namespace foundation::msg_svc::transport::layers::session {

/// Runs what is posted to an `io_context`. Members may be called from any thread, but start() once and before them.
class IoThread {
  public:
    explicit IoThread(asio::io_context& io) : io_(io), work_(io.get_executor()) {}

    /// Starts the thread. Signals are not delivered to it. `onOutOfMemory` is called on it when something that was
    /// posted has thrown std::bad_alloc; the rest goes on. Throws std::system_error where the process may have no more
    /// threads.
    void start(std::function<void()> onOutOfMemory);

    /// Lets the thread end when nothing is left to be done. On the thread itself.
    void release() { work_.reset(); }

    /// Waits for the thread's end. Several threads may.
    void join();

  private:
    bool run();

    asio::io_context& io_;
    asio::executor_work_guard<asio::io_context::executor_type> work_;
    std::mutex joinMutex_;
    std::thread thread_;
};

}  // namespace foundation::msg_svc::transport::layers::session
