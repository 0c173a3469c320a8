#include "foundation/msg_svc/transport/layers/serialization/Registry.hpp"

#include <stdexcept>

namespace foundation::msg_svc::transport::layers::serialization {

SerializerBase::SerializerBase(const std::string& name, const std::type_info& type,
                               const std::pair<unsigned int, unsigned int>& version)
    : name_(name), type_(&type), version_(version) {}

SerializerBase::~SerializerBase() = default;

Registry::Registry() = default;
Registry::~Registry() = default;

void Registry::insert(const std::shared_ptr<const SerializerBase>& serializer) {
    if (!serializer) {
        throw std::invalid_argument("Registry::insert: expected a serializer, got a null pointer");
    }
    if (byName_.contains(serializer->name())) {
        throw std::invalid_argument("Registry::insert: a serializer named \"" + serializer->name() +
                                    "\" is registered already");
    }
    if (byType_.contains(serializer->type())) {
        throw std::invalid_argument("Registry::insert: \"" + serializer->name() + "\" handles the same type as \"" +
                                    byType_.at(serializer->type())->name() + "\", which is registered already");
    }
    // Room first, so that nothing below the first insertion can leave the three tables in disagreement.
    serializers_.reserve(serializers_.size() + 1);
    const auto named = byName_.emplace(serializer->name(), serializer).first;
    try {
        byType_.emplace(serializer->type(), serializer);
    } catch (...) {
        byName_.erase(named);
        throw;
    }
    serializers_.push_back(serializer);
}

std::shared_ptr<const SerializerBase> Registry::find(std::type_index type) const {
    return byType_.at(type);
}

std::shared_ptr<const SerializerBase> Registry::find(const std::string& name) const {
    return byName_.at(name);
}

}  // namespace foundation::msg_svc::transport::layers::serialization
