// Every frame of a session, for a person who looks into it.
#pragma once

#include <mutex>
#include <string>

#include "foundation/msg_svc/transport/layers/session/Session.hpp"

namespace client {

/// One line for a frame, without the newline and in printable ASCII:
///
///     --> stream 1 frame 2 last type 27 krutil:IIPEnqueueMessage 53 bytes: iipHandle: 1 iipid { ... } ...
///     <-- stream 1 frame 1 type 4 data 8 bytes: 00000000000000f03f
///
/// An arrow to the right goes to the engine. Content is shown up to 2,000 characters, bytes up to 32.
std::string traceLine(const foundation::msg_svc::transport::layers::session::FrameTrace& trace);

/// Writes these lines to standard error; from any thread.
class Tracer {
  public:
    void operator()(const foundation::msg_svc::transport::layers::session::FrameTrace& trace);

  private:
    std::mutex mutex_;
};

}  // namespace client
