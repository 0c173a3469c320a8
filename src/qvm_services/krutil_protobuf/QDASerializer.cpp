#include "QDASerializer.hpp"

#include <cstdlib>
#include <mutex>

#include "QDADataFrameReader.hpp"
#include "QDADataFrameWriter.hpp"
#include "foundation/korveldata/ArrayFactory.hpp"
#include "foundation/korveldata/protobuf/SerializationContext.hpp"

namespace krutil::protobuf_serializer {

namespace korveldata = foundation::korveldata;

namespace {

const std::string qdaName = "krutil:QDA";

bool zeroCopyAllowed = true;
std::once_flag environmentChecked;

void checkEnvironment() {
    const char* value = std::getenv("QX_DISABLE_ZEROCOPY");
    if (value != nullptr && *value != '\0') {
        zeroCopyAllowed = false;
    }
}

}  // namespace

QDASerializer::QDASerializer(const std::unordered_map<std::string, std::string>& features)
    : ArrayFamily(qdaName, typeid(korveldata::Array), {1U, 0U}), features_(features) {
    std::call_once(environmentChecked, checkEnvironment);
}

QDASerializer::~QDASerializer() = default;

bool QDASerializer::zeroCopy() noexcept {
    return zeroCopyAllowed;
}

FrameIndex QDASerializer::serialize(const korveldata::Array& array, StreamID streamID, FrameIndex frameIndex,
                                    const std::shared_ptr<MessageStream>& stream,
                                    const std::shared_ptr<const Registry>& /*registry*/,
                                    const SerializationContext& /*context*/) const {
    std::unique_ptr<korveldata::protobuf::KORVEL_Array> proto;
    {
        korveldata::ArrayFactory factory;
        std::shared_ptr<detail::QDADataFrameWriter> writer;
        if (zeroCopyAllowed) {
            writer = std::make_shared<detail::QDADataFrameWriter>(streamID, frameIndex, stream);
        }
        korveldata::protobuf::SerializationContext arrayContext(factory, true, false, writer, nullptr);
        proto = arrayContext.convertToProtobuf(array);
        if (writer) {
            frameIndex = writer->getNextFrameIndex();
        }
    }
    return writeTaggedFrame(*proto, name(), streamID, frameIndex, stream, objectFrame);
}

korveldata::Array QDASerializer::deserialize(FrameIndex frameIndex, const std::unique_ptr<Message>& message,
                                             const std::shared_ptr<const Registry>& /*registry*/,
                                             const SerializationContext& /*context*/) const {
    auto proto = korveldata::protobuf::createKORVEL_Array();
    readTaggedFrame(frameIndex, message, *proto, objectFrame);
    korveldata::ArrayFactory factory;
    std::shared_ptr<detail::QDADataFrameReader> reader;
    if (zeroCopyAllowed) {
        reader = std::make_shared<detail::QDADataFrameReader>(*message);
    }
    korveldata::protobuf::SerializationContext arrayContext(factory, true, false, nullptr, reader);
    return arrayContext.convertFromProtobuf(std::move(proto));
}

}  // namespace krutil::protobuf_serializer
