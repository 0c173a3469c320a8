// The requests that this client has sent and that the engine has not answered.
#pragma once

#include <boost/shared_ptr.hpp>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "foundation/msg_svc/eventmgr/EventMgr.hpp"
#include "foundation/msg_svc/exchange/IDType.hpp"
#include "krutil/base/ExitCode.hpp"
#include "krutil/cmddistributor/IIPReply.hpp"

namespace krutil_client {

/// What came of a request.
struct Answer {
    ExitCode exitCode;  ///< Ok, CodeError or Cancelled
    boost::shared_ptr<const krutil::cmddistributor::IIPReply> reply;
};

/// A request that was sent, as far as its events and its reply have told.
struct SentRequest {
    enum class State {
        Waiting,    ///< in the engine's queue
        Requeued,   ///< there again: the prompt that had taken it closed before its turn
        Running,    ///< its code runs
        HeldUp,     ///< by a prompt that its code has opened
        Discarded,  ///< it is not run
    };

    unsigned number;  ///< from 1, in the order in which requests were sent
    foundation::msg_svc::exchange::IDType id;
    std::string name;  ///< for a person; UTF-8
    State state = State::Waiting;
    bool errorPrinted = false;  ///< the engine has sent the text to print for its error
    bool withdrawn = false;     ///< the client itself has taken it back, so nobody waits for what comes of it
    std::optional<Answer> answer;
};

/// Keeps requests up to date by their events. An object belongs to one session. Main thread only.
class RequestList {
  public:
    using Sent = std::shared_ptr<SentRequest>;

    /// Subscribes to `events`, which must deliver nothing when the object has gone.
    explicit RequestList(foundation::msg_svc::eventmgr::EventMgr& events);
    RequestList(const RequestList&) = delete;
    RequestList& operator=(const RequestList&) = delete;

    /// Adds a request that has just been sent, and numbers it.
    void add(const Sent& request);

    /// A reply to the request has come. It keeps its number.
    void remove(const SentRequest& request);

    /// The requests in the order in which they were sent.
    const std::vector<Sent>& unanswered() const noexcept { return requests_; }

    /// Null for one that was answered or never sent.
    Sent find(const foundation::msg_svc::exchange::IDType& id) const;
    Sent find(unsigned number) const;

  private:
    std::vector<Sent> requests_;
    unsigned lastNumber_ = 0;
};

}  // namespace krutil_client
