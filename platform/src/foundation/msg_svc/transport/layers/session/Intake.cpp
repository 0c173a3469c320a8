#include "foundation/msg_svc/transport/layers/session/Intake.hpp"

#include <stdexcept>
#include <utility>

#include "foundation/msg_svc/transport/layers/message/Message.hpp"
#include "foundation/msg_svc/transport/layers/session/FrameKinds.hpp"
#include "foundation/msg_svc/transport/layers/session/PrintableText.hpp"
#include "foundation/msg_svc/transport/layers/session/RefusalTexts.hpp"

namespace foundation::msg_svc::transport::layers::session {

Intake::Intake(const SessionConfig& config, std::shared_ptr<const serialization::Registry> registry,
               std::string arrayTag, SharedExchanges& exchanges)
    : config_(config), registry_(std::move(registry)), arrayTag_(std::move(arrayTag)), exchanges_(exchanges) {}

void Intake::expectMore() {
    std::optional<Refusal> refusal;
    {
        const std::lock_guard lock(exchanges_.mutex);
        refusal = exchanges_.exchanges.sayAnything(speaker());
    }
    if (refusal) {
        throw ProtocolViolation(refusalToReceive(*refusal, Saying::Goodbye, config_.role, 0, {}));
    }
}

void Intake::takeKeepAlive() {
    // A client goes on with them after its goodbye, while it waits for the rest.
    if (speaker() == Role::Engine) {
        expectMore();
    }
}

void Intake::takeGoodbye(SessionHandler& handler) {
    std::optional<Refusal> refusal;
    {
        const std::lock_guard lock(exchanges_.mutex);
        refusal = exchanges_.exchanges.say(speaker(), Saying::Goodbye, 0);
    }
    if (refusal) {
        throw ProtocolViolation(refusalToReceive(*refusal, Saying::Goodbye, config_.role, 0, {}));
    }
    handler.onGoodbye();
}

void Intake::takeMessage(Frames frames, SessionHandler& handler) {
    expectMore();
    if (config_.trace) {
        for (const auto& frame : frames) {
            config_.trace({false, frame == frames.back(), *frame});
        }
    }
    const framing::StreamID stream = frames.back()->streamID();
    const auto* const root = asTagged(*frames.back());
    const auto refuse = [stream](const std::string& why) {
        throw ProtocolViolation("message on stream " + std::to_string(stream) + ": " + why);
    };
    if (root == nullptr) {
        refuse("expected a tagged frame as its last one, got a data frame");
    }
    const serialization::SerializerBase* serializer = nullptr;
    try {
        serializer = registry_->find(root->tag()).get();
    } catch (const std::out_of_range&) {
        refuse("no serializer is registered for its tag " + quoted(root->tag()));
    }
    const auto* const messages = serialization::asFamily<RootSerializer<exchange::Message>>(*serializer);
    const auto* const replies = serialization::asFamily<RootSerializer<exchange::Reply>>(*serializer);
    const auto* const events = serialization::asFamily<RootSerializer<eventmgr::BaseEvent>>(*serializer);
    if (messages == nullptr && replies == nullptr && events == nullptr) {
        refuse(quoted(root->tag()) + " is only ever referred to and cannot be the last frame");
    }
    const Saying saying = messages != nullptr  ? Saying::Message
                          : replies != nullptr ? Saying::Reply
                                               : sayingOfEvent(serializer->type(), config_);
    std::optional<Refusal> refusal;
    {
        const std::lock_guard lock(exchanges_.mutex);
        refusal = exchanges_.exchanges.say(speaker(), saying, stream);
    }
    if (refusal) {
        throw ProtocolViolation(refusalToReceive(*refusal, saying, config_.role, stream, root->tag()));
    }
    if (config_.check) {
        for (const auto& frame : frames) {
            if (const auto* const tagged = asTagged(*frame)) {
                config_.check->check(*tagged, config_.limits.parts);
            }
        }
    }
    if (messages != nullptr) {
        handler.onMessage(stream, rebuild(*messages, std::move(frames)));
    } else if (replies != nullptr) {
        handler.onReply(stream, rebuild(*replies, std::move(frames)));
    } else {
        handler.onEvent(stream, rebuild(*events, std::move(frames)));
    }
}

// Objects.

template <class T>
boost::shared_ptr<const T> Intake::rebuild(const RootSerializer<T>& serializer, Frames frames) {
    const framing::FrameIndex root = frames.size();
    notes_.take(frames);
    // Indexes of a message start at 1.
    frames.insert(frames.begin(), nullptr);
    const auto message = std::make_unique<message::Message>(std::move(frames));
    const auto refuse = [&](const std::string& why) {
        throw ProtocolViolation("cannot read " + quoted(serializer.name()) + ": " + why);
    };
    boost::shared_ptr<const T> object;
    try {
        object = serializer.deserialize(root, message, registry_, serialization::SerializationContext());
    } catch (const std::exception& error) {
        refuse(notes_.explain(error, *registry_, arrayTag_));
    } catch (...) {
        refuse("exception of an unknown type");
    }
    if (!object) {
        refuse("its serializer returned no object");
    }
    return object;
}

}  // namespace foundation::msg_svc::transport::layers::session
