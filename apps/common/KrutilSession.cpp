#include "common/KrutilSession.hpp"

#include <cstdlib>
#include <vector>

#include "KrutilProtocol.hpp"
#include "krutil/capabilities_api/CapabilitiesChanged.hpp"
#include "krutil/eventmgr/QVMShutdownEvent.hpp"

namespace apps {
namespace {

namespace session = foundation::msg_svc::transport::layers::session;

// Whether bulk bytes travel beside their messages is decided once for the process, whatever its sessions settle. So a
// session that settled otherwise could not work.
const std::vector<session::UnusableFeature>& unusableFeatures() {
    static const std::vector<session::UnusableFeature> features = [] {
        const char* const value = std::getenv("QX_DISABLE_ZEROCOPY");
        const bool disabled = value != nullptr && *value != '\0';
        return std::vector<session::UnusableFeature>{
            disabled ? session::UnusableFeature{"ZEROCOPY", "enable", false, "QX_DISABLE_ZEROCOPY is set"}
                     : session::UnusableFeature{
                           "ZEROCOPY", "disable", true,
                           "has zero copy switched on; set QX_DISABLE_ZEROCOPY for both ends or for neither"}};
    }();
    return features;
}

}  // namespace

session::SessionConfig krutilSession(session::Role role) {
    using krutil::protobuf::KrutilProtocol;
    KrutilProtocol::init();
    session::SessionConfig config;
    config.role = role;
    config.protocol = KrutilProtocol::protocolName;
    config.version = KrutilProtocol::protocolVersion;
    config.shutdownEvent = typeid(krutil::eventmgr::QVMShutdownEvent);
    config.clientEvents = {typeid(krutil::capabilities_api::CapabilitiesChanged)};
    config.unusableFeatures = unusableFeatures();
    return config;
}

}  // namespace apps
