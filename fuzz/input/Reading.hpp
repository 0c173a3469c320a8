// Reads the message of an input as a host does, and knows what reading may end in.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "foundation/msg_svc/transport/layers/message/Message.hpp"
#include "foundation/msg_svc/transport/layers/serialization/Registry.hpp"
#include "samples/Samples.hpp"

namespace fuzz {

using foundation::msg_svc::transport::layers::message::Message;
using foundation::msg_svc::transport::layers::serialization::Registry;

/// Size of a message as the wire walk counts it.
struct Extent {
    std::uint64_t bytes = 0;  ///< of the contents of all frames
    std::uint64_t parts = 0;  ///< of the contents of tagged frames
};

/// The size of a message whose contents are all whole; empty when one is not. Numbers that end a process are let pass.
std::optional<Extent> extentOfWhole(const Message& message);

/// What the last frame's serializer makes of the message. Empty where reading may fail: it throws one of the exceptions
/// of malformed input, or ends the process with one of its own reports, which is an exception here (see Ended.cpp). Any
/// other outcome is a finding.
std::optional<samples::Object> read(const std::unique_ptr<Message>& message,
                                    const std::shared_ptr<const Registry>& registry);

/// Tag of the last frame; empty when that is a data frame or there is none.
std::optional<std::string> rootTag(const Message& message);

}  // namespace fuzz
