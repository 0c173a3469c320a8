// What every serializer is, whatever family of types it handles.
#pragma once

#include <string>
#include <typeinfo>
#include <utility>

namespace foundation::msg_svc::transport::layers::serialization {

/// Identity of a serializer: the name under which a registry finds it and which tags its frames, the in-process class
/// that it handles, and its version. Immutable after construction, so any number of threads may use one object.
class SerializerBase {
  public:
    /// `name` is copied; `type` is that of the concrete class whose objects the serializer handles.
    SerializerBase(const std::string& name, const std::type_info& type,
                   const std::pair<unsigned int, unsigned int>& version);
    virtual ~SerializerBase();
    SerializerBase(const SerializerBase&) = delete;
    SerializerBase& operator=(const SerializerBase&) = delete;

    /// Also the tag of the objects' frames.
    const std::string& name() const noexcept { return name_; }
    /// The concrete class whose objects the serializer handles.
    const std::type_info& type() const noexcept { return *type_; }
    /// (major, minor).
    const std::pair<unsigned int, unsigned int>& version() const noexcept { return version_; }

    /// The SerializerAPI that this is; SerializerBase for an object that is none.
    const std::type_info& family() const noexcept { return *family_; }

  protected:
    /// For `family`, a SerializerAPI.
    SerializerBase(const std::string& name, const std::type_info& type,
                   const std::pair<unsigned int, unsigned int>& version, const std::type_info& family);

  private:
    std::string name_;
    const std::type_info* type_;
    const std::type_info* family_;
    std::pair<unsigned int, unsigned int> version_;
};

}  // namespace foundation::msg_svc::transport::layers::serialization
