// Casts from a base class, quick where the class is the one that is expected.
#pragma once

#include <typeinfo>

namespace krutil::protobuf_serializer {

/// A dynamic cast to `To`, which is one comparison when the object is of exactly that class.
template <class To, class From>
const To* downcast(const From* object) {
    if constexpr (requires { static_cast<const To*>(object); }) {
        if (object != nullptr && typeid(*object) == typeid(To)) {
            return static_cast<const To*>(object);
        }
    }
    return dynamic_cast<const To*>(object);
}

/// The serializer as one of `Family`, null when it is of another. Some platforms know the family; asking costs less
/// than a dynamic cast.
template <class Family, class Serializer>
const Family* familyCast(const Serializer& serializer) {
    if constexpr (requires { asFamily<Family>(serializer); }) {
        return asFamily<Family>(serializer);
    } else {
        return dynamic_cast<const Family*>(&serializer);
    }
}

}  // namespace krutil::protobuf_serializer
