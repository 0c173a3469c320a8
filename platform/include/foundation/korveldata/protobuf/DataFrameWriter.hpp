// Where the elements of large arrays go on the way out.
#pragma once

#include <functional>
#include <memory>

namespace foundation::korveldata::protobuf {

/// Takes element buffers that shall not be copied into an array's message. Used by one thread at a time.
///
/// The order of the virtual members is fixed: hosts and this library are built apart.
class DataFrameWriter {
  public:
    /// Takes over `buffer` with its deleter; the bytes are only to be read. `size` is in bytes, `elementType` one of
    /// the codes of ElementType. Returns the data ID under which a DataFrameReader finds the buffer again.
    virtual unsigned long write(std::unique_ptr<char[], std::function<void(char*)>>&& buffer, unsigned long size,
                                int elementType) = 0;

    virtual ~DataFrameWriter();
};

}  // namespace foundation::korveldata::protobuf
