// What docs/protocol.md and docs/session-wire.md tell whoever writes a client, held against a real engine.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>
#include <utility>
#include <vector>

#include "apps/qvm/bytes/ByteClient.hpp"
#include "foundation.korveldata.protobuf.KORVEL_Array.pb.h"
#include "krutil.protobuf.FEvalResult.pb.h"
#include "krutil.protobuf.IIPCancelReply.pb.h"
#include "krutil.protobuf.IIPReply.pb.h"
#include "platform/session/support/WireBytes.hpp"

namespace qvm_test {
namespace {

namespace wire_protobuf = krutil::protobuf;
using foundation::korveldata::protobuf::KORVEL_Array;

// Without a colon for a request that ran to its end.
std::string outcome(const Received& reply) {
    if (reply.tag() != "krutil:IIPReply") {
        return reply.tag();
    }
    const wire_protobuf::RuntimeException error = errorOf(reply);
    return error.msgid().empty() ? "ran" : error.msgid() + ": " + error.msgtext();
}

wire_protobuf::CancelStatus statusOf(const Received& reply) {
    EXPECT_EQ(reply.tag(), "krutil:IIPCancelReply");
    return reply.as<wire_protobuf::IIPCancelReply>(1).status();
}

std::string doubles(std::size_t count) {
    const double one = 1.0;
    std::string bytes;
    for (std::size_t i = 0; i < count; ++i) {
        bytes.append(reinterpret_cast<const char*>(&one), sizeof(one));
    }
    return bytes;
}

KORVEL_Array doubleArray(std::size_t count) {
    KORVEL_Array array;
    array.set_elementtype(5);
    array.add_dimensions(count);
    array.set_order(KORVEL_Array::ROW_MAJOR);
    return array;
}

// A call of sum() with the array of frame `index`, the frames before which are given.
std::string sumOf(const std::string& before, std::uint64_t index, const KORVEL_Array& array) {
    wire_protobuf::FEvalIIP request;
    *request.mutable_iip() = requestCore();
    request.set_functionname("numpy.sum");
    request.set_nlhs(1);
    request.add_dataids(index);
    request.set_clientqvmid(77);
    request.set_serverqvmid(88);
    return requestBytes(1, before + wire::tagged(1, index, false, "krutil:QDA", array.SerializeAsString()), index + 1,
                        "krutil:FEvalIIP", request.SerializeAsString(), enqueueing(index + 1, 1));
}

// The output of a call that has one, a double.
double outputOf(const Received& reply) {
    const auto root = reply.as<wire_protobuf::IIPReply>(reply.frames.size());
    const auto result = reply.as<wire_protobuf::FEvalResult>(root.resultid());
    if (reply.frames.at(root.resultid() - 1).tag != "krutil:FEvalResult" || result.dataids_size() != 1) {
        ADD_FAILURE() << outcome(reply);
        return 0;
    }
    const std::string elements = reply.as<KORVEL_Array>(result.dataids(0)).inlineelements();
    double value = 0;
    elements.copy(reinterpret_cast<char*>(&value), sizeof(value));
    return value;
}

TEST(ByteClientTest, NumbersThatMeanEnginesAreNotLookedAt) {
    ByteClient client;
    wire_protobuf::IIPEnqueueMessage enqueue = enqueueing(1, 5);
    enqueue.set_qcrid(-5);
    enqueue.set_qvmid(99);
    client.write(evaluation(1, "print('ran')", enqueue));
    EXPECT_EQ(outcome(client.awaitReply(1)), "ran");
    EXPECT_EQ(client.text(), "ran\n");
}

TEST(ByteClientTest, TheReplyHasTheIdentifierOfTheRequest) {
    ByteClient client;
    client.write(evaluation(1, "pass", enqueueing(1, 5)));
    const Received reply = client.awaitReply(1);
    EXPECT_EQ(reply.as<wire_protobuf::IIPReply>(reply.frames.size()).id().lo(), 5U);
}

TEST(ByteClientTest, ARequestNeedsNoIdentifier) {
    ByteClient client;
    wire_protobuf::IIPEnqueueMessage enqueue = enqueueing(1, 0);
    enqueue.clear_iipid();
    client.write(evaluation(1, "print('ran')", enqueue));
    EXPECT_EQ(outcome(client.awaitReply(1)), "ran");
    EXPECT_EQ(client.text(), "ran\n");
}

TEST(ByteClientTest, ACancelTakesTheFirstQueuedRequestOfSeveralWithOneIdentifier) {
    ByteClient client;
    client.write(evaluation(1, "print('running\\n', end='', flush=True)\nwhile True: pass", enqueueing(1, 7)));
    client.awaitTag("krutil:TextBaseEvent");
    client.write(evaluation(2, "print(2)", enqueueing(1, 7)) + evaluation(3, "print(3)", enqueueing(1, 7)));
    const std::string cancelled = "KeyboardInterrupt: The request was cancelled before it was started.";
    for (const std::uint32_t stream : {2U, 3U}) {
        client.write(cancel(9, 7));
        EXPECT_EQ(outcome(client.awaitReply(stream)), cancelled);
        EXPECT_EQ(statusOf(client.awaitReply(9)), wire_protobuf::SUCCESSFUL_CANCEL);
    }
    client.write(cancel(9, 7));
    EXPECT_EQ(statusOf(client.awaitReply(9)), wire_protobuf::PENDING_CANCEL);
    EXPECT_EQ(outcome(client.awaitReply(1)), "KeyboardInterrupt: ");
    client.write(cancel(9, 7));
    EXPECT_EQ(statusOf(client.awaitReply(9)), wire_protobuf::UNABLE_TO_CANCEL_ALREADY_DONE);
    EXPECT_EQ(client.text(), "running\n");
}

TEST(ByteClientTest, ElementsAreTakenInsideTheArrayAtAnySize) {
    ByteClient client;
    for (const std::size_t count : {0U, 255U, 256U, 100'000U}) {
        KORVEL_Array array = doubleArray(count);
        array.set_inlineelements(doubles(count));
        client.write(sumOf({}, 1, array));
        EXPECT_EQ(outputOf(client.awaitReply(1)), static_cast<double>(count));
    }
}

TEST(ByteClientTest, ElementsAreTakenFromADataFrameOfAnySizeAndType) {
    ByteClient client;
    for (const auto& [count, type] : std::vector<std::pair<std::size_t, unsigned>>{
             {0, 11}, {1, 11}, {1, 0}, {1, 3}, {1, 29}, {1, 255}, {1000, 11}, {1000, 29}}) {
        KORVEL_Array array = doubleArray(count);
        array.set_dataid(1);
        client.write(sumOf(wire::data(1, 1, false, doubles(count), type), 2, array));
        EXPECT_EQ(outputOf(client.awaitReply(1)), static_cast<double>(count)) << type;
    }
}

// A parser would take the text for whole, with zero bytes for what is missing.
TEST(ByteClientTest, AContentThatWasCutIsAViolation) {
    krutil::protobuf::EvalIIP request;
    *request.mutable_iip() = requestCore();
    request.set_cmd("print(6 * 7)");
    const std::string whole = request.SerializeAsString();
    for (const std::size_t missing : {std::size_t{1}, std::size_t{10}}) {
        ByteClient client;
        client.write(
            requestBytes(1, {}, 1, "krutil:EvalIIP", whole.substr(0, whole.size() - missing), enqueueing(1, 1)));
        EXPECT_EQ(client.awaitTag("abort").frames.back().content,
                  "frame \"krutil:EvalIIP\", byte " + std::to_string(whole.size() - 14) +
                      ", field cmd: expected 12 more bytes, got " + std::to_string(12 - missing));
        EXPECT_EQ(client.readAll(), "");
        EXPECT_EQ(client.engine().wait(), 4);
    }
}

TEST(ByteClientTest, AFrameThatOnlyBeginsAfterTheGoodbyeIsNotNoticed) {
    const std::string request = evaluation(1, "pass", enqueueing(1, 1));
    // Parts of a header, of a frame, and a whole frame that is not the last one of its message.
    const std::size_t firstFrame =
        request.size() - 24 - std::string("krutil:IIPEnqueueMessage").size() - enqueueing(1, 1).ByteSizeLong();
    for (const std::size_t size : {std::size_t{1}, std::size_t{23}, std::size_t{24}, firstFrame - 1, firstFrame}) {
        ByteClient client;
        client.write(wire::goodbye() + request.substr(0, size));
        EXPECT_EQ(client.read().tag(), "krutil:QVMShutdownEvent") << size;
        EXPECT_EQ(client.readAll(), "") << size;
        EXPECT_EQ(client.engine().wait(), 0) << size;
    }
}

TEST(ByteClientTest, AMessageAfterTheGoodbyeIsAViolation) {
    for (const std::string& after : {evaluation(1, "pass", enqueueing(1, 1)), wire::goodbye()}) {
        ByteClient client;
        client.write(wire::goodbye() + after);
        EXPECT_EQ(client.awaitTag("abort").tag(), "abort");
        EXPECT_EQ(client.readAll(), "");
        EXPECT_EQ(client.engine().wait(), 4);
    }
}

TEST(ByteClientTest, NothingOfTheEngineIsAmongTheNamesOfASession) {
    ByteClient client;
    client.write(evaluation(1, "print([each for each in dir() if not each.startswith('__')])", enqueueing(1, 1)));
    EXPECT_EQ(outcome(client.awaitReply(1)), "ran");
    EXPECT_EQ(client.text(), "[]\n");
    client.write(evaluation(1, "qvm.dbcont()", enqueueing(1, 1)));
    EXPECT_EQ(outcome(client.awaitReply(1)), "NameError: name 'qvm' is not defined");
}

}  // namespace
}  // namespace qvm_test
