// The form in which a fuzzer's input stands for a received message.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "foundation/msg_svc/transport/layers/message/Message.hpp"
#include "foundation/msg_svc/transport/layers/serialization/Registry.hpp"

namespace fuzz {

/// One frame of an input. On disk: a byte that selects the tag (an index into the registry's serializers; values beyond
/// it select a data frame), the type byte, the content's length as two bytes with the lower first, the content.
struct FrameInput {
    std::uint8_t tag;
    std::uint8_t type;
    std::string content;
};

/// Frames one after the other; a truncated last one keeps what is there of its content.
std::vector<FrameInput> parseInput(const std::uint8_t* data, std::size_t size);
std::string formatInput(const std::vector<FrameInput>& frames);

/// A message with these frames from index 1 on, in buffers like those of a transport.
std::unique_ptr<foundation::msg_svc::transport::layers::message::Message> makeMessage(
    const std::vector<FrameInput>& frames,
    const foundation::msg_svc::transport::layers::serialization::Registry& registry);

}  // namespace fuzz
