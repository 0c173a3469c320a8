// Takes element buffers of arrays out of data frames.
#pragma once

#include <memory>

#include "foundation/korveldata/protobuf/DataFrameReader.hpp"
#include "foundation/msg_svc/transport/layers/message/Message.hpp"

namespace krutil::protobuf_serializer::detail {

/// Lives for one deserialize call of an array; refers to the received message and does not own it. Not synchronised.
class QDADataFrameReader final : public foundation::korveldata::protobuf::DataFrameReader {
  public:
    explicit QDADataFrameReader(foundation::msg_svc::transport::layers::message::Message& message);

    /// Moves the data frame at `dataID` out of the message and its buffer out of the frame; no byte is copied. Throws
    /// std::bad_cast when no data frame is there (any more). A buffer whose deleter is not a plain function of type
    /// void(char*) ends the process: the transport that built the frame is at fault.
    std::unique_ptr<char[], void (*)(char*)> read(unsigned long dataID) override;

  private:
    foundation::msg_svc::transport::layers::message::Message& message_;
};

}  // namespace krutil::protobuf_serializer::detail
