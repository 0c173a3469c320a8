// Arrays and their message. Not synchronised.
#pragma once

#include <memory>

#include "arrays.pb.h"
#include "foundation/korveldata/Array.hpp"
#include "foundation/korveldata/ArrayFactory.hpp"
#include "foundation/korveldata/protobuf/DataFrameReader.hpp"
#include "foundation/korveldata/protobuf/DataFrameWriter.hpp"

namespace foundation::korveldata::protobuf {

inline std::unique_ptr<KORVEL_Array> createKORVEL_Array() {
    return std::make_unique<KORVEL_Array>();
}

class SerializationContext {
  public:
    /// `shareable`: planes go to the writer as they are. `dense` is for arrays that this platform does not have.
    SerializationContext(ArrayFactory& factory, bool shareable, bool dense, std::shared_ptr<DataFrameWriter> writer,
                         std::shared_ptr<DataFrameReader> reader);

    std::unique_ptr<KORVEL_Array> convertToProtobuf(const Array& array);

    /// Throws std::runtime_error for a plane whose size is not what the message says.
    Array convertFromProtobuf(std::unique_ptr<KORVEL_Array> message);

  private:
    ArrayFactory& factory_;
    bool shareable_;
    std::shared_ptr<DataFrameWriter> writer_;
    std::shared_ptr<DataFrameReader> reader_;
};

}  // namespace foundation::korveldata::protobuf
