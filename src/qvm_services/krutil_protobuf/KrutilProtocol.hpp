// Makes the krutil protocol known to a host's message service.
#pragma once

#include <memory>
#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

#include "foundation/msg_svc/transport/layers/serialization/Registry.hpp"
#include "foundation/msg_svc/transport/layers/session/FeatureRequest.hpp"

// Marks what the shared library exports. The build defines it; users of the library need no definition.
#ifndef KRUTIL_PROTOBUF_EXPORT
#define KRUTIL_PROTOBUF_EXPORT
#endif

namespace krutil::protobuf {

/// Registration of the protocol "krutil". A host calls init() once; the message service then calls the two registered
/// functions for each session that speaks the protocol. The data members are filled when the library is loaded, before
/// any of the functions can run, from static constructors of the host too.
class KRUTIL_PROTOBUF_EXPORT KrutilProtocol {
  public:
    /// "krutil".
    static std::string protocolName;

    /// (1, 0).
    static const std::pair<unsigned int, unsigned int> protocolVersion;

    /// The feature values that the protocol works with, best first: "ZEROCOPY" = "enable", "ZEROCOPY" = "disable". A
    /// session must settle on one of them.
    static std::vector<foundation::msg_svc::transport::layers::session::FeatureRequest> supportedFeatures;

    /// Registers the protocol with the process's ProtocolRegistry. Any number of calls from any threads register it
    /// once; when the registry throws, the exception reaches the caller and the next call tries again. Throws
    /// std::system_error when the once mechanism fails.
    static void init();

    /// Fills a session's registry with one fresh serializer for each type that the protocol carries, in the order of
    /// the table in KrutilProtocol.cpp, and returns (1, 0). For any version but (1, 0) returns (0xFFFF, 0xFFFF) and
    /// inserts nothing. `features` holds the settled values, feature name to value.
    ///
    /// An exception of the registry or of a constructor reaches the caller; serializers inserted before it stay.
    static std::pair<unsigned int, unsigned int> protocolInitializer(
        const std::shared_ptr<foundation::msg_svc::transport::layers::serialization::Registry>& registry,
        const std::pair<unsigned int, unsigned int>& version,
        const std::unordered_map<std::string, std::string>& features);

    /// A copy of supportedFeatures, whatever the environment holds.
    static std::vector<foundation::msg_svc::transport::layers::session::FeatureRequest> getConfiguration();
};

}  // namespace krutil::protobuf
