// What a session makes of what has arrived whole: whether it may be said now, and which object it is.
#pragma once

#include <boost/shared_ptr.hpp>
#include <memory>
#include <string>
#include <vector>

#include "foundation/msg_svc/transport/layers/session/Exchanges.hpp"
#include "foundation/msg_svc/transport/layers/session/FrameNotes.hpp"
#include "foundation/msg_svc/transport/layers/session/ObjectWriter.hpp"
#include "foundation/msg_svc/transport/layers/session/Session.hpp"

namespace foundation::msg_svc::transport::layers::session {

/// Judges what one end has said to the other, in the order in which it arrives. One thread.
class Intake {
  public:
    using Frames = std::vector<std::unique_ptr<framing::Frame>>;

    /// `config.role` is that of the end that receives. All references must outlive this object. `arrayTag` is the tag
    /// of what refers to data frames.
    Intake(const SessionConfig& config, std::shared_ptr<const serialization::Registry> registry, std::string arrayTag,
           SharedExchanges& exchanges);

    /// A goodbye of the peer. Throws ProtocolViolation when there must be none now.
    void takeGoodbye(SessionHandler& handler);

    /// A sign of life of the peer. Throws ProtocolViolation when there must be none now.
    void takeKeepAlive();

    /// The frames of one message of the peer, of which its object is made. Throws ProtocolViolation for a message that
    /// may not be sent now or cannot be read; nothing of it has reached the handler then.
    void takeMessage(Frames frames, SessionHandler& handler);

  private:
    Role speaker() const noexcept { return config_.role == Role::Client ? Role::Engine : Role::Client; }
    void expectMore();
    template <class T>
    boost::shared_ptr<const T> rebuild(const RootSerializer<T>& serializer, Frames frames);

    const SessionConfig& config_;
    const std::shared_ptr<const serialization::Registry> registry_;
    const std::string arrayTag_;
    SharedExchanges& exchanges_;
    FrameNotes notes_;
};

}  // namespace foundation::msg_svc::transport::layers::session
