// What contexts of the array library have in common.
#pragma once

namespace foundation::korveldata::protobuf {

/// Can be destroyed through the base, and nothing else.
class SerializationContextBase {
  public:
    virtual ~SerializationContextBase();
};

}  // namespace foundation::korveldata::protobuf
