// Arrays whose description and bytes do not fit together, and what an engine does about them.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <functional>

#include "KrutilProtocol.hpp"
#include "apps/qvm/calls/CallFixture.hpp"
#include "foundation.korveldata.protobuf.KORVEL_Array.pb.h"
#include "foundation/msg_svc/transport/layers/serialization/SerializerAPI.hpp"
#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"
#include "foundation/vantor/carrier/framing/DataFrame.hpp"

namespace qvm_test {
namespace {

namespace framing = foundation::vantor::carrier::framing;
namespace serialization = foundation::msg_svc::transport::layers::serialization;
using foundation::korveldata::protobuf::KORVEL_Array;
using foundation::msg_svc::transport::layers::message::Message;
using foundation::msg_svc::transport::layers::message::MessageStream;
using testing::HasSubstr;

// What is sent instead of an array.
struct Forgery {
    std::vector<std::uint64_t> dimensions;
    std::size_t bytes;                             // of the data frame
    std::function<void(KORVEL_Array&)> further{};  // changes the description, whose data ID is set
    ElementType type = ElementType::Double;
};

Forgery forgery;

class ForgingSerializer final : public serialization::SerializerAPI<Array, Array, Array> {
  public:
    ForgingSerializer() : SerializerAPI("krutil:QDA", typeid(Array), {1U, 0U}) {}

    framing::FrameIndex serialize(const Array& /*array*/, framing::StreamID stream, framing::FrameIndex index,
                                  const std::shared_ptr<MessageStream>& out,
                                  const std::shared_ptr<const serialization::Registry>& /*registry*/,
                                  const serialization::SerializationContext& /*context*/) const override {
        framing::FrameBuffer data = framing::BufferAllocator::makeFrameBuffer(forgery.bytes);
        std::fill_n(data.first.get(), forgery.bytes, '\1');
        std::unique_ptr<framing::Frame> frame =
            std::make_unique<framing::DataFrame>(framing::FrameType{11}, stream, std::move(data), true, index);
        out->append(frame);

        KORVEL_Array array;
        array.set_elementtype(static_cast<int>(forgery.type));
        array.mutable_dimensions()->Add(forgery.dimensions.begin(), forgery.dimensions.end());
        array.set_order(KORVEL_Array::ROW_MAJOR);
        array.set_dataid(index);
        if (forgery.further) {
            forgery.further(array);
        }
        const std::string description = array.SerializeAsString();
        framing::FrameBuffer tagged = framing::BufferAllocator::makeFrameBuffer(description.size());
        description.copy(tagged.first.get(), description.size());
        frame = std::make_unique<framing::TaggedFrame>(framing::FrameType::Object, stream, name(), std::move(tagged),
                                                       index + 1);
        out->append(frame);
        return index + 2;
    }

    Array deserialize(framing::FrameIndex /*index*/, const std::unique_ptr<Message>& /*message*/,
                      const std::shared_ptr<const serialization::Registry>& /*registry*/,
                      const serialization::SerializationContext& /*context*/) const override {
        throw std::logic_error("a forger does not read");
    }
};

// While it lives, this process's protocol has that serializer for arrays.
class Forging {
  public:
    Forging() {
        KrutilProtocol::init();
        const auto protocols = session::ProtocolRegistry::getRegistry();
        protocols->unregister("krutil");
        protocols->registerProtocolInitializer("krutil", &initialize, &KrutilProtocol::getConfiguration);
    }
    ~Forging() {
        const auto protocols = session::ProtocolRegistry::getRegistry();
        protocols->unregister("krutil");
        protocols->registerProtocolInitializer("krutil", &KrutilProtocol::protocolInitializer,
                                               &KrutilProtocol::getConfiguration);
    }
    Forging(const Forging&) = delete;
    Forging& operator=(const Forging&) = delete;

  private:
    using KrutilProtocol = krutil::protobuf::KrutilProtocol;

    static std::pair<unsigned int, unsigned int> initialize(
        const std::shared_ptr<serialization::Registry>& registry, const std::pair<unsigned int, unsigned int>& version,
        const std::unordered_map<std::string, std::string>& features) {
        const auto all = std::make_shared<serialization::Registry>();
        KrutilProtocol::protocolInitializer(all, version, features);
        for (const auto& serializer : all->serializers()) {
            if (serializer->name() != "krutil:QDA") {
                registry->insert(serializer);
            }
        }
        registry->insert(std::make_shared<const ForgingSerializer>());
        return version;
    }
};

// The engine's last words about a session in which this is sent. Its process must have ended.
std::string lastWords(Forgery sent) {
    const Forging forging;
    forgery = std::move(sent);
    EngineSession engine;
    EXPECT_EQ(engine.client.eval("1 + 1").shown(), "2\n");
    engine.client.enqueue(callOf("len", {Array()}));
    const session::SessionEnd end = engine.client.awaitEnd();
    EXPECT_EQ(end.reason, session::SessionEnd::Reason::Violation);
    EXPECT_EQ(engine.process.wait(), 4);
    return end.text;
}

TEST(HostileCallTest, AnnouncedElementsThatDidNotComeCloseTheSession) {
    EXPECT_THAT(lastWords({{1000, 1000}, 8}),
                HasSubstr("Array: 1000 x 1000 double needs 8000000 bytes; the buffer has 8"));
}

TEST(HostileCallTest, OneByteShortOrLongClosesTheSession) {
    EXPECT_THAT(lastWords({{10}, 79}), HasSubstr("Array: 10 double needs 80 bytes; the buffer has 79"));
    EXPECT_THAT(lastWords({{10}, 81}), HasSubstr("Array: 10 double needs 80 bytes; the buffer has 81"));
}

TEST(HostileCallTest, DimensionsWhoseProductWrapsCloseTheSession) {
    const std::uint64_t half = std::uint64_t{1} << 32;
    EXPECT_THAT(lastWords({{half, half}, 0}),
                HasSubstr("Array: 4294967296 x 4294967296 double is more than 9223372036854775807 bytes"));
    EXPECT_THAT(lastWords({{~std::uint64_t{0}}, 8}),
                HasSubstr("Array: a dimension of 18446744073709551615; at most 9223372036854775807 is supported"));
    EXPECT_THAT(lastWords({std::vector<std::uint64_t>(33, 1), 8}),
                HasSubstr("33 dimensions; at most 32 are supported"));
}

TEST(HostileCallTest, UnknownElementTypeClosesTheSession) {
    EXPECT_THAT(lastWords({{1}, 8, [](KORVEL_Array& array) { array.set_elementtype(-1); }}),
                HasSubstr("elements of type unknown (code -1) are not supported"));
}

TEST(HostileCallTest, BoolThatIsNeitherZeroNorOneClosesTheSession) {
    // Every byte of the forged frame is 1, so that it would be right for eight of them.
    EXPECT_THAT(lastWords({{1}, 8, {}, ElementType::Bool}), HasSubstr("needs 1 bytes; the buffer has 8"));
}

TEST(HostileCallTest, DataIdThatNamesNoDataFrameClosesTheSession) {
    for (const std::uint64_t id : {std::uint64_t{0}, std::uint64_t{2}, std::uint64_t{99}, ~std::uint64_t{0}}) {
        EXPECT_THAT(
            lastWords({{1}, 8, [id](KORVEL_Array& array) { array.set_dataid(id); }}),
            HasSubstr("cannot read \"krutil:IIPEnqueueMessage\": frame " + std::to_string(id) +
                      ": expected a frame, got none: " + (id == 2 ? "it was read already" : "the message has 4")));
    }
}

}  // namespace
}  // namespace qvm_test
