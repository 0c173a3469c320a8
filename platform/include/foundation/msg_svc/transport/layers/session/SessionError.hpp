// How a session can fail. Every what() is a sentence for a person.
#pragma once

#include <stdexcept>
#include <string>
#include <utility>

namespace foundation::msg_svc::transport::layers::session {

/// Base of the failures of a session.
class SessionError : public std::runtime_error {
  public:
    using std::runtime_error::runtime_error;
};

/// The byte stream ended or failed before the session was over.
class StreamLost : public SessionError {
  public:
    using SessionError::SessionError;
};

/// The peer closed the stream before it had sent anything, as whoever only looks whether somebody listens does.
class PeerSilent : public StreamLost {
  public:
    using StreamLost::StreamLost;
};

/// The peer sent something that the byte layout or the order of a session does not allow.
class ProtocolViolation : public SessionError {
  public:
    using SessionError::SessionError;
};

/// The first bytes on the stream belong to no session. They need not be the peer's: a start-up script may have printed
/// them before the peer was started.
class StrayText : public ProtocolViolation {
  public:
    /// `text` is between quotes, with escapes for what a terminal should not get.
    StrayText(const std::string& what, std::string text) : ProtocolViolation(what), text_(std::move(text)) {}

    /// What came, as far as it was there and before a session begins in it, in a form to be shown.
    const std::string& text() const noexcept { return text_; }

  private:
    std::string text_;
};

/// The ends cannot work together: protocol, version, features or roles do not match. what() lists every mismatch.
class HandshakeRefused : public SessionError {
  public:
    using SessionError::SessionError;
};

/// An object is larger than the peer accepts. Nothing of it was sent, and the session goes on.
class LimitExceeded : public SessionError {
  public:
    using SessionError::SessionError;
};

}  // namespace foundation::msg_svc::transport::layers::session
