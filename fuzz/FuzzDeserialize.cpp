// Any message of any frames: reading it gives an object or one of the exceptions that reading may throw.

#include <boost/numeric/conversion/cast.hpp>
#include <memory>
#include <stdexcept>
#include <typeinfo>

#include "common/Precheck.hpp"
#include "foundation/korveldata/ArrayFormatError.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionError.hpp"
#include "foundation/vantor/carrier/framing/TaggedFrame.hpp"
#include "input/FuzzInput.hpp"
#include "krutil_protobuf/support/TestTransport.hpp"
#include "samples/Samples.hpp"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    using foundation::vantor::carrier::framing::TaggedFrame;
    static const std::shared_ptr<const transport::Registry> registry = transport::sessionRegistry();
    const auto message = fuzz::makeMessage(fuzz::parseInput(data, size), *registry);
    const unsigned long root = message->size() - 1;
    const auto* last = dynamic_cast<const TaggedFrame*>(message->frame(root).get());
    if (last == nullptr) {
        return 0;
    }
    const auto serializer = registry->find(last->tag());
    try {
        // Numbers that end the process by the protocol's own rule are left out, as sessions do.
        for (unsigned long index = 1; index <= root; ++index) {
            if (const auto* tagged = dynamic_cast<const TaggedFrame*>(message->frame(index).get())) {
                apps::precheck(true)->check(*tagged);
            }
        }
        samples::read(*serializer, root, message, registry, transport::SerializationContext());
    } catch (const foundation::msg_svc::transport::layers::session::ProtocolViolation&) {
    } catch (const foundation::korveldata::ArrayFormatError&) {
    } catch (const std::bad_cast&) {
    } catch (const std::logic_error&) {
    }
    return 0;
}
