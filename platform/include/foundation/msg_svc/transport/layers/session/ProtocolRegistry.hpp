// The protocols that this process can speak.
#pragma once

#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

#include "foundation/msg_svc/transport/layers/serialization/Registry.hpp"
#include "foundation/msg_svc/transport/layers/session/FeatureRequest.hpp"

namespace foundation::msg_svc::transport::layers::session {

/// (major, minor) of a protocol.
using ProtocolVersion = std::pair<unsigned int, unsigned int>;

/// Fills a session's registry for one protocol version and the settled feature values (name to value); returns the
/// version that it set up, or (0xFFFF, 0xFFFF) for one that it does not know.
using ProtocolInitializer =
    std::function<ProtocolVersion(const std::shared_ptr<serialization::Registry>&, const ProtocolVersion&,
                                  const std::unordered_map<std::string, std::string>&)>;

/// Lists the feature values that the protocol offers to negotiate.
using ProtocolConfiguration = std::function<std::vector<FeatureRequest>()>;

/// Process-wide table of protocols by name. All members may be called from any thread.
class ProtocolRegistry {
  public:
    /// What a protocol has registered.
    struct Protocol {
        ProtocolInitializer initialize;       ///< fills the registry of a session
        ProtocolConfiguration configuration;  ///< lists what a session may negotiate
    };

    /// The one registry of the process.
    static std::shared_ptr<ProtocolRegistry> getRegistry();

    /// Remembers both functions under `name`. Throws std::invalid_argument when the name is registered already.
    void registerProtocolInitializer(
        const std::string& name,
        const std::function<std::pair<unsigned int, unsigned int>(
            const std::shared_ptr<serialization::Registry>&, const std::pair<unsigned int, unsigned int>&,
            const std::unordered_map<std::string, std::string>&)>& initializer,
        const std::function<std::vector<FeatureRequest>()>& configuration);

    /// The functions registered under `name`; throws std::out_of_range for an unknown name.
    Protocol find(const std::string& name) const;

    /// Forgets a protocol; sessions that use it keep working. Returns whether the name was known.
    bool unregister(const std::string& name);

  private:
    mutable std::mutex mutex_;
    std::map<std::string, Protocol> protocols_;
};

}  // namespace foundation::msg_svc::transport::layers::session
