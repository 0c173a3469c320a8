// A host whose static constructor calls into the library before main, on whatever order the images are initialised.

#include <cstdio>

#include "KrutilProtocol.hpp"
#include "cmddistributor/IIPStateEvent.hpp"
#include "foundation/korveldata/Array.hpp"
#include "foundation/msg_svc/transport/layers/session/ProtocolRegistry.hpp"

namespace {

using foundation::msg_svc::transport::layers::serialization::Registry;
using foundation::msg_svc::transport::layers::session::ProtocolRegistry;
using krutil::protobuf::KrutilProtocol;

struct Host {
    Host() {
        ready = KrutilProtocol::protocolName == "krutil" && KrutilProtocol::supportedFeatures.size() == 2 &&
                KrutilProtocol::supportedFeatures[0].value() == "enable" &&
                KrutilProtocol::supportedFeatures[1].value() == "disable" &&
                KrutilProtocol::protocolVersion == std::make_pair(1U, 0U);
        KrutilProtocol::init();
        configured = KrutilProtocol::getConfiguration().size() == 2;
        const auto registry = std::make_shared<Registry>();
        initialized =
            KrutilProtocol::protocolInitializer(registry, {1, 0}, {{"ZEROCOPY", "enable"}}) == std::make_pair(1U, 0U) &&
            registry->serializers().size() == 25 &&
            registry->find("krutil:QDA")->type() == typeid(foundation::korveldata::Array) &&
            registry->find("krutil:detail::LastIIPEvent")->type() == typeid(cmddistributor::LastIIPEvent);
    }

    bool ready = false;
    bool configured = false;
    bool initialized = false;
};

// Among the first of the program's own constructors.
__attribute__((init_priority(101))) const Host host;

}  // namespace

int main() {
    const bool registered = ProtocolRegistry::getRegistry()->find("krutil").configuration().size() == 2;
    if (host.ready && host.configured && host.initialized && registered) {
        return 0;
    }
    std::fprintf(stderr, "ready %d, configured %d, initialized %d, registered %d\n", host.ready, host.configured,
                 host.initialized, registered);
    return 1;
}
