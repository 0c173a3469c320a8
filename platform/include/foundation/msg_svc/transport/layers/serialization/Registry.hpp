// The serializers of one session.
#pragma once

#include <memory>
#include <string>
#include <typeindex>
#include <unordered_map>
#include <vector>

#include "foundation/msg_svc/transport/layers/serialization/SerializerBase.hpp"

namespace foundation::msg_svc::transport::layers::serialization {

/// Finds serializers by the dynamic type of an object to write and by the tag of a frame to read. Filled once, by the
/// protocol's initializer; look-ups may run from several threads as long as nobody inserts.
class Registry {
  public:
    Registry();
    ~Registry();
    Registry(const Registry&) = delete;
    Registry& operator=(const Registry&) = delete;

    /// Adds one serializer and shares its ownership. Throws std::invalid_argument, and adds nothing, for a null pointer
    /// and for a name or a type that is registered already.
    void insert(const std::shared_ptr<const SerializerBase>& serializer);

    /// The serializer of exactly this type (base classes do not count); throws std::out_of_range when there is none.
    std::shared_ptr<const SerializerBase> find(std::type_index type) const;

    /// The serializer registered under this name; throws std::out_of_range when there is none.
    std::shared_ptr<const SerializerBase> find(const std::string& name) const;

    /// All serializers, in the order of insertion.
    const std::vector<std::shared_ptr<const SerializerBase>>& serializers() const noexcept { return serializers_; }

  private:
    std::vector<std::shared_ptr<const SerializerBase>> serializers_;
    std::unordered_map<std::string, std::shared_ptr<const SerializerBase>> byName_;
    std::unordered_map<std::type_index, std::shared_ptr<const SerializerBase>> byType_;
};

}  // namespace foundation::msg_svc::transport::layers::serialization
