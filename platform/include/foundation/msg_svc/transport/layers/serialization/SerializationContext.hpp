// What a transport tells the serializers of one message.
#pragma once

namespace foundation::msg_svc::transport::layers::serialization {

/// Passed by reference through every serialize and deserialize call of one message. It holds nothing at present; it is
/// the place where a transport would add per-message settings without touching the serializers' signatures.
class SerializationContext {};

}  // namespace foundation::msg_svc::transport::layers::serialization
