// Where planes go that are not copied. The order of the virtual functions is that of the host's libraries.
#pragma once

#include <functional>
#include <memory>

namespace foundation::korveldata::protobuf {

class DataFrameWriter {
  public:
    virtual unsigned long write(std::unique_ptr<char[], std::function<void(char*)>>&& buffer, unsigned long size,
                                int code) = 0;
    virtual ~DataFrameWriter() = default;
};

}  // namespace foundation::korveldata::protobuf
