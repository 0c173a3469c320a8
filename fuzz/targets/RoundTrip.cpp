// Any message that can be read: what was read is written, and what is read from that is the same object, written as the
// same bytes.

#include <google/protobuf/descriptor.h>
#include <google/protobuf/message.h>

#include <algorithm>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "common/MessageNames.hpp"
#include "input/Ended.hpp"
#include "input/FuzzInput.hpp"
#include "input/Reading.hpp"
#include "input/Require.hpp"
#include "krutil_protobuf/support/TestTransport.hpp"
#include "samples/Samples.hpp"

namespace {

// Whether the parser reads all of what was written. Of a message with text that is no UTF-8 it does not, and what
// follows the text is lost: 8-bit text of a host is its sender's to keep valid.
bool arrivesWhole(const std::vector<transport::FrameContent>& frames) {
    return std::all_of(frames.begin(), frames.end(), [](const transport::FrameContent& frame) {
        if (!frame.tagged) {
            return true;
        }
        const auto* const type = google::protobuf::DescriptorPool::generated_pool()->FindMessageTypeByName(
            apps::messageNameOfTag(frame.tag));
        const std::unique_ptr<google::protobuf::Message> message(
            google::protobuf::MessageFactory::generated_factory()->GetPrototype(type)->New());
        return message->ParseFromString(frame.bytes);
    });
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const std::shared_ptr<const transport::Registry> registry = transport::sessionRegistry();
    const auto message = fuzz::makeMessage(fuzz::parseInput(data, size), *registry);
    const std::optional<std::string> tag = fuzz::rootTag(*message);
    if (!tag) {
        return 0;
    }
    const std::optional<samples::Object> object = fuzz::read(message, registry);
    if (!object) {
        return 0;
    }
    const samples::SampleSet& set = samples::sampleSet(*tag);
    std::vector<transport::FrameContent> written;
    try {
        written = transport::writtenFrames(*registry->find(*tag), *object, registry);
    } catch (const fuzz::Ended& ended) {
        // A request may name a stream that only its sender knows. Who passes that on has to know it.
        fuzz::require(ended.message == "Unsupported cmddistributor::IqmStreamID value", ended.message.c_str());
        return 0;
    }
    if (!arrivesWhole(written)) {
        return 0;
    }
    const std::optional<samples::Object> again = fuzz::read(transport::makeMessage(written), registry);
    fuzz::require(again.has_value(), "what was written can be read");
    fuzz::require(set.describe(*object, samples::View::AfterTrip) == set.describe(*again, samples::View::AsIs),
                  "what is read again is the same object");
    fuzz::require(transport::writtenFrames(*registry->find(*tag), *again, registry) == written,
                  "what is written again has the same bytes");
    return 0;
}
