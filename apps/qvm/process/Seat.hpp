// A session's side of what a listening engine allows: its place among the sessions.
#pragma once

#include <chrono>
#include <cstddef>
#include <string>

#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionConfig.hpp"

namespace qvm {

/// What a session and its listener say to each other, a byte each. The end of the line says that the handshake is over.
namespace seat_words {
inline constexpr char ask = 'a';       ///< session: may this be a session?
inline constexpr char yes = 'y';       ///< listener: it counts as one now
inline constexpr char full = 'n';      ///< listener: there are as many as there may be
inline constexpr char withdraw = 'w';  ///< listener: the handshake has lasted too long, and others need its place
}  // namespace seat_words

/// In the process of a session: asks the listener for its place while it shakes hands. Without the listener, which may
/// have been killed, nobody counts, and everything is allowed.
class Seat {
  public:
    /// `line` leads to the listener. `maxSessions` and `maxHandshakes` are its bounds, for what a refusal says.
    /// `patience` is how long an answer may take.
    Seat(foundation::core::posix::OwnedDescriptor line, std::size_t maxSessions, std::size_t maxHandshakes,
         std::chrono::milliseconds patience);

    /// For the configuration of the session. The object must outlive the handshake.
    foundation::msg_svc::transport::layers::session::Admission admission();

    /// Whether the listener, which has said so itself, has refused the session.
    bool isRefused() const noexcept { return refused_; }

    /// Tells the listener that the handshake is over.
    void leaveLine() noexcept { line_.reset(); }

  private:
    std::string refusal();
    std::string refuse(std::string why);

    foundation::core::posix::OwnedDescriptor line_;
    std::size_t maxSessions_;
    std::size_t maxHandshakes_;
    bool refused_ = false;
};

/// Why a listener with so many sessions has no place for another one, as a sentence for a client.
std::string fullOfSessions(std::size_t maxSessions);

}  // namespace qvm
