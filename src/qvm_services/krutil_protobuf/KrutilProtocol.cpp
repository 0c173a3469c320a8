#include "KrutilProtocol.hpp"

#include <mutex>

#include "CapabilitiesChangedSerializer.hpp"
#include "DebugLoopEventSerializer.hpp"
#include "EvalIIPSerializer.hpp"
#include "FEvalIIPSerializer.hpp"
#include "FEvalResultSerializer.hpp"
#include "IIPCancelMessageSerializer.hpp"
#include "IIPCancelReplySerializer.hpp"
#include "IIPEnqueueMessageSerializer.hpp"
#include "IIPReplySerializer.hpp"
#include "IIPResultSerializer.hpp"
#include "IIPStateEventSerializer.hpp"
#include "IssuedEnabledWarningEventSerializer.hpp"
#include "IssuedWarningEventSerializer.hpp"
#include "PrintableErrorEventSerializer.hpp"
#include "QDASerializer.hpp"
#include "QVMShutdownEventSerializer.hpp"
#include "SinkTextEventSerializer.hpp"
#include "TextBaseEventSerializer.hpp"
#include "foundation/msg_svc/transport/layers/session/ProtocolRegistry.hpp"

namespace krutil::protobuf {
namespace {

namespace layers = foundation::msg_svc::transport::layers;
using layers::serialization::SerializerBase;
using layers::session::FeatureHandling;
using layers::session::FeatureRequest;
using namespace protobuf_serializer;

using Features = std::unordered_map<std::string, std::string>;
using MakeSerializer = std::shared_ptr<const SerializerBase> (*)(const Features&);

// Serializers that depend on the settled features take them in their constructor.
template <class Serializer>
std::shared_ptr<const SerializerBase> make(const Features& features) {
    if constexpr (std::is_constructible_v<Serializer, const Features&>) {
        return std::make_shared<const Serializer>(features);
    } else {
        return std::make_shared<const Serializer>();
    }
}

// clang-format off

// Every type that the protocol carries, in the order in which a registry gets their serializers.
constexpr MakeSerializer serializers[] = {
    // serializer                                                          // registered name                                   family   frame type
    make<QVMShutdownEventSerializer>,                                      // krutil:QVMShutdownEvent                           event    29
    make<DebugLoopEventSerializer>,                                        // krutil:DebugLoopEvent                             event    29
    make<IIPStateEventSerializer<StartedEvent>>,                           // krutil:IIPStartedEvent                            event    29
    make<IIPStateEventSerializer<SuspendedEvent>>,                         // krutil:IIPSuspendedEvent                          event    29
    make<IIPStateEventSerializer<ResumedEvent>>,                           // krutil:IIPResumedEvent                            event    29
    make<IIPStateEventSerializer<DiscardedEvent>>,                         // krutil:IIPDiscardedEvent                          event    29
    make<IIPStateEventSerializer<RequeuedEvent>>,                          // krutil:IIPRequeuedEvent                           event    29
    make<IIPStateEventSerializer<ReactivatedEvent>>,                       // krutil:IIPReactivatedEvent                        event    29
    make<IIPStateEventSerializer<CompletedEvent>>,                         // krutil:IIPCompletedEvent                          event    29
    make<IIPStateEventSerializer<LastEvent>>,                              // krutil:detail::LastIIPEvent                       event    29
    make<TextBaseEventSerializer>,                                         // krutil:TextBaseEvent                              event    29
    make<SinkTextEventSerializer>,                                         // krutil:SinkTextEvent                              event    29
    make<IIPCancelMessageSerializer>,                                      // krutil:IIPCancelMessage                           message  27
    make<IIPCancelReplySerializer>,                                        // krutil:IIPCancelReply                             reply    29
    make<IIPEnqueueMessageSerializer>,                                     // krutil:IIPEnqueueMessage                          message  27
    make<EvalIIPSerializer>,                                               // krutil:EvalIIP                                    request  29
    make<IIPResultSerializer>,                                             // krutil:IIPResult                                  result   29
    make<IIPReplySerializer>,                                              // krutil:IIPReply                                   reply    29
    make<FEvalIIPSerializer>,                                              // krutil:FEvalIIP                                   request  29
    make<FEvalResultSerializer>,                                           // krutil:FEvalResult                                result   29
    make<QDASerializer>,                                                   // krutil:QDA                                        array    29
    make<IssuedWarningEventSerializer>,                                    // korvel:lang:diagnostic:IssuedWarningEvent         event    29
    make<IssuedEnabledWarningEventSerializer>,                             // korvel:lang:diagnostic:IssuedEnabledWarningEvent  event    27
    make<PrintableErrorEventSerializer>,                                   // krutil:PrintableErrorEvent                        event    29
    make<CapabilitiesChangedSerializer>,                                   // krutil:capabilities_api:CapabilitiesChanged       event    29
};

// clang-format on

constexpr std::pair<unsigned int, unsigned int> unknownVersion{0xFFFF, 0xFFFF};

// Both peers must settle on a value. The number is settled; what a platform calls it is not.
constexpr auto required = static_cast<FeatureHandling>(3);

std::once_flag registered;

}  // namespace

std::string KrutilProtocol::protocolName = "krutil";

const std::pair<unsigned int, unsigned int> KrutilProtocol::protocolVersion{1, 0};

std::vector<FeatureRequest> KrutilProtocol::supportedFeatures{
    {"ZEROCOPY", "enable", required},
    {"ZEROCOPY", "disable", required},
};

void KrutilProtocol::init() {
    std::call_once(registered, [] {
        layers::session::ProtocolRegistry::getRegistry()->registerProtocolInitializer(protocolName, protocolInitializer,
                                                                                      getConfiguration);
    });
}

std::pair<unsigned int, unsigned int> KrutilProtocol::protocolInitializer(
    const std::shared_ptr<layers::serialization::Registry>& registry,
    const std::pair<unsigned int, unsigned int>& version, const Features& features) {
    if (version != protocolVersion) {
        return unknownVersion;
    }
    for (const MakeSerializer makeSerializer : serializers) {
        registry->insert(makeSerializer(features));
    }
    return protocolVersion;
}

std::vector<FeatureRequest> KrutilProtocol::getConfiguration() {
    return supportedFeatures;
}

}  // namespace krutil::protobuf
