// Where the elements of large arrays come from on the way in.
#pragma once

#include <memory>

namespace foundation::korveldata::protobuf {

/// Hands out the buffers that a DataFrameWriter took. Used by one thread at a time.
///
/// The order of the virtual members is fixed: hosts and this library are built apart.
class DataFrameReader {
  public:
    /// The buffer written under `dataID`, which the caller owns from now on. Its length does not come with it: the
    /// caller asks the BufferAllocator. Throws what the implementation throws when there is none.
    virtual std::unique_ptr<char[], void (*)(char*)> read(unsigned long dataID) = 0;

    virtual ~DataFrameReader();
};

}  // namespace foundation::korveldata::protobuf
