// Identity of a serializer. Immutable.
#pragma once

#include <string>
#include <typeindex>
#include <typeinfo>
#include <utility>

namespace foundation::msg_svc::transport::layers::serialization {

class SerializerBase {
  public:
    SerializerBase(const std::string& name, const std::type_info& type, std::pair<unsigned int, unsigned int> version)
        : type_(type), ownCopyOfTheName_(name), version_(version) {}
    virtual ~SerializerBase() = default;

    std::string name() const { return ownCopyOfTheName_; }
    std::type_index handles() const { return type_; }
    std::pair<unsigned int, unsigned int> version() const { return version_; }

  private:
    std::type_index type_;
    std::string ownCopyOfTheName_;
    std::pair<unsigned int, unsigned int> version_;
};

}  // namespace foundation::msg_svc::transport::layers::serialization
