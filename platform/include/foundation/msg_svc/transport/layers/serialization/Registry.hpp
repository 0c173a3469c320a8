// The serializers of one session.
#pragma once

#include <functional>
#include <memory>
#include <string>
#include <string_view>
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
    /// The reference stays valid as long as the registry.
    const std::shared_ptr<const SerializerBase>& find(std::type_index type) const;

    /// The serializer registered under this name; throws std::out_of_range when there is none. The reference stays
    /// valid as long as the registry.
    const std::shared_ptr<const SerializerBase>& find(std::string_view name) const;

    /// All serializers, in the order of insertion.
    const std::vector<std::shared_ptr<const SerializerBase>>& serializers() const noexcept { return serializers_; }

  private:
    // Names differ in length and at their ends, so the last eight characters will do.
    struct HashOfName {
        using is_transparent = void;
        std::size_t operator()(std::string_view name) const noexcept;
    };

    std::vector<std::shared_ptr<const SerializerBase>> serializers_;
    std::unordered_map<std::string, std::shared_ptr<const SerializerBase>, HashOfName, std::equal_to<>> byName_;
    std::unordered_map<std::type_index, std::shared_ptr<const SerializerBase>> byType_;
    // The same once more by the address of the type's name, which is quicker to hash. Another library may have a type's
    // name at an address of its own; then the table above answers.
    std::unordered_map<const char*, std::shared_ptr<const SerializerBase>> byTypeAddress_;
};

}  // namespace foundation::msg_svc::transport::layers::serialization
