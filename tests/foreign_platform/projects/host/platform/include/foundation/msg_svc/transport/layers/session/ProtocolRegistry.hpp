// The protocols of the process. Protocols are registered before sessions begin; not synchronised.
#pragma once

#include <functional>
#include <map>
#include <memory>
#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

#include "foundation/msg_svc/transport/layers/serialization/Registry.hpp"
#include "foundation/msg_svc/transport/layers/session/FeatureRequest.hpp"

namespace foundation::msg_svc::transport::layers::session {

class ProtocolRegistry {
  public:
    using Version = std::pair<unsigned int, unsigned int>;
    using Initializer = std::function<Version(const std::shared_ptr<serialization::Registry>&, const Version&,
                                              const std::unordered_map<std::string, std::string>&)>;
    using Configuration = std::function<std::vector<FeatureRequest>()>;

    /// Not in a header: there is one in the process, whatever each library makes of inline functions.
    static std::shared_ptr<ProtocolRegistry> getRegistry();

    void registerProtocolInitializer(const std::string& name, Initializer initializer, Configuration configuration) {
        protocols_.emplace(name, std::make_pair(std::move(initializer), std::move(configuration)));
    }

    const std::pair<Initializer, Configuration>& protocol(const std::string& name) const { return protocols_.at(name); }

  private:
    std::map<std::string, std::pair<Initializer, Configuration>> protocols_;
};

}  // namespace foundation::msg_svc::transport::layers::session
