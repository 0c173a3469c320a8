// How a session can fail. Every what() is a sentence for a person.
#pragma once

#include <stdexcept>

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

/// The peer sent something that the byte layout or the order of a session does not allow.
class ProtocolViolation : public SessionError {
  public:
    using SessionError::SessionError;
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
