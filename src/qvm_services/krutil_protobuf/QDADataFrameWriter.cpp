#include "QDADataFrameWriter.hpp"

#include <utility>

#include "ArrayFrameTypes.hpp"
#include "foundation/vantor/carrier/framing/DataFrame.hpp"

namespace krutil::protobuf_serializer::detail {

using foundation::vantor::carrier::framing::DataFrame;
using foundation::vantor::carrier::framing::Frame;
using foundation::vantor::carrier::framing::FrameIndex;
using foundation::vantor::carrier::framing::StreamID;

QDADataFrameWriter::QDADataFrameWriter(
    StreamID streamID, FrameIndex nextFrameIndex,
    std::shared_ptr<foundation::msg_svc::transport::layers::message::MessageStream> stream)
    : streamID_(streamID), nextFrameIndex_(nextFrameIndex), stream_(std::move(stream)) {}

unsigned long QDADataFrameWriter::write(std::unique_ptr<char[], std::function<void(char*)>>&& buffer,
                                        unsigned long size, int elementType) {
    // Moving keeps a plain function inside the deleter a plain function, which a reader in this process can unwrap.
    std::unique_ptr<Frame> frame = std::make_unique<DataFrame>(
        frameTypeOfElements(elementType), streamID_, std::make_pair(std::move(buffer), size), true, nextFrameIndex_);
    stream_->append(frame);
    return nextFrameIndex_++;
}

}  // namespace krutil::protobuf_serializer::detail
