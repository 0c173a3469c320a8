#include "foundation/msg_svc/transport/layers/session/ObjectWriter.hpp"

#include <boost/core/demangle.hpp>
#include <stdexcept>
#include <string>
#include <typeindex>
#include <typeinfo>
#include <utility>

#include "foundation/msg_svc/transport/layers/session/FrameKinds.hpp"
#include "foundation/msg_svc/transport/layers/session/OutgoingMessage.hpp"

namespace foundation::msg_svc::transport::layers::session {
namespace {

using Frames = std::vector<std::unique_ptr<framing::Frame>>;

// A serializer that breaks these would make the peer close the session.
void checkFrames(const std::vector<std::unique_ptr<framing::Frame>>& frames, framing::StreamID stream) {
    for (std::size_t i = 0; i < frames.size(); ++i) {
        if (!frames[i] || frames[i]->index() != i + 1 || frames[i]->streamID() != stream) {
            throw std::logic_error("Session::send: expected a serializer to write frame " + std::to_string(i + 1) +
                                   " on stream " + std::to_string(stream) + ", got " +
                                   (frames[i] ? "frame " + std::to_string(frames[i]->index()) + " on stream " +
                                                    std::to_string(frames[i]->streamID())
                                              : std::string("none")));
        }
    }
    if (frames.empty() || asTagged(*frames.back()) == nullptr) {
        throw std::logic_error("Session::send: expected a serializer to write a tagged frame last");
    }
}

}  // namespace

ObjectWriter::ObjectWriter(std::shared_ptr<const serialization::Registry> registry, PeerLimits limits)
    : registry_(std::move(registry)), limits_(std::move(limits)) {}

template <class T>
Frames ObjectWriter::write(framing::StreamID stream, const boost::shared_ptr<const T>& object) const {
    const T& referenced = *object;
    const std::type_info& type = typeid(referenced);
    const serialization::SerializerBase* found = nullptr;
    try {
        found = registry_->find(std::type_index(type)).get();
    } catch (const std::out_of_range&) {
        throw std::out_of_range("Session::send: no serializer is registered for " + boost::core::demangle(type.name()));
    }
    const auto* const serializer = serialization::asFamily<RootSerializer<T>>(*found);
    if (serializer == nullptr) {
        throw std::bad_cast();
    }
    const auto collected = std::make_shared<OutgoingMessage>();
    serializer->serialize(object, stream, 1, collected, registry_, serialization::SerializationContext());
    auto frames = collected->takeFrames();
    checkFrames(frames, stream);
    limits_.check(frames);
    return frames;
}

template Frames ObjectWriter::write(framing::StreamID, const boost::shared_ptr<const exchange::Message>&) const;
template Frames ObjectWriter::write(framing::StreamID, const boost::shared_ptr<const exchange::Reply>&) const;
template Frames ObjectWriter::write(framing::StreamID, const boost::shared_ptr<const eventmgr::BaseEvent>&) const;

}  // namespace foundation::msg_svc::transport::layers::session
