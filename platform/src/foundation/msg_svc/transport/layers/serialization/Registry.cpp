#include "foundation/msg_svc/transport/layers/serialization/Registry.hpp"

#include <cstdint>
#include <cstring>
#include <stdexcept>

namespace foundation::msg_svc::transport::layers::serialization {

SerializerBase::SerializerBase(const std::string& name, const std::type_info& type,
                               const std::pair<unsigned int, unsigned int>& version)
    : SerializerBase(name, type, version, typeid(SerializerBase)) {}

SerializerBase::SerializerBase(const std::string& name, const std::type_info& type,
                               const std::pair<unsigned int, unsigned int>& version, const std::type_info& family)
    : name_(name), type_(&type), family_(&family), version_(version) {}

SerializerBase::~SerializerBase() = default;

std::size_t Registry::HashOfName::operator()(std::string_view name) const noexcept {
    std::uint64_t end = 0;
    if (name.size() < sizeof end) {
        return std::hash<std::string_view>()(name);
    }
    std::memcpy(&end, name.data() + name.size() - sizeof end, sizeof end);
    return end + name.size();
}

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
    // Room first, so that nothing below the first insertion can leave the tables in disagreement.
    serializers_.reserve(serializers_.size() + 1);
    const auto named = byName_.emplace(serializer->name(), serializer).first;
    try {
        byTypeAddress_.emplace(serializer->type().name(), serializer);
        byType_.emplace(serializer->type(), serializer);
    } catch (...) {
        byTypeAddress_.erase(serializer->type().name());
        byName_.erase(named);
        throw;
    }
    serializers_.push_back(serializer);
}

const std::shared_ptr<const SerializerBase>& Registry::find(std::type_index type) const {
    const auto found = byTypeAddress_.find(type.name());
    return found != byTypeAddress_.end() ? found->second : byType_.at(type);
}

const std::shared_ptr<const SerializerBase>& Registry::find(std::string_view name) const {
    const auto found = byName_.find(name);
    if (found == byName_.end()) {
        throw std::out_of_range("Registry::find: no serializer is registered under the name \"" + std::string(name) +
                                "\"");
    }
    return found->second;
}

}  // namespace foundation::msg_svc::transport::layers::serialization
