// Any message of any frames: reading it gives an object that can be used, or fails as reading may fail. What it takes
// of memory depends on what is there, not on what a length claims.

#include <algorithm>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "input/FuzzInput.hpp"
#include "input/Reading.hpp"
#include "input/Require.hpp"
#include "krutil_protobuf/serializers/AllocationRecorder.hpp"
#include "krutil_protobuf/support/TestTransport.hpp"
#include "samples/Samples.hpp"

namespace {

using Registry = std::shared_ptr<const transport::Registry>;

// What is made once, on first use, is no cost of a message.
Registry makeRegistry() {
    Registry registry = transport::sessionRegistry();
    for (std::size_t i = 0; i < registry->serializers().size(); ++i) {
        fuzz::read(fuzz::makeMessage({{static_cast<std::uint8_t>(i), 29, ""}}, *registry), registry);
    }
    return registry;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const Registry registry = makeRegistry();
    const auto message = fuzz::makeMessage(fuzz::parseInput(data, size), *registry);
    const std::optional<std::string> tag = fuzz::rootTag(*message);
    if (!tag) {
        return 0;
    }
    // A message that is not whole is read as well, but only sessions' messages have a bound.
    const std::optional<fuzz::Extent> extent = fuzz::extentOfWhole(*message);
    AllocationRecorder recorder;
    const std::optional<samples::Object> object = fuzz::read(message, registry);
    recorder.stop();
    fuzz::require(!extent || recorder.peak() <= 16 * extent->bytes + 512 * extent->parts + 65'536,
                  "memory while reading is at most 16 times its bytes, 512 for each part and 64 KiB");
    if (object) {
        // Looks at all that is in it, elements of arrays as well.
        samples::sampleSet(*tag).describe(*object, samples::View::AsIs);
    }
    return 0;
}
