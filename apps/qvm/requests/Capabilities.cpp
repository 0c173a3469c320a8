#include "qvm/requests/Capabilities.hpp"

namespace qvm {

Capabilities::Lists Capabilities::lists() const {
    const std::lock_guard lock(mutex_);
    return {engine_.without(engine_.without(client_)), engine_, client_};
}

void Capabilities::setClient(const List& client) {
    const std::lock_guard lock(mutex_);
    client_ = client;
}

void Capabilities::setEngine(::capabilities::Capability capability, bool on) {
    const std::lock_guard lock(mutex_);
    if (on) {
        engine_ |= capability;
    } else {
        engine_ = engine_.without({capability});
    }
}

std::string Capabilities::lacking(const List& needed) const {
    const Lists now = lists();
    const List ofEngine = needed.without(now.engine);
    const List ofClient = needed.without(now.client);
    std::string text;
    if (!ofEngine.empty()) {
        text = "This request needs capabilities that the engine does not have: " + toString(ofEngine) + ".";
    }
    if (!ofClient.empty()) {
        text += (text.empty() ? "This request needs" : " It needs") +
                std::string(" capabilities that the client does not have: ") + toString(ofClient) + ".";
    }
    return text;
}

}  // namespace qvm
