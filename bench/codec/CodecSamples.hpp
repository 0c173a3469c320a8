// Four objects as sessions send them, each with the least code that turns it into its bytes and back.
#pragma once

#include <cstddef>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "krutil_protobuf/support/TestTransport.hpp"
#include "samples/Samples.hpp"

namespace bench {

/// Takes the serialized bytes of one message; they are gone when it returns.
using TakeBytes = std::function<void(const char* bytes, std::size_t size)>;

/// One object and four ways to use it. The product's ways do all that a session does for it: look-up, casts, getters,
/// conversion, frame, append. The bare ways are what a program without this library would write by hand: fresh messages
/// on the stack, filled from the same object with the same text conversion, one allocation of exactly the serialized
/// size for each; and back.
struct CodecSample {
    std::string name;

    std::function<void(const std::shared_ptr<transport::MessageStream>& stream)> serialize;
    std::function<void(const TakeBytes& take)> serializeBare;

    /// Consumes `message`, whose last frame is the object's.
    std::function<samples::Object(const std::unique_ptr<transport::Message>& message)> deserialize;
    std::function<samples::Object(const transport::Message& message)> deserializeBare;

    /// What `serialize` appends.
    std::vector<transport::FrameContent> frames;
};

/// A line of 80 characters, a command of 2 KiB, an error with 40 stack frames in 4 levels of causes, and a warning with
/// 4 arguments and 5 stack frames. The first call checks that both ways lead to the same bytes, and back to the same
/// object; throws std::logic_error with the sample's name otherwise.
const std::vector<CodecSample>& codecSamples();

/// Takes every frame and destroys it.
class DroppingStream final : public transport::MessageStream {
  public:
    void append(std::unique_ptr<transport::Frame>& frame) override { frame.reset(); }
};

}  // namespace bench
