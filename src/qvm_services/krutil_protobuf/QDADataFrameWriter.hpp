// Puts element buffers of arrays into data frames.
#pragma once

#include <memory>

#include "foundation/korveldata/protobuf/DataFrameWriter.hpp"
#include "foundation/msg_svc/transport/layers/message/MessageStream.hpp"

namespace krutil::protobuf_serializer::detail {

/// Lives for one serialize call of an array; not synchronised.
class QDADataFrameWriter final : public foundation::korveldata::protobuf::DataFrameWriter {
  public:
    /// The first frame gets the index `nextFrameIndex`.
    QDADataFrameWriter(foundation::vantor::carrier::framing::StreamID streamID,
                       foundation::vantor::carrier::framing::FrameIndex nextFrameIndex,
                       std::shared_ptr<foundation::msg_svc::transport::layers::message::MessageStream> stream);

    /// Moves `buffer` and its deleter into a data frame and appends it; no byte is copied. Returns the frame's index.
    /// When the stream throws, the exception passes and the index is not used up.
    unsigned long write(std::unique_ptr<char[], std::function<void(char*)>>&& buffer, unsigned long size,
                        int elementType) override;

    /// The index that the next frame will get.
    foundation::vantor::carrier::framing::FrameIndex getNextFrameIndex() const noexcept { return nextFrameIndex_; }

  private:
    foundation::vantor::carrier::framing::StreamID streamID_;
    foundation::vantor::carrier::framing::FrameIndex nextFrameIndex_;
    std::shared_ptr<foundation::msg_svc::transport::layers::message::MessageStream> stream_;
};

}  // namespace krutil::protobuf_serializer::detail
