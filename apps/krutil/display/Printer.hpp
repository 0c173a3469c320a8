// How a session is shown.
#pragma once

#include <chrono>
#include <cstddef>
#include <optional>
#include <string>
#include <unordered_map>

#include "cmddistributor/RuntimeException.hpp"
#include "foundation/korveldata/Array.hpp"
#include "foundation/msg_svc/eventmgr/EventMgr.hpp"
#include "foundation/msg_svc/exchange/IDType.hpp"
#include "foundation/msg_svc/transport/layers/session/Session.hpp"
#include "krutil/display/Pictures.hpp"

namespace krutil_client {

/// How a request ended.
struct Replied {
    foundation::msg_svc::exchange::IDType request;
    const cmddistributor::RuntimeException* error;  ///< null for success; valid during the call
    bool told = false;  ///< a person needs no text for the error: the engine has sent one, or nobody waits for it
};

/// An output of a function that was called. The references are valid during the call only.
struct Returned {
    foundation::msg_svc::exchange::IDType request;
    std::size_t number;  ///< from 1
    std::size_t count;   ///< of all outputs
    const foundation::korveldata::Array& array;
    const std::string& file;  ///< that it has been written to; empty for none
};

/// A form of a picture that has been written to a file. The references are valid during the call only.
struct Pictured {
    const Picture& picture;
    const PictureForm& form;
    const std::string& file;
};

/// How long things took; what did not happen is empty.
struct Timing {
    using Duration = std::chrono::steady_clock::duration;
    std::optional<Duration> ready;        ///< from the start of the program to the end of the handshake
    std::optional<Duration> firstOutput;  ///< from sending the request to the first text
    std::optional<Duration> answered;     ///< from sending the request to its reply
};

/// Shows what happens in a session. Called on the main thread only. Every member may throw what Output::write() throws.
class Printer {
  public:
    virtual ~Printer() = default;

    /// Subscribes to the events that this printer shows. The object must outlive the deliveries of `events`.
    virtual void subscribe(foundation::msg_svc::eventmgr::EventMgr& events) = 0;

    /// The handshake is done.
    virtual void connected(const foundation::msg_svc::transport::layers::session::Peer& peer,
                           const std::unordered_map<std::string, std::string>& features) = 0;

    /// A function call has succeeded; once for each output, in order, after its replied().
    virtual void returned(const Returned& output) = 0;

    /// A picture that a request has shown is in a file.
    virtual void pictured(const Pictured& picture) = 0;

    /// The reply to a request has come.
    virtual void replied(const Replied& reply) = 0;

    /// The program ends early, with this exit code. Standard error has the sentence already.
    virtual void failed(int exitCode, const std::string& sentence) = 0;

    virtual void timed(const Timing& timing) = 0;
};

}  // namespace krutil_client
