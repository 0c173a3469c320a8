#include "foundation/msg_svc/transport/layers/session/ProtocolRegistry.hpp"

#include <stdexcept>

namespace foundation::msg_svc::transport::layers::session {

FeatureRequest::FeatureRequest(const std::string& name, const std::string& value, FeatureHandling handling)
    : name_(name), value_(value), handling_(handling) {}

std::shared_ptr<ProtocolRegistry> ProtocolRegistry::getRegistry() {
    // Built on first use, because libraries register from static constructors.
    static const auto registry = std::make_shared<ProtocolRegistry>();
    return registry;
}

void ProtocolRegistry::registerProtocolInitializer(
    const std::string& name,
    const std::function<std::pair<unsigned int, unsigned int>(
        const std::shared_ptr<serialization::Registry>&, const std::pair<unsigned int, unsigned int>&,
        const std::unordered_map<std::string, std::string>&)>& initializer,
    const std::function<std::vector<FeatureRequest>()>& configuration) {
    const std::lock_guard lock(mutex_);
    if (!protocols_.try_emplace(name, Protocol{initializer, configuration}).second) {
        throw std::invalid_argument("ProtocolRegistry: protocol \"" + name + "\" is registered already");
    }
}

ProtocolRegistry::Protocol ProtocolRegistry::find(const std::string& name) const {
    const std::lock_guard lock(mutex_);
    const auto found = protocols_.find(name);
    if (found == protocols_.end()) {
        throw std::out_of_range("ProtocolRegistry: no protocol named \"" + name + "\" is registered in this process");
    }
    return found->second;
}

bool ProtocolRegistry::unregister(const std::string& name) {
    const std::lock_guard lock(mutex_);
    return protocols_.erase(name) != 0;
}

}  // namespace foundation::msg_svc::transport::layers::session
