// Where planes come from that are not copied. The order of the virtual functions is that of the host's libraries.
#pragma once

#include <memory>

namespace foundation::korveldata::protobuf {

class DataFrameReader {
  public:
    virtual std::unique_ptr<char[], void (*)(char*)> read(unsigned long place) = 0;
    virtual ~DataFrameReader() = default;
};

}  // namespace foundation::korveldata::protobuf
