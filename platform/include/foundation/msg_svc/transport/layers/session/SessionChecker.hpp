// Checks the frames of a session that others hold.
#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <unordered_map>

#include "foundation/msg_svc/transport/layers/session/Limits.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionConfig.hpp"

namespace foundation::msg_svc::transport::layers::session {

/// Says of frames that were recorded what their receiver would have said: the rules are those of Session itself, down
/// to their texts. Of shared memory it sees the contents, and not the memory. Makes no threads and uses no descriptors.
/// Not synchronised.
class SessionChecker {
  public:
    /// What the handshake of the session has settled.
    struct Settled {
        Limits clientLimits;                                    ///< what the client accepts
        Limits engineLimits;                                    ///< what the engine accepts
        std::unordered_map<std::string, std::string> features;  ///< of the protocol, name to value
        bool sharedMemory = false;                              ///< contents may be in memory that both ends see
        bool keepAlive = false;                                 ///< there may be frames that are signs of life
    };

    /// `config` is that of the end that has recorded: its role, and what it says of the protocol, counts. Throws
    /// std::out_of_range for a protocol that is not registered.
    SessionChecker(const SessionConfig& config, const Settled& settled);

    /// Destroys the checker.
    ~SessionChecker();
    SessionChecker(const SessionChecker&) = delete;
    SessionChecker& operator=(const SessionChecker&) = delete;

    /// The next frame in the order of the recording, which the end of the role `sender` has sent: header, tag, content,
    /// and what that lies in shared memory. Throws ProtocolViolation when a rule is broken; the object must not be used
    /// again then.
    void take(Role sender, std::string_view frame);

    /// Whether that end may stop here: none of its messages is begun.
    bool atBoundary(Role sender) const noexcept;

  private:
    class Impl;
    const std::unique_ptr<Impl> impl_;
};

}  // namespace foundation::msg_svc::transport::layers::session
