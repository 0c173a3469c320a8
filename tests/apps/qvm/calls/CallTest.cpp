// Function calls with arrays through a real engine, against NumPy's own answers.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdlib>

#include "apps/qvm/calls/CallFixture.hpp"
#include "foundation/korveldata/protobuf/SerializationContext.hpp"
#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"
#include "msg_svc/protobuf/ustring.hpp"

namespace qvm_test {
namespace {

using foundation::korveldata::protobuf::outOfLineThreshold;
using foundation::vantor::carrier::framing::BufferAllocator;
using krutil::cmddistributor::inCOMM_ERROR;
using krutil::cmddistributor::inEXECUTION_CTRLC;
using krutil::cmddistributor::inRUNTIME_ERROR;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::StartsWith;

// An engine, and functions in its session that make arrays and compare those that came with what was meant.
class EngineCallTest : public testing::Test {
  protected:
    explicit EngineCallTest(std::vector<std::string> arguments = {}, const session::Limits& limits = {})
        : engine(std::move(arguments), limits) {
        EXPECT_EQ(client
                      .eval(R"(
import numpy
def make(code):
    return eval(code)
def native(y):
    return y.astype(y.dtype.newbyteorder('='), order='K')
def difference(x, code):
    y = eval(code)
    if x.dtype != y.dtype.newbyteorder('=') or x.shape != y.shape:
        return f'{x.dtype} {x.shape} instead of {y.dtype} {y.shape}'
    if x.tobytes() != native(y).tobytes():
        return f'{x} instead of {y}'
    if y.flags.f_contiguous != x.flags.f_contiguous and y.flags.forc:
        return f'another order'
    if x.flags.owndata or not x.flags.writeable or not x.flags.aligned or x.ctypes.data % 64 != 0:
        return f'{x.flags}'
    return ''
)")
                      .errorText(),
                  "");
    }

    std::vector<Array> call(const std::string& function, std::vector<Array> arguments, unsigned long wanted = 1) {
        return qvm_test::call(client, function, std::move(arguments), wanted);
    }

    Array make(const std::string& code) {
        std::vector<Array> made = call("make", {text(msg_svc::protobuf::utf8_to_ustring(code))});
        return made.empty() ? Array() : made.front();
    }

    // Empty when the engine sees `array` as what `code` says.
    std::string difference(const Array& array, const std::string& code) {
        std::vector<Array> result = call("difference", {array, text(msg_svc::protobuf::utf8_to_ustring(code))});
        return result.empty() ? "no answer" : msg_svc::protobuf::ustring_to_utf8(result.front().toText());
    }

    std::string shown(const std::string& code) {
        const Evaluation result = client.eval(code);
        return result.shown() + result.errorText();
    }

    EngineSession engine;
    EngineClient& client = engine.client;
};

TEST_F(EngineCallTest, ArraysOfAllKindsGoThereAndBack) {
    for (const char* code : {
             "numpy.arange(12).reshape(3, 4)",
             "numpy.asfortranarray(numpy.arange(12.0).reshape(3, 4))",
             "numpy.arange(24, dtype='i2').reshape(2, 3, 4).T",
             "numpy.arange(1000.0)[::3]",
             "numpy.arange(1000.0)[::-1]",
             "numpy.arange(24).reshape(2, 3, 4).transpose(1, 0, 2)",
             "numpy.array(2.5)",
             "numpy.float32(7)",
             "numpy.zeros((0,))",
             "numpy.zeros((3, 0, 2), 'c8')",
             "numpy.broadcast_to(numpy.arange(3), (4, 3))",
             "numpy.frombuffer(bytes(range(8)), 'u1')",
             "numpy.arange(1000, dtype='>f8')",
             "numpy.arange(12, dtype='>i2').reshape(3, 4).T",
             "numpy.array([True, False, True])",
             "numpy.arange(1000) % 3 == 0",
             "numpy.arange(6).reshape(2, 3) * (1 + 2j)",
             "(numpy.arange(600) * (1 - 2j)).astype('c8')",
             "numpy.array([numpy.nan, -0.0, numpy.inf])",
             "numpy.array([2**63 - 1, -2**63])",
             "numpy.array([2**64 - 1], 'u8')",
             "numpy.array([-128, 127], 'i1')",
             "numpy.arange(70000, dtype='u2')",
             "numpy.arange(70000, dtype='u4')",
             "numpy.arange(70000, dtype='f4')",
         }) {
        EXPECT_EQ(difference(make(code), code), "") << code;
    }
}

TEST_F(EngineCallTest, SizesAroundTheThresholdGoThereAndBack) {
    for (const std::size_t size : {std::size_t{0}, std::size_t{1}, outOfLineThreshold - 1, outOfLineThreshold,
                                   outOfLineThreshold + 1, std::size_t{1} << 20}) {
        const Array sent = bytes(size);
        const std::vector<Array> got = call("numpy.asarray", {sent});
        ASSERT_EQ(got.size(), 1U);
        EXPECT_EQ(got[0], sent) << size;
        EXPECT_EQ(difference(sent, "(numpy.arange(" + std::to_string(size) + ") % 251).astype('u1')"), "");
    }
}

TEST_F(EngineCallTest, LargeArrayGoesThereAndBack) {
    EXPECT_EQ(shown("def check(x):\n"
                    "    return x, bool((x == numpy.resize(numpy.arange(251, dtype='u1'), x.size)).all())\n"),
              "");
    const Array sent = bytes(std::size_t{256} << 20);
    const std::vector<Array> got = call("check", {sent}, 2);
    ASSERT_EQ(got.size(), 2U);
    EXPECT_TRUE(got[0] == sent);
    EXPECT_EQ(got[1], ArrayFactory().createScalar(true));
}

TEST_F(EngineCallTest, SeveralOutputsOfALibraryFunction) {
    std::vector<Array> parts = call("numpy.linalg.svd", {make("numpy.vander([1.0, 2, 3, 4])")}, 3);
    ASSERT_EQ(parts.size(), 3U);
    EXPECT_EQ(shown("def whole(u, s, v): return bool(numpy.allclose(u * s @ v, numpy.vander([1.0, 2, 3, 4])))"), "");
    EXPECT_EQ(call("whole", parts).at(0), ArrayFactory().createScalar(true));
}

TEST_F(EngineCallTest, BuiltinsAndFunctionsOfTheSession) {
    EXPECT_EQ(call("len", {text(u"four")}).at(0), ArrayFactory().createScalar(std::int64_t{4}));
    EXPECT_EQ(shown("def twice(x): return 2 * x"), "");
    EXPECT_EQ(call("twice", {ArrayFactory().createScalar(1.5)}).at(0), ArrayFactory().createScalar(3.0));
    EXPECT_EQ(call("str.upper", {text(u"größe")}).at(0), text(u"GRÖSSE"));
    EXPECT_TRUE(call("twice", {ArrayFactory().createScalar(1.5)}, 0).empty());
    EXPECT_TRUE(call("print", {text(u"x")}, 0).empty());
}

TEST_F(EngineCallTest, OutputAndEventsAreThoseOfAnEvaluation) {
    EXPECT_EQ(shown("import sys\ndef talk(): print('out'); print('err', file=sys.stderr); return 1"), "");
    const Evaluation result = client.await(client.enqueue(callOf("talk", {})));
    EXPECT_EQ(result.output(), "out\n");
    EXPECT_EQ(result.errors(), "err\n");
    EXPECT_THAT(result.kinds(),
                ElementsAre("IIPStartedEvent", "TextBaseEvent", "TextBaseEvent", "IIPCompletedEvent", "LastIIPEvent"));
    EXPECT_EQ(outputsOf(result).at(0), ArrayFactory().createScalar(std::int64_t{1}));
}

TEST_F(EngineCallTest, ErrorOfTheFunctionComesInAPlainResult) {
    EXPECT_EQ(shown("def outer(): inner()\ndef inner(): print('before'); raise KeyError('lost')"), "");
    const Evaluation result = client.await(client.enqueue(callOf("outer", {})));
    const cmddistributor::IIPResult& plain = *result.reply->getResult();
    EXPECT_EQ(typeid(plain), typeid(cmddistributor::IIPResult));
    EXPECT_EQ(result.output(), "before\n");
    ASSERT_TRUE(result.error);
    EXPECT_EQ(result.error->getExecutionStatus(), inRUNTIME_ERROR);
    EXPECT_EQ(result.errorId(), "KeyError");
    EXPECT_EQ(result.errorText(), "'lost'");
    ASSERT_EQ(result.error->getStackFrames().size(), 2U);
    EXPECT_EQ(result.error->getStackFrames()[0].func, "outer");
    EXPECT_EQ(result.error->getStackFrames()[1].func, "inner");
    EXPECT_EQ(result.error->getFunctionName(), "inner");
}

TEST_F(EngineCallTest, EveryOtherFailureComesInAPlainResultToo) {
    EXPECT_EQ(callError(client, "numpy.linalg.svdd", {}),
              "AttributeError: Unknown function 'numpy.linalg.svdd': the module 'numpy.linalg' has no attribute and no "
              "submodule 'svdd'");
    EXPECT_EQ(callError(client, "numpy.linalg.eigh", {bytes(0)}),
              "numpy.linalg.LinAlgError: 1-dimensional array given. Array must be at least two-dimensional");
    EXPECT_EQ(callError(client, "divmod", {bytes(3), bytes(3)}, 3),
              "ValueError: 3 outputs were wanted, but 'divmod' returned 2; ask for 2 outputs");
    EXPECT_EQ(callError(client, "print", {}),
              "ValueError: 1 output was wanted, but 'print' returned none; ask for 0 outputs");
    EXPECT_EQ(
        callError(client, "object", {}),
        "TypeError: The output of 'object' has dtype object, which cannot be sent; what can is bool, 8- to 64-bit "
        "integers, float32, float64, complex64, complex128, and text as a single str");
    EXPECT_EQ(callError(client, "len", {ArrayFactory().createArray(ElementType::ComplexInt16, {2})}),
              "TypeError: Argument 1 of 'len' has elements of type complex int16, which NumPy does not have");
    EXPECT_EQ(shown("1 + 1"), "2\n");
}

TEST_F(EngineCallTest, InterruptInsideAFunctionHasItsOwnStatus) {
    EXPECT_EQ(shown("def f(): raise KeyboardInterrupt"), "");
    const Evaluation result = client.await(client.enqueue(callOf("f", {})));
    ASSERT_TRUE(result.error);
    EXPECT_EQ(result.error->getExecutionStatus(), inEXECUTION_CTRLC);
}

TEST_F(EngineCallTest, SystemExitInsideAFunctionEndsTheSession) {
    EXPECT_EQ(callError(client, "sys.exit", {text(u"enough")}), "SystemExit: enough");
    EXPECT_EQ(client.awaitEnd().reason, session::SessionEnd::Reason::Finished);
    EXPECT_EQ(engine.process.wait(), 0);
}

TEST_F(EngineCallTest, ForkedChildOfAFunctionDoesNotAnswer) {
    EXPECT_EQ(shown("import os\n"
                    "def f():\n"
                    "    pid = os.fork()\n"
                    "    return pid == 0 or os.waitstatus_to_exitcode(os.waitpid(pid, 0)[1])\n"),
              "");
    EXPECT_EQ(call("f", {}).at(0), ArrayFactory().createScalar(std::int64_t{0}));
    EXPECT_EQ(shown("1 + 1"), "2\n");
}

TEST_F(EngineCallTest, ReplyIsWrittenBeforeTheNextRequestRuns) {
    EXPECT_EQ(shown("data = numpy.ones(4 << 20)\ndef current(): return data"), "");
    const IDType reading = client.enqueue(callOf("current", {}));
    const IDType changing = client.enqueue("data[:] = 2");
    const std::vector<Array> got = outputsOf(client.await(reading));
    client.await(changing);
    ASSERT_EQ(got.size(), 1U);
    EXPECT_EQ(difference(got[0], "numpy.ones(4 << 20)"), "");
    EXPECT_EQ(difference(call("current", {}).at(0), "numpy.full(4 << 20, 2.0)"), "");
}

TEST(CallAtAPromptTest, FunctionIsLookedUpInTheSessionNotInTheStoppedFrame) {
    EngineSession engine({}, {}, {capabilities::Capability::Debugging});
    EngineClient& client = engine.client;
    const IDType outer = client.enqueue(
        "def name(): return 'of the session'\n"
        "def stop():\n"
        "    def name(): return 'of the frame'\n"
        "    breakpoint()\n"
        "stop()");
    client.awaitLoop(outer, cmddistributor::DebugLoopEvent::ENTER);
    EvalOptions atPrompt;
    atPrompt.mode = krutil::cmddistributor::WhenToDequeue::DEQUEUE_AT_PROMPT;
    EXPECT_EQ(client.eval("name()", atPrompt).shown(), "'of the frame'\n");
    const std::vector<Array> outputs = outputsOf(client.await(client.enqueue(callOf("name", {}), atPrompt)));
    ASSERT_EQ(outputs.size(), 1U);
    EXPECT_EQ(std::string(outputs[0].data(), outputs[0].sizeInBytes()),
              std::string(text(u"of the session").data(), text(u"of the session").sizeInBytes()));
    client.eval("import qvm; qvm.dbcont()", atPrompt);
    EXPECT_FALSE(client.await(outer).error);
}

TEST(CallAtAPromptTest, OutputIsWhatItWasThoughACancelLetsTheCodeGoOnBeforeItIsRead) {
    EngineSession engine({}, {}, {capabilities::Capability::Debugging});
    EngineClient& client = engine.client;
    Gate returned;
    Gate changed;
    // The thread opens the first gate when the call is over and the main thread waits for its reply to be read.
    const IDType outer = client.enqueue(
        "import numpy, sys, threading, time\n"
        "whole = numpy.full(50_000_000, 1, 'u1')\n"
        "main = threading.get_ident()\n"
        "def names(frame): return [] if frame is None else [frame.f_code.co_name] + names(frame.f_back)\n"
        "def watch():\n"
        "    while 'get' in names(sys._current_frames()[main]): time.sleep(0.001)\n"
        "    while '<lambda>' in names(sys._current_frames()[main]): time.sleep(0.001)\n"
        "    " +
        returned.wait() +
        "\n"
        "def get():\n"
        "    threading.Thread(target=watch).start()\n"
        "    return whole\n"
        "try: breakpoint()\n"
        "finally:\n"
        "    whole[:] = 2\n"
        "    " +
        changed.wait());
    client.awaitLoop(outer, cmddistributor::DebugLoopEvent::ENTER);
    client.stopReading();
    EvalOptions atPrompt;
    atPrompt.mode = krutil::cmddistributor::WhenToDequeue::DEQUEUE_AT_PROMPT;
    const IDType inner = client.enqueue(callOf("get", {}), atPrompt);
    returned.open();
    const session::framing::StreamID cancel = client.startCancel(outer);
    // The memory is changed while the reply, which no buffer on the way can hold, has not been read.
    changed.open();
    client.readOn();
    EXPECT_EQ(client.awaitCancel(cancel), cmddistributor::IIPCancelReply::PENDING_CANCEL);
    const std::vector<Array> outputs = outputsOf(client.await(inner));
    ASSERT_EQ(outputs.size(), 1U);
    const char* const elements = outputs[0].data();
    EXPECT_EQ(std::count(elements, elements + outputs[0].sizeInBytes(), '\1'), 50'000'000);
    EXPECT_EQ(client.await(outer).errorId(), "KeyboardInterrupt");
}

TEST_F(EngineCallTest, OutputsMayBeArgumentsAndShareMemory) {
    EXPECT_EQ(shown("def f(x):\n"
                    "    x += 1\n"
                    "    return x, x, x[1000:], x[::-1], x[:1000]\n"),
              "");
    const Array sent = make("numpy.arange(10000.0)");
    const std::vector<Array> got = call("f", {sent}, 5);
    ASSERT_EQ(got.size(), 5U);
    EXPECT_EQ(difference(got[0], "numpy.arange(10000.0) + 1"), "");
    EXPECT_EQ(got[0], got[1]);
    EXPECT_EQ(difference(got[2], "numpy.arange(1001.0, 10001)"), "");
    EXPECT_EQ(difference(got[3], "numpy.arange(10000.0, 0, -1)"), "");
    EXPECT_EQ(difference(got[4], "numpy.arange(1.0, 1001)"), "");
    EXPECT_EQ(difference(sent, "numpy.arange(10000.0)"), "");
}

TEST_F(EngineCallTest, SameArrayMayBeSeveralArguments) {
    EXPECT_EQ(shown("def f(a, b):\n"
                    "    a[:] = 0\n"
                    "    return b\n"),
              "");
    const Array sent = bytes(10'000);
    EXPECT_EQ(call("f", {sent, sent}).at(0), sent);
}

TEST_F(EngineCallTest, OutputIsReleasedOnceItIsSent) {
    EXPECT_EQ(shown("import weakref\n"
                    "def f():\n"
                    "    global watch\n"
                    "    result = numpy.ones(1 << 20)\n"
                    "    watch = weakref.ref(result)\n"
                    "    return result\n"),
              "");
    EXPECT_EQ(call("f", {}).size(), 1U);
    // The engine's writing thread is done with the memory a moment after its last byte was taken.
    std::string alive;
    for (int i = 0; i < 10'000 && alive != "False\n"; ++i) {
        alive = shown("watch() is not None");
    }
    EXPECT_EQ(alive, "False\n");
}

TEST_F(EngineCallTest, ArgumentsMayOutliveTheCall) {
    EXPECT_EQ(shown("kept = []\ndef keep(x): kept.append(x)"), "");
    call("keep", {bytes(100'000)}, 0);
    call("keep", {bytes(1)}, 0);
    EXPECT_EQ(shown("[int(each.astype('u8').sum()) for each in kept] == "
                    "[int((numpy.arange(100000) % 251).sum()), 0]"),
              "True\n");
}

TEST_F(EngineCallTest, ClientsBuffersAreReleased) {
    const std::size_t before = BufferAllocator::inUse();
    for (int i = 0; i < 10; ++i) {
        EXPECT_EQ(call("numpy.negative", {bytes(100'000)}).size(), 1U);
    }
    // What the test itself has seen is kept by the fixture's record of replies.
    EXPECT_LE(BufferAllocator::inUse(), before + 10);
}

TEST(FreshEngineTest, NumpyIsImportedWhenAnArrayIsThere) {
    EngineSession engine;
    const std::string loaded = "import sys; 'numpy' in sys.modules";
    EXPECT_EQ(call(engine.client, "len", {text(u"four")}).size(), 1U);
    EXPECT_EQ(call(engine.client, "os.getpid", {}).size(), 1U);
    EXPECT_EQ(engine.client.eval(loaded).shown(), "False\n");
    EXPECT_EQ(call(engine.client, "len", {bytes(3)}).size(), 1U);
    EXPECT_EQ(engine.client.eval(loaded).shown(), "True\n");
}

TEST(FreshEngineTest, OutputBeyondThePeersLimitsIsAnErrorAndTheSessionGoesOn) {
    session::Limits limits;
    limits.message = 1 << 20;
    EngineSession engine({}, limits);
    const Evaluation result = engine.client.await(engine.client.enqueue(callOf("bytearray", {bytes(1)})));
    EXPECT_FALSE(result.error);
    const Evaluation large = engine.client.await(
        engine.client.enqueue(callOf("numpy.zeros", {ArrayFactory().createScalar(std::int32_t{1 << 20})})));
    ASSERT_TRUE(large.error);
    EXPECT_EQ(large.error->getExecutionStatus(), inCOMM_ERROR);
    EXPECT_THAT(large.errorText(), StartsWith("The result of this request cannot be sent: "));
    EXPECT_THAT(large.errorText(), HasSubstr("1048576"));
    EXPECT_EQ(engine.client.eval("1 + 1").shown(), "2\n");
}

TEST(FreshEngineTest, WaitingArgumentsCountForTheQueuesBound) {
    EngineSession engine({"--max-queued-bytes", "100KiB"});
    const Evaluation result = engine.client.await(engine.client.enqueue(callOf("len", {bytes(101 << 10)})));
    EXPECT_TRUE(result.discarded());
    EXPECT_THAT(result.errorText(), HasSubstr("would hold more than 102400 bytes, which is the engine's bound"));
    EXPECT_EQ(call(engine.client, "len", {bytes(99 << 10)}).size(), 1U);
}

// More memory than a test may take unasked: KRUTIL_LARGE_ARRAY_BYTES says how much there is to send.
TEST(LargeArrayTest, GoesThereAndBack) {
    const char* const asked = std::getenv("KRUTIL_LARGE_ARRAY_BYTES");
    if (asked == nullptr) {
        GTEST_SKIP() << "set KRUTIL_LARGE_ARRAY_BYTES to run it, for example to 1073741824";
    }
    const std::uint64_t size = std::strtoull(asked, nullptr, 10);
    const std::string limit = std::to_string(size + (1U << 20));
    session::Limits limits;
    limits.message = size + (1U << 20);
    EngineSession engine({"--limit-message", limit, "--max-queued-bytes", limit}, limits);
    const Array sent = bytes(size);
    const std::vector<Array> got = call(engine.client, "numpy.asarray", {sent});
    ASSERT_EQ(got.size(), 1U);
    EXPECT_EQ(got[0].numberOfElements(), size);
    EXPECT_TRUE(got[0] == sent);
}

}  // namespace
}  // namespace qvm_test
