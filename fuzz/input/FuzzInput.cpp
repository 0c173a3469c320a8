#include "input/FuzzInput.hpp"

#include <algorithm>
#include <cstring>

#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"
#include "foundation/vantor/carrier/framing/DataFrame.hpp"
#include "foundation/vantor/carrier/framing/TaggedFrame.hpp"

namespace fuzz {

namespace framing = foundation::vantor::carrier::framing;
using foundation::msg_svc::transport::layers::message::Message;

std::vector<FrameInput> parseInput(const std::uint8_t* data, std::size_t size) {
    std::vector<FrameInput> frames;
    while (size >= 4) {
        const std::size_t claimed = data[2] + std::size_t{256} * data[3];
        const std::size_t length = std::min(claimed, size - 4);
        frames.push_back({data[0], data[1], std::string(data + 4, data + 4 + length)});
        data += 4 + length;
        size -= 4 + length;
    }
    return frames;
}

std::string formatInput(const std::vector<FrameInput>& frames) {
    std::string bytes;
    for (const FrameInput& frame : frames) {
        const std::size_t length = std::min<std::size_t>(frame.content.size(), 0xFFFF);
        bytes += static_cast<char>(frame.tag);
        bytes += static_cast<char>(frame.type);
        bytes += static_cast<char>(length & 0xFF);
        bytes += static_cast<char>(length >> 8);
        bytes.append(frame.content, 0, length);
    }
    return bytes;
}

std::unique_ptr<Message> makeMessage(const std::vector<FrameInput>& inputs,
                                     const foundation::msg_svc::transport::layers::serialization::Registry& registry) {
    std::vector<std::unique_ptr<framing::Frame>> frames(1);
    for (const FrameInput& input : inputs) {
        framing::FrameBuffer buffer = framing::BufferAllocator::makeFrameBuffer(input.content.size());
        std::copy(input.content.begin(), input.content.end(), buffer.first.get());
        const auto type = static_cast<framing::FrameType>(input.type);
        const framing::FrameIndex index = frames.size();
        if (input.tag < registry.serializers().size()) {
            frames.push_back(std::make_unique<framing::TaggedFrame>(type, 7, registry.serializers()[input.tag]->name(),
                                                                    std::move(buffer), index));
        } else {
            frames.push_back(std::make_unique<framing::DataFrame>(type, 7, std::move(buffer), true, index));
        }
    }
    return std::make_unique<Message>(std::move(frames));
}

}  // namespace fuzz
