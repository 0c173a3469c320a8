// The serializers of a session. Read by any number of threads once it is filled.
#pragma once

#include <algorithm>
#include <list>
#include <memory>
#include <stdexcept>
#include <string>
#include <typeindex>

#include "foundation/msg_svc/transport/layers/serialization/SerializerBase.hpp"

namespace foundation::msg_svc::transport::layers::serialization {

class Registry {
  public:
    using Entry = std::shared_ptr<const SerializerBase>;

    void insert(Entry serializer) { entries_.push_back(std::move(serializer)); }

    Entry find(std::type_index type) const {
        return theOne([type](const Entry& entry) { return entry->handles() == type; });
    }
    Entry find(const std::string& name) const {
        return theOne([&name](const Entry& entry) { return entry->name() == name; });
    }

    const std::list<Entry>& entries() const { return entries_; }

  private:
    template <class Predicate>
    Entry theOne(Predicate predicate) const {
        const auto found = std::find_if(entries_.begin(), entries_.end(), predicate);
        return found == entries_.end() ? throw std::out_of_range("no such serializer") : *found;
    }

    std::list<Entry> entries_;
};

}  // namespace foundation::msg_svc::transport::layers::serialization
