#include "krutil_protobuf/support/TestTransport.hpp"

#include <algorithm>

#include "KrutilProtocol.hpp"
#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"

namespace transport {

void RecordingStream::append(std::unique_ptr<Frame>& frame) {
    frames.push_back(std::move(frame));
}

FrameContent contentOf(const Frame& frame) {
    const auto* tagged = dynamic_cast<const TaggedFrame*>(&frame);
    return {tagged != nullptr,
            frame.type(),
            frame.streamID(),
            frame.index(),
            std::string(tagged != nullptr ? tagged->tag() : std::string_view()),
            std::string(frame.data(), frame.size())};
}

std::vector<FrameContent> contentOf(const Frames& frames) {
    std::vector<FrameContent> contents;
    for (const auto& frame : frames) {
        contents.push_back(contentOf(*frame));
    }
    return contents;
}

FrameBuffer makeBuffer(const std::string& bytes) {
    FrameBuffer buffer = foundation::vantor::carrier::framing::BufferAllocator::makeFrameBuffer(bytes.size());
    std::copy(bytes.begin(), bytes.end(), buffer.first.get());
    return buffer;
}

std::unique_ptr<Frame> makeFrame(const FrameContent& content) {
    if (content.tagged) {
        FrameBuffer buffer{std::unique_ptr<char[], std::function<void(char*)>>(new char[content.bytes.size()],
                                                                               std::default_delete<char[]>()),
                           content.bytes.size()};
        std::copy(content.bytes.begin(), content.bytes.end(), buffer.first.get());
        return std::make_unique<TaggedFrame>(content.type, content.streamID, content.tag, std::move(buffer),
                                             content.index);
    }
    return std::make_unique<DataFrame>(content.type, content.streamID, makeBuffer(content.bytes), true, content.index);
}

std::unique_ptr<Message> makeMessage(const std::vector<FrameContent>& frames) {
    Frames placed;
    for (const FrameContent& content : frames) {
        placed.resize(std::max<std::size_t>(placed.size(), content.index + 1));
        placed[content.index] = makeFrame(content);
    }
    return std::make_unique<Message>(std::move(placed));
}

std::unique_ptr<Message> makeMessage(const std::string& tag, const std::string& bytes, FrameType type) {
    return makeMessage({FrameContent{true, type, 7, 1, tag, bytes}});
}

std::shared_ptr<Registry> sessionRegistry() {
    auto registry = std::make_shared<Registry>();
    using krutil::protobuf::KrutilProtocol;
    KrutilProtocol::protocolInitializer(registry, KrutilProtocol::protocolVersion, {{"ZEROCOPY", "enable"}});
    return registry;
}

std::vector<FrameContent> writtenFrames(const SerializerBase& serializer, const samples::Object& object,
                                        const std::shared_ptr<const Registry>& registry, FrameIndex firstIndex) {
    const auto stream = std::make_shared<RecordingStream>();
    samples::write(serializer, object, 7, firstIndex, stream, registry, SerializationContext());
    return contentOf(stream->frames);
}

samples::Object readObject(const std::string& tag, const std::string& bytes, FrameType type) {
    const auto registry = sessionRegistry();
    return samples::read(*registry->find(tag), 1, makeMessage(tag, bytes, type), registry, SerializationContext());
}

}  // namespace transport
