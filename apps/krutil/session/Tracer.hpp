// Every frame of a session, for a person who looks into it.
#pragma once

#include <mutex>
#include <optional>
#include <string>

#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "foundation/msg_svc/transport/layers/session/Session.hpp"

namespace krutil_client {

namespace posix = foundation::core::posix;

/// One line for a frame, without the newline and in printable ASCII:
///
///     --> stream 1 frame 2 last type 27 krutil:IIPEnqueueMessage 53 bytes: iipHandle: 1 iipid { ... } ...
///     <-- stream 1 frame 1 type 4 data 8 bytes: 00000000000000f03f
///
/// An arrow to the right goes to the engine. Content is shown up to 2,000 characters, bytes up to 32.
std::string traceLine(const foundation::msg_svc::transport::layers::session::FrameTrace& trace);

/// Writes these lines to standard error, to a file or to both, as soon as a frame is there: what ends the program ends
/// no trace early. Lines of several threads are not mixed. When a line cannot be written to the file, one sentence on
/// standard error says so, and the file gets no more of them. Thread-safe.
class Tracer {
  public:
    /// `file` is emptied, or created for this user alone; see apps::openOwnFile(). Throws Failure (Usage) when it
    /// cannot be opened or is not this user's.
    Tracer(bool toStandardError, const std::optional<std::string>& file);

    void operator()(const foundation::msg_svc::transport::layers::session::FrameTrace& trace);

    /// Whether the file has every line.
    bool isComplete();

  private:
    const bool toStandardError_;
    const std::string fileName_;
    std::mutex mutex_;
    posix::OwnedDescriptor file_;
    bool complete_ = true;
};

}  // namespace krutil_client
