// What the serializers of objects that another one refers to are called with: the arguments of the outer call.

#include <gtest/gtest.h>

#include <boost/make_shared.hpp>

#include "FEvalIIPSerializer.hpp"
#include "FEvalResultSerializer.hpp"
#include "IIPEnqueueMessageSerializer.hpp"
#include "IIPReplySerializer.hpp"
#include "QDASerializer.hpp"
#include "cmddistributor/EvalIIP.hpp"
#include "krutil_protobuf/support/TestTransport.hpp"

namespace {

using foundation::korveldata::Array;
using foundation::msg_svc::exchange::IDType;
using krutil::cmddistributor::EDIDataWrapper;
using krutil::io::SinkTraits;
using namespace krutil::protobuf_serializer;
using transport::Registry;
using transport::SerializationContext;

constexpr transport::StreamID outerStream = 7;

/// What one call was given besides the object. Compared by address: a copy of a context is another one.
struct Call {
    const SerializationContext* context;
    const std::shared_ptr<const Registry> registry;

    bool operator==(const Call&) const = default;
};

/// Stands for the serializer of a nested object: keeps what it is called with, writes one frame and reads nothing.
template <class Family>
class ListeningSerializer;

template <class T, class Ptr, class Ret>
class ListeningSerializer<transport::SerializerAPI<T, Ptr, Ret>> final : public transport::SerializerAPI<T, Ptr, Ret> {
  public:
    ListeningSerializer(const std::type_info& type, std::vector<Call>& calls)
        : transport::SerializerAPI<T, Ptr, Ret>("test:Listening", type, {1U, 0U}), calls_(calls) {}

    transport::FrameIndex serialize(const Ptr& /*object*/, transport::StreamID streamID,
                                    transport::FrameIndex frameIndex,
                                    const std::shared_ptr<transport::MessageStream>& stream,
                                    const std::shared_ptr<const Registry>& registry,
                                    const SerializationContext& context) const override {
        calls_.push_back({&context, registry});
        auto frame = transport::makeFrame({true, transport::FrameType::Object, streamID, frameIndex, this->name(), ""});
        stream->append(frame);
        return frameIndex + 1;
    }

    Ret deserialize(transport::FrameIndex frameIndex, const std::unique_ptr<transport::Message>& message,
                    const std::shared_ptr<const Registry>& registry,
                    const SerializationContext& context) const override {
        calls_.push_back({&context, registry});
        message->release(frameIndex);
        return Ret();
    }

  private:
    std::vector<Call>& calls_;
};

class NestedObjectsTest : public testing::Test {
  protected:
    /// Writes `object` with `Outer` and reads it again, with a ListeningSerializer of `Family` for the nested objects,
    /// which are of `type`. Checks that those were called `count` times in each direction, with the outer call's
    /// arguments.
    template <class Outer, class Family>
    void expectCallsWithTheOuterArguments(const samples::Object& object, const std::type_info& type,
                                          std::size_t count) {
        std::vector<Call> calls;
        const auto registry = std::make_shared<Registry>();
        const auto outer = std::make_shared<const Outer>();
        registry->insert(outer);
        registry->insert(std::make_shared<const ListeningSerializer<Family>>(type, calls));

        const SerializationContext writing;
        const auto stream = std::make_shared<transport::RecordingStream>();
        samples::write(*outer, object, outerStream, 1, stream, registry, writing);
        EXPECT_EQ(calls, std::vector<Call>(count, Call{&writing, registry}));
        for (const auto& frame : stream->frames) {
            EXPECT_EQ(frame->streamID(), outerStream);
        }

        calls.clear();
        const SerializationContext reading;
        const auto frames = transport::contentOf(stream->frames);
        samples::read(*outer, frames.back().index, transport::makeMessage(frames), registry, reading);
        EXPECT_EQ(calls, std::vector<Call>(count, Call{&reading, registry}));
    }

    const IDType id_{1, 2};
    const std::vector<Array> arrays_{Array(), Array()};
};

TEST_F(NestedObjectsTest, TheRequestOfAnEnqueueMessage) {
    using cmddistributor::EvalIIP;
    const auto request =
        boost::make_shared<const EvalIIP>("x", cmddistributor::IqmStreamID::ekIqmCmdWinStream, nullptr, SinkTraits(),
                                          SinkTraits(), u"1", cmddistributor::CodeType::CodeBlockType);
    expectCallsWithTheOuterArguments<IIPEnqueueMessageSerializer, IIPFamily>(
        boost::shared_ptr<const foundation::msg_svc::exchange::Message>(
            boost::make_shared<const cmddistributor::IIPEnqueueMessage>(
                request, id_, 3, boost::none, nullptr, krutil::cmddistributor::WhenToDequeue::DEQUEUE_AT_PROMPT, u"n",
                capabilities::CapabilityList(), nullptr, false)),
        typeid(EvalIIP), 1);
}

TEST_F(NestedObjectsTest, TheResultOfAReply) {
    using cmddistributor::IIPResult;
    expectCallsWithTheOuterArguments<IIPReplySerializer, ResultFamily>(
        boost::shared_ptr<const foundation::msg_svc::exchange::Reply>(
            boost::make_shared<const krutil::cmddistributor::IIPReply>(id_,
                                                                       std::make_unique<IIPResult>(id_, boost::none))),
        typeid(IIPResult), 1);
}

TEST_F(NestedObjectsTest, TheArgumentsOfACall) {
    using cmddistributor::FEvalIIP;
    expectCallsWithTheOuterArguments<FEvalIIPSerializer, ArrayFamily>(
        boost::shared_ptr<const cmddistributor::IIP>(boost::make_shared<const FEvalIIP>(
            "x", std::string("f"), 1, FEvalIIP::Data::makeClientSideData(EDIDataWrapper(std::vector<Array>(arrays_))),
            cmddistributor::IqmStreamID::ekIqmCmdWinStream, SinkTraits(), SinkTraits(), 3, 4, true)),
        typeid(Array), arrays_.size());
}

TEST_F(NestedObjectsTest, TheOutputsOfAResult) {
    std::unique_ptr<cmddistributor::IIPResult> result =
        std::make_unique<cmddistributor::FEvalResult>(id_, std::vector<Array>(arrays_));
    expectCallsWithTheOuterArguments<FEvalResultSerializer, ArrayFamily>(std::move(result), typeid(Array),
                                                                         arrays_.size());
}

}  // namespace
