// A host whose static constructor calls into the library before main, on whatever order the images are initialised.

#include <cstdio>

#include "KrutilProtocol.hpp"
#include "foundation/msg_svc/transport/layers/session/ProtocolRegistry.hpp"

namespace {

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
    }

    bool ready = false;
    bool configured = false;
};

// Among the first of the program's own constructors.
__attribute__((init_priority(101))) const Host host;

}  // namespace

int main() {
    const bool registered = ProtocolRegistry::getRegistry()->find("krutil").configuration().size() == 2;
    if (host.ready && host.configured && registered) {
        return 0;
    }
    std::fprintf(stderr, "ready %d, configured %d, registered %d\n", host.ready, host.configured, registered);
    return 1;
}
