// Sample objects of every type that the protocol carries: a typical one, the emptiest one and an extreme one of each at
// least. Unit tests, golden files, fuzz seeds and benchmarks all use these.
//
// Neighbours of one type (two traits, two identifiers, four lists, an identifier beside a name, booleans in a row) have
// pairwise different values, so that a conversion that mixes them up is seen.
//
// The sets are built on first use, from main on (not by static constructors), and immutable then; any thread may read
// them.
#pragma once

#include <boost/shared_ptr.hpp>
#include <memory>
#include <string>
#include <variant>
#include <vector>

#include "cmddistributor/IIP.hpp"
#include "cmddistributor/IIPResult.hpp"
#include "foundation/korveldata/Array.hpp"
#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"
#include "foundation/msg_svc/exchange/Message.hpp"
#include "foundation/msg_svc/exchange/Reply.hpp"
#include "foundation/msg_svc/transport/layers/serialization/SerializerAPI.hpp"

namespace samples {

namespace layers = foundation::msg_svc::transport::layers;
namespace framing = foundation::vantor::carrier::framing;

/// An object of any family, in the form in which the family's serializers take it and give it back.
using Object = std::variant<boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent>,
                            boost::shared_ptr<const cmddistributor::IIP>,
                            boost::shared_ptr<const foundation::msg_svc::exchange::Message>,
                            boost::shared_ptr<const foundation::msg_svc::exchange::Reply>,
                            std::unique_ptr<cmddistributor::IIPResult>, foundation::korveldata::Array>;

/// What describe() tells about an object.
enum class View {
    AsIs,       ///< the object as it is
    AfterTrip,  ///< what must come back when the object has travelled: without that which stays in the process
};

/// One object and the name that it has in test names and golden files.
struct Sample {
    std::string name;
    Object object;
};

/// All samples of one serializer.
struct SampleSet {
    std::string serializer;  ///< registered name
    std::string message;     ///< full name of the message in the serializer's own frame
    std::vector<Sample> samples;

    /// The whole content of an object, one line for each value, for comparison and for a person to read. An object of
    /// another class than the set's is described by that fact.
    std::string (*describe)(const Object& object, View view);
};

/// The sets, in no particular order.
const std::vector<SampleSet>& sampleSets();

/// The set of the serializer with this registered name; throws std::out_of_range when there is none.
const SampleSet& sampleSet(const std::string& serializer);

/// Calls serialize of the object's family. Throws std::bad_cast when `serializer` is of another family, and what the
/// serializer throws.
framing::FrameIndex write(const layers::serialization::SerializerBase& serializer, const Object& object,
                          framing::StreamID streamID, framing::FrameIndex frameIndex,
                          const std::shared_ptr<layers::message::MessageStream>& stream,
                          const std::shared_ptr<const layers::serialization::Registry>& registry,
                          const layers::serialization::SerializationContext& context);

/// Calls deserialize of the serializer's family. Throws std::bad_cast when it is of no family known here, and what the
/// serializer throws.
Object read(const layers::serialization::SerializerBase& serializer, framing::FrameIndex frameIndex,
            const std::unique_ptr<layers::message::Message>& message,
            const std::shared_ptr<const layers::serialization::Registry>& registry,
            const layers::serialization::SerializationContext& context);

/// In quotes, with everything but printable ASCII as \xNN or \u{NNNN}.
std::string quoted(const std::string& text);
std::string quoted(const std::u16string& text);

}  // namespace samples
