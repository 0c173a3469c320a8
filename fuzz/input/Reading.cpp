#include "input/Reading.hpp"

#include <google/protobuf/stubs/logging.h>

#include <algorithm>
#include <array>
#include <stdexcept>
#include <string_view>
#include <typeinfo>

#include "common/Precheck.hpp"
#include "foundation/korveldata/ArrayFormatError.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionError.hpp"
#include "foundation/vantor/carrier/framing/TaggedFrame.hpp"
#include "input/Ended.hpp"
#include "input/Require.hpp"

namespace fuzz {
namespace {

using foundation::vantor::carrier::framing::TaggedFrame;

const TaggedFrame* taggedAt(const Message& message, unsigned long index) {
    return dynamic_cast<const TaggedFrame*>(message.frame(index).get());
}

// Of each text that is no UTF-8 a line would be written.
[[maybe_unused]] google::protobuf::LogHandler* const silent = google::protobuf::SetLogHandler(nullptr);

// With these the protocol's rules end a process that reads. No other number of a peer does.
constexpr std::array<std::string_view, 2> readingEndsWith{
    "Unsupported krutil::protobuf::StreamType value",
    "Unsupported protobuf::ExecutionStatus value",
};

}  // namespace

std::optional<std::string> rootTag(const Message& message) {
    const TaggedFrame* root = message.size() > 1 ? taggedAt(message, message.size() - 1) : nullptr;
    return root != nullptr ? std::optional<std::string>(root->tag()) : std::nullopt;
}

std::optional<Extent> extentOfWhole(const Message& message) {
    Extent extent;
    for (unsigned long index = 1; index < message.size(); ++index) {
        extent.bytes += message.frame(index)->size();
        if (const TaggedFrame* tagged = taggedAt(message, index)) {
            try {
                apps::precheck(false)->check(*tagged);
            } catch (const foundation::msg_svc::transport::layers::session::ProtocolViolation&) {
                return std::nullopt;
            }
            extent.parts += apps::precheck(false)->parts(*tagged);
        }
    }
    return extent;
}

std::optional<samples::Object> read(const std::unique_ptr<Message>& message,
                                    const std::shared_ptr<const Registry>& registry) {
    try {
        return samples::read(*registry->find(*rootTag(*message)), message->size() - 1, message, registry,
                             samples::layers::serialization::SerializationContext());
    } catch (const foundation::korveldata::ArrayFormatError&) {
    } catch (const std::bad_cast&) {
    } catch (const std::logic_error&) {
    } catch (const Ended& ended) {
        require(std::find(readingEndsWith.begin(), readingEndsWith.end(), ended.message) != readingEndsWith.end(),
                ended.message.c_str());
    }
    return std::nullopt;
}

}  // namespace fuzz
