// Results of function calls: the order of frames and of checks, and what happens to arrays when a check fails.

#include "FEvalResultSerializer.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <boost/exception/exception.hpp>
#include <boost/make_shared.hpp>
#include <boost/variant/get.hpp>
#include <stdexcept>

#include "krutil.protobuf.IIPReply.pb.h"
#include "krutil/cmddistributor/IIPReply.hpp"
#include "krutil_protobuf/serializers/ArraysTest.hpp"
#include "krutil_protobuf/serializers/FatalReport.hpp"

namespace {

using arrays::ArraysTest;
using arrays::dataIDs;
using arrays::indexes;
using arrays::large;
using arrays::small;
using cmddistributor::FEvalResult;
using cmddistributor::IIPResult;
using cmddistributor::RuntimeException;
using foundation::korveldata::Array;
using foundation::msg_svc::exchange::IDType;
using foundation::vantor::carrier::framing::BufferAllocator;
using krutil::cmddistributor::EDIDataWrapper;
using krutil::cmddistributor::IIPReply;
using krutil::protobuf_serializer::DataID;
using krutil::protobuf_serializer::FEvalResultSerializer;
using krutil::protobuf_serializer::ReplyFamily;
using krutil::protobuf_serializer::ResultFamily;
using transport::errorText;
using transport::FrameIndex;
using transport::FrameType;
using transport::Message;
using transport::parsed;
namespace wire = krutil::protobuf;

const IDType requestID(5, 6);

RuntimeException exceptionWith(int status) {
    return {static_cast<krutil::cmddistributor::inExecutionStatus>(status), u"text", "id", "function", {}, {}, false};
}

std::unique_ptr<IIPResult> outputs(std::vector<Array>&& arrays) {
    return std::make_unique<FEvalResult>(requestID, std::move(arrays));
}

wire::FEvalResult resultProto(const std::vector<std::uint64_t>& dataIDs) {
    wire::FEvalResult proto;
    proto.mutable_iipresult()->mutable_id()->set_lo(6);
    for (const std::uint64_t id : dataIDs) {
        proto.add_dataids(id);
    }
    return proto;
}

class FEvalResultTest : public ArraysTest {
  protected:
    FrameIndex write(const std::unique_ptr<IIPResult>& result, FrameIndex first) const {
        return writeAs<ResultFamily>("krutil:FEvalResult", result, first);
    }

    std::unique_ptr<IIPResult> read(const std::unique_ptr<Message>& message, FrameIndex index) const {
        return readAs<ResultFamily>("krutil:FEvalResult", message, index);
    }

    static const std::vector<Array>& arraysOf(const IIPResult& result) {
        return boost::get<std::vector<Array>>(dynamic_cast<const FEvalResult&>(result).getResults());
    }

    wire::FEvalResult written() const { return parsed<wire::FEvalResult>(*frames().back()); }
};

TEST_F(FEvalResultTest, WithoutOutputsTheResultIsOneFrame) {
    EXPECT_EQ(write(outputs({}), 5), 6U);
    EXPECT_EQ(indexes(frames()), (std::vector<FrameIndex>{5}));
    EXPECT_EQ(written().dataids_size(), 0);
    const auto back = read(received(), 5);
    EXPECT_EQ(back->id, requestID);
    EXPECT_TRUE(arraysOf(*back).empty());
}

TEST_F(FEvalResultTest, TwoSmallOutputsGivenIndex3) {
    EXPECT_EQ(write(outputs({small(1), small(2)}), 3), 6U);
    EXPECT_EQ(indexes(frames()), (std::vector<FrameIndex>{3, 4, 5}));
    EXPECT_EQ(dataIDs(written()), (std::vector<std::uint64_t>{3, 4}));
    EXPECT_EQ(arraysOf(*read(received(), 5)), (std::vector<Array>{small(1), small(2)}));
}

TEST_F(FEvalResultTest, AnOutputGivenIndex0) {
    EXPECT_EQ(write(outputs({small(1)}), 0), 2U);
    EXPECT_EQ(dataIDs(written()), (std::vector<std::uint64_t>{0}));
    EXPECT_EQ(arraysOf(*read(received(), 1)), (std::vector<Array>{small(1)}));
}

TEST_F(FEvalResultTest, OutputsAreLentToTheirFramesAndReceivedInPlace) {
    const Array output = large();
    write(outputs({output}), 1);
    EXPECT_EQ(frames().at(0)->data(), output.data());
    const auto message = received();
    const char* const address = message->frame(1)->data();
    EXPECT_EQ(arraysOf(*read(message, 3)).at(0).data(), address);
}

TEST_F(FEvalResultTest, InsideAReplyTheResultIDIsTheResultsOwnFrame) {
    const auto reply = boost::make_shared<IIPReply>(IDType(1, 2), outputs({small(1), small(2)}));
    EXPECT_EQ(writeAs<ReplyFamily>("krutil:IIPReply", reply, 3), 7U);
    EXPECT_EQ(indexes(frames()), (std::vector<FrameIndex>{3, 4, 5, 6}));
    EXPECT_EQ(parsed<wire::IIPReply>(*frames().back()).resultid(), 5U);
    const auto back =
        boost::dynamic_pointer_cast<const IIPReply>(readAs<ReplyFamily>("krutil:IIPReply", received(), 6));
    EXPECT_EQ(back->getID(), IDType(1, 2));
    EXPECT_EQ(back->getResult()->id, requestID);
    EXPECT_EQ(arraysOf(*back->getResult()), (std::vector<Array>{small(1), small(2)}));
}

TEST_F(FEvalResultTest, OutputsOfARefusedReplyAreReleased) {
    auto given = framesOf({large()});
    given.push_back({true, FrameType::Object, 7, 3, "krutil:FEvalResult", resultProto({2}).SerializeAsString()});
    wire::IIPReply reply;
    reply.set_resultid(3);
    const auto message = messageOf(reply, "krutil:IIPReply", given);
    EXPECT_EQ(errorText<std::logic_error>([&] { readAs<ReplyFamily>("krutil:IIPReply", message, 4); }),
              "Required field is missing: protobuf::IIPReply.id");
    EXPECT_EQ(message->frame(1), nullptr);
    EXPECT_EQ(BufferAllocator::inUse(), before());
}

TEST_F(FEvalResultTest, AnExceptionIsSentAndNotReadBack) {
    const std::unique_ptr<IIPResult> failed =
        std::make_unique<FEvalResult>(requestID, FEvalResult::Results(std::vector<Array>{small(1)}), exceptionWith(2));
    write(failed, 1);
    EXPECT_EQ(written().iipresult().exception().status(), 2);
    EXPECT_EQ(written().iipresult().exception().msgid(), "id");
    const auto back = read(received(), 2);
    EXPECT_FALSE(back->getException().has_value());
    EXPECT_EQ(arraysOf(*back), (std::vector<Array>{small(1)}));
}

TEST_F(FEvalResultTest, TheRecordIsCheckedBeforeAnArrayIsRead) {
    wire::FEvalResult proto;
    proto.add_dataids(2);
    proto.add_dataids(9);
    const auto text = [&] {
        const auto message = messageOf(proto, "krutil:FEvalResult", framesOf({large()}));
        const std::string error = errorText<std::logic_error>([&] { read(message, 3); });
        EXPECT_NE(message->frame(1), nullptr);
        EXPECT_NE(message->frame(2), nullptr);
        EXPECT_EQ(message->frame(3), nullptr);
        return error;
    };
    EXPECT_EQ(text(), "Required field is missing: protobuf::FEvalResult.iipResult");
    proto.mutable_iipresult()->mutable_exception();
    EXPECT_EQ(text(), "Required field is missing: protobuf::IIPResult.id");
    proto.mutable_iipresult()->mutable_id();
    const auto message = messageOf(proto, "krutil:FEvalResult", framesOf({large()}));
    EXPECT_THROW(read(message, 3), std::bad_cast);
    EXPECT_EQ(BufferAllocator::inUse(), before());
}

TEST_F(FEvalResultTest, AnEmptyMessageLacksItsRecord) {
    EXPECT_EQ(errorText<std::logic_error>([&] { read(transport::makeMessage("krutil:FEvalResult", ""), 1); }),
              "Required field is missing: protobuf::FEvalResult.iipResult");
}

TEST_F(FEvalResultTest, TheFirstTagSelectsTheSerializerOfAllOutputs) {
    auto given = framesOf({small(1), small(2)});
    given[1].tag = "unknown";
    const auto back = read(messageOf(resultProto({1, 2}), "krutil:FEvalResult", given), 3);
    EXPECT_EQ(arraysOf(*back), (std::vector<Array>{small(1), small(2)}));
    EXPECT_THROW(read(messageOf(resultProto({2, 1}), "krutil:FEvalResult", given), 3), std::out_of_range);
    given[1].tag = "krutil:IIPResult";
    EXPECT_THROW(read(messageOf(resultProto({2, 1}), "krutil:FEvalResult", given), 3), std::bad_cast);
}

TEST_F(FEvalResultTest, OutputsInAnotherFormAreBoostsWrappedBadGetAndNothingIsWritten) {
    for (int form = 0; form < 3; ++form) {
        FEvalResult::Results results;
        if (form == 1) {
            results = std::vector<std::u16string>{u"1"};
        } else if (form == 2) {
            results = EDIDataWrapper(std::vector<Array>{small(1)});
        }
        const std::unique_ptr<IIPResult> result =
            std::make_unique<FEvalResult>(requestID, std::move(results), boost::none);
        bool caught = false;
        try {
            write(result, 1);
        } catch (const boost::bad_get& error) {
            caught = true;
            EXPECT_NE(dynamic_cast<const boost::exception*>(&error), nullptr);
            EXPECT_NE(typeid(error), typeid(boost::bad_get));
        }
        EXPECT_TRUE(caught) << form;
        EXPECT_TRUE(frames().empty()) << form;
    }
}

TEST_F(FEvalResultTest, WithoutACallableTheArraysAreLeftOutAndNothingComesBack) {
    wire::FEvalResult proto;
    FEvalResultSerializer::fill(FEvalResult(requestID, {small(1)}), proto, FEvalResultSerializer::WriteArrays());
    EXPECT_EQ(proto.iipresult().id().lo(), 6U);
    EXPECT_EQ(proto.dataids_size(), 0);
    // Nor is the form of the outputs looked at.
    const FEvalResult nothing(requestID, FEvalResult::Results(), boost::none);
    FEvalResultSerializer::fill(nothing, proto, FEvalResultSerializer::WriteArrays());
    EXPECT_TRUE(proto.has_iipresult());

    EXPECT_EQ(FEvalResultSerializer::fromProtobuf(resultProto({1}), FEvalResultSerializer::ReadArrays()), nullptr);
    EXPECT_EQ(errorText<std::logic_error>([] {
                  FEvalResultSerializer::fromProtobuf(wire::FEvalResult(), FEvalResultSerializer::ReadArrays());
              }),
              "Required field is missing: protobuf::FEvalResult.iipResult");
}

TEST_F(FEvalResultTest, TheCallablesGetTheArraysAndTheIDsInOrder) {
    std::vector<Array> given;
    const FEvalResultSerializer::WriteArrays writer = [&given](const std::vector<Array>& arrays) {
        given = arrays;
        return std::vector<DataID>{8, 3};
    };
    wire::FEvalResult proto;
    FEvalResultSerializer::fill(FEvalResult(requestID, {small(1), small(2)}), proto, writer);
    EXPECT_EQ(given, (std::vector<Array>{small(1), small(2)}));
    EXPECT_EQ(dataIDs(proto), (std::vector<std::uint64_t>{8, 3}));

    std::vector<std::uint64_t> asked;
    const FEvalResultSerializer::ReadArrays reader = [&asked](const auto& ids) {
        asked.assign(ids.begin(), ids.end());
        return std::vector<Array>{small(4)};
    };
    const auto result = FEvalResultSerializer::fromProtobuf(proto, reader);
    EXPECT_EQ(asked, (std::vector<std::uint64_t>{8, 3}));
    EXPECT_EQ(arraysOf(*result), (std::vector<Array>{small(4)}));
}

using FEvalResultDeathTest = fatal::FatalTest;

void readResult(const wire::FEvalResult& proto) {
    transport::readObject("krutil:FEvalResult", proto.SerializeAsString());
}

TEST_F(FEvalResultDeathTest, ABadStatusInAnExceptionThatIsDroppedAnyway) {
    wire::FEvalResult proto = resultProto({});
    proto.mutable_iipresult()->mutable_exception()->set_status(static_cast<wire::ExecutionStatus>(6));
    EXPECT_FATAL(readResult(proto), fatal::statusIn);
    // Also in a cause, also before the missing identifier is noticed, and also before an array is looked for.
    proto.mutable_iipresult()->clear_id();
    proto.mutable_iipresult()->mutable_exception()->set_status(wire::inRUNTIME_ERROR);
    proto.mutable_iipresult()->mutable_exception()->add_causes()->set_status(static_cast<wire::ExecutionStatus>(-1));
    proto.add_dataids(9);
    EXPECT_FATAL(readResult(proto), fatal::statusIn);
}

void writeResultAloud(FEvalResult::Results&& results) {
    fatal::writeAloud("krutil:FEvalResult", std::unique_ptr<IIPResult>(std::make_unique<FEvalResult>(
                                                requestID, std::move(results), exceptionWith(6))));
}

TEST_F(FEvalResultDeathTest, ABadStatusToWriteBeforeAnyFrameAndBeforeTheFormOfTheOutputs) {
    EXPECT_FATAL_BEFORE_ANY_FRAME(writeResultAloud(std::vector<Array>{small(1)}), fatal::statusOut);
    EXPECT_FATAL_BEFORE_ANY_FRAME(writeResultAloud(FEvalResult::Results()), fatal::statusOut);
}

}  // namespace
