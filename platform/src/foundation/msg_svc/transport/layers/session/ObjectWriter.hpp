// Objects become the frames of messages that the peer accepts.
#pragma once

#include <boost/shared_ptr.hpp>
#include <memory>
#include <vector>

#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"
#include "foundation/msg_svc/exchange/Message.hpp"
#include "foundation/msg_svc/exchange/Reply.hpp"
#include "foundation/msg_svc/transport/layers/serialization/SerializerAPI.hpp"
#include "foundation/msg_svc/transport/layers/session/PeerLimits.hpp"

namespace foundation::msg_svc::transport::layers::session {

/// Serializer of a family of objects that can be the root of a message.
template <class T>
using RootSerializer = serialization::SerializerAPI<T, boost::shared_ptr<const T>, boost::shared_ptr<const T>>;

/// Immutable; any thread.
class ObjectWriter {
  public:
    ObjectWriter(std::shared_ptr<const serialization::Registry> registry, PeerLimits limits);

    /// All frames of one message, the first with index 1. `T` is Message, Reply or BaseEvent; the object is not null.
    /// Throws std::out_of_range for a type without a serializer, LimitExceeded, std::logic_error for a serializer that
    /// writes no message, and whatever the serializer throws.
    template <class T>
    std::vector<std::unique_ptr<framing::Frame>> write(framing::StreamID stream,
                                                       const boost::shared_ptr<const T>& object) const;

  private:
    std::shared_ptr<const serialization::Registry> registry_;
    PeerLimits limits_;
};

}  // namespace foundation::msg_svc::transport::layers::session
