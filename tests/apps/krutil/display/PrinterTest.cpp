// Both printers, fed with events.

#include <gtest/gtest.h>

#include <limits>
#include <nlohmann/json.hpp>

#include "apps/krutil/CaughtOutput.hpp"
#include "cmddistributor/IIPStateEvent.hpp"
#include "foundation/korveldata/ArrayFactory.hpp"
#include "krutil/capabilities_api/CapabilitiesChanged.hpp"
#include "krutil/display/JsonPrinter.hpp"
#include "krutil/display/PersonPrinter.hpp"
#include "krutil/eventmgr/QVMShutdownEvent.hpp"
#include "krutil/io/SinkTextEvent.hpp"
#include "krutil/io/TextBaseEvent.hpp"

namespace krutil_client {
namespace {

using capabilities::Capability;
using capabilities::CapabilityList;
using foundation::msg_svc::exchange::IDType;
using krutil::io::SinkTextEvent;
using krutil::io::StreamTypeEnum;
using krutil::io::TextBaseEvent;

const IDType request(0x0123456789abcdef, 0xfedcba9876543210);
const std::string requestText = "0123456789abcdeffedcba9876543210";

cmddistributor::RuntimeException error() {
    return {krutil::cmddistributor::inRUNTIME_ERROR,
            u"no good",
            "ValueError",
            "work",
            {{u"a.py", "work", 12}, {u"b.py", "more", 2.5}},
            {{krutil::cmddistributor::inEXECUTION_CTRLC, u"", "KeyboardInterrupt", "", {}, {}, false}},
            false};
}

class PersonPrinterTest : public PrinterFixture {
  protected:
    PersonPrinterTest() { printer.subscribe(events); }
    PersonPrinter printer{out, err, {}};
};

TEST_F(PersonPrinterTest, TextGoesToItsStreamByteForByte) {
    publish<TextBaseEvent>(request, StreamTypeEnum::OUTPUT_STREAM, u"out \u00e4\n");
    publish<TextBaseEvent>(request, StreamTypeEnum::ERROR_STREAM, u"err\n");
    publish<TextBaseEvent>(IDType(), StreamTypeEnum::GENERIC_STREAM, u"generic");
    publish<SinkTextEvent>(request, StreamTypeEnum::OUTPUT_STREAM, std::u16string(u"value\0!", 7));
    publish<SinkTextEvent>(request, StreamTypeEnum::ERROR_STREAM, u"sink err");
    EXPECT_EQ(outPipe.content(), std::string("out \u00e4\ngenericvalue\0!", 21));
    EXPECT_EQ(errPipe.content(), "err\nsink err");
}

TEST_F(PersonPrinterTest, StateEventsAreNotShown) {
    publish<cmddistributor::IIPStartedEvent>(request);
    publish<cmddistributor::LastIIPEvent>(request);
    publish<krutil::eventmgr::QVMShutdownEvent>();
    printer.connected({}, {});
    EXPECT_EQ(outPipe.content() + errPipe.content(), "");
}

TEST_F(PersonPrinterTest, AnErrorGoesToStandardError) {
    const auto raised = error();
    printer.replied({request, nullptr});
    printer.replied({request, &raised});
    EXPECT_EQ(outPipe.content(), "");
    EXPECT_EQ(errPipe.content(),
              "KeyboardInterrupt\n"
              "\n"
              "The error above caused this one:\n"
              "\n"
              "In \"a.py\", line 12, in work\n"
              "In \"b.py\", line 2.5, in more\n"
              "ValueError: no good\n");
}

TEST_F(PersonPrinterTest, TimingTellsWhatIsKnown) {
    printer.timed({std::chrono::microseconds(12'345), std::nullopt, std::chrono::milliseconds(2)});
    EXPECT_EQ(errPipe.content(), "krutil: engine ready after 12.35 ms, answered after 2.00 ms\n");
}

class SafePersonPrinterTest : public PrinterFixture {
  protected:
    SafePersonPrinterTest() { printer.subscribe(events); }
    PersonPrinter printer{out, err, {.color = true, .safeText = true}};
};

TEST_F(SafePersonPrinterTest, ShowsWhatSteersATerminalAsEscapes) {
    publish<TextBaseEvent>(request, StreamTypeEnum::OUTPUT_STREAM, u"out\x1b[2J\r\t\u202e\n");
    publish<SinkTextEvent>(request, StreamTypeEnum::OUTPUT_STREAM, u"'value\u2066'\n");
    publish<TextBaseEvent>(request, StreamTypeEnum::ERROR_STREAM, u"err\x1b]0;title\a\n");
    const cmddistributor::RuntimeException raised{
        krutil::cmddistributor::inRUNTIME_ERROR, u"bad \x1b[31m", "Error", "", {{u"a\u202e.py", "f", 1}}, {}, false};
    printer.replied({request, &raised});
    const auto array = foundation::korveldata::ArrayFactory().createText(u"text\x1b[2J");
    printer.returned({request, 1, 1, array, ""});
    EXPECT_EQ(outPipe.content(), "out\\x1b[2J\\x0d\t\\u202e\n'value\\u2066'\ntext of 8 characters: text\\x1b[2J\n");
    EXPECT_EQ(errPipe.content(),
              "\x1b[31merr\\x1b]0;title\\x07\n\x1b[0m"
              "\x1b[31mIn \"a\\u202e.py\", line 1, in f\nError: bad \\x1b[31m\n\x1b[0m");
}

class JsonPrinterTest : public PrinterFixture {
  protected:
    JsonPrinterTest() { printer.subscribe(events); }
    JsonPrinter printer{out};
};

TEST_F(JsonPrinterTest, EachStateEventIsOneObjectTheLastOneToo) {
    publish<cmddistributor::IIPStartedEvent>(request);
    publish<cmddistributor::IIPSuspendedEvent>(request);
    publish<cmddistributor::IIPResumedEvent>(request);
    publish<cmddistributor::IIPDiscardedEvent>(request);
    publish<cmddistributor::IIPRequeuedEvent>(request);
    publish<cmddistributor::IIPReactivatedEvent>(request);
    publish<cmddistributor::IIPCompletedEvent>(request);
    publish<cmddistributor::LastIIPEvent>(request);
    std::string expected;
    for (const std::string name :
         {"started", "suspended", "resumed", "discarded", "requeued", "reactivated", "completed", "last"}) {
        expected += R"({"event":")" + name + R"(","request":")" + requestText + "\"}\n";
    }
    EXPECT_EQ(outPipe.content(), expected);
}

TEST_F(JsonPrinterTest, TextAndValues) {
    publish<TextBaseEvent>(request, StreamTypeEnum::OUTPUT_STREAM, u"\u00e4\n\"");
    publish<TextBaseEvent>(IDType(), StreamTypeEnum::GENERIC_STREAM, std::u16string(u"\0", 1));
    publish<SinkTextEvent>(request, StreamTypeEnum::ERROR_STREAM, u"42");
    EXPECT_EQ(
        outPipe.content(),
        R"({"event":"text","request":")" + requestText + "\",\"stream\":\"output\",\"text\":\"\u00e4\\n\\\"\"}\n" +
            R"({"event":"text","request":"00000000000000000000000000000000","stream":"generic","text":"\u0000"})" +
            "\n" + R"({"event":"value","request":")" + requestText + R"(","stream":"error","text":"42"})" + "\n");
}

TEST_F(JsonPrinterTest, CapabilitiesAndShutdown) {
    publish<krutil::capabilities_api::CapabilitiesChanged>(
        CapabilityList{}, CapabilityList{Capability::Debugging},
        CapabilityList{Capability::InteractiveCommandLine, Capability::LocalClient}, CapabilityList{Capability::Swing});
    publish<krutil::eventmgr::QVMShutdownEvent>();
    EXPECT_EQ(outPipe.content(), R"({"event":"capabilities","previous":[],"engine":["Debugging"],)"
                                 R"("client":["InteractiveCommandLine","LocalClient"],"request":["Swing"]})"
                                 "\n"
                                 R"({"event":"shutdown"})"
                                 "\n");
}

TEST_F(JsonPrinterTest, ConnectionTimingAndFailure) {
    printer.connected({"engine 1.0", {}, CapabilityList{Capability::Debugging}}, {{"ZEROCOPY", "enable"}});
    printer.timed({std::nullopt, std::chrono::microseconds(1'500), std::chrono::milliseconds(2)});
    printer.failed(3, "the engine was lost");
    EXPECT_EQ(
        outPipe.content(),
        R"({"event":"connected","engine":"engine 1.0","features":{"ZEROCOPY":"enable"},"capabilities":["Debugging"]})"
        "\n"
        R"({"event":"timing","firstOutputMs":1.5,"answeredMs":2.0})"
        "\n"
        R"({"event":"failure","exitCode":3,"text":"the engine was lost"})"
        "\n");
}

TEST_F(JsonPrinterTest, WhatSteersATerminalIsAnEscape) {
    publish<TextBaseEvent>(request, StreamTypeEnum::OUTPUT_STREAM, u"a\x1b\u009b\u202e\u2069b");
    const std::string line = outPipe.content();
    EXPECT_EQ(line, R"({"event":"text","request":")" + requestText +
                        R"(","stream":"output","text":"a\u001b\u009b\u202e\u2069b"})" + "\n");
    EXPECT_EQ(nlohmann::json::parse(line).at("text"), "a\x1b\u009b\u202e\u2069b");
}

TEST_F(JsonPrinterTest, AReplyCarriesItsError) {
    const auto raised = error();
    printer.replied({request, nullptr});
    printer.replied({request, &raised});
    EXPECT_EQ(outPipe.content(),
              R"({"event":"reply","request":")" + requestText + R"(","ok":true})" + "\n" +
                  R"({"event":"reply","request":")" + requestText +
                  R"(","ok":false,"error":{"status":"runtime error",)" +
                  R"("id":"ValueError","message":"no good","function":"work","frames":[)" +
                  R"({"file":"a.py","function":"work","line":12},{"file":"b.py","function":"more","line":2.5}],)" +
                  R"("causes":[{"status":"cancelled","id":"KeyboardInterrupt","message":"","function":"",)" +
                  R"("frames":[],"causes":[]}]}})" + "\n");
}

TEST_F(JsonPrinterTest, TextThatIsNoUtf8AndNumbersThatAreNoneAreShownAllTheSame) {
    const cmddistributor::RuntimeException raised{krutil::cmddistributor::inRUNTIME_ERROR,
                                                  std::u16string(u"\xd800", 1),
                                                  "bad \xff id",
                                                  "cut \xe2\x82",
                                                  {{u"f", "\x80", std::numeric_limits<double>::quiet_NaN()}},
                                                  {},
                                                  false};
    publish<TextBaseEvent>(request, StreamTypeEnum::OUTPUT_STREAM, std::u16string(u"a\xdc00z", 3));
    printer.replied({request, &raised});
    printer.failed(4, "got \xfe");
    printer.connected({"\xff", {}, {}}, {{"\xff", "\xfe"}});
    const std::string text = outPipe.content();
    EXPECT_NE(text.find("\"text\":\"a\uFFFDz\""), std::string::npos) << text;
    EXPECT_NE(text.find("\"id\":\"bad \uFFFD id\",\"message\":\"\uFFFD\",\"function\":\"cut \uFFFD\""),
              std::string::npos)
        << text;
    EXPECT_NE(text.find("\"line\":null"), std::string::npos) << text;
    EXPECT_NE(text.find("\"text\":\"got \uFFFD\""), std::string::npos) << text;
    EXPECT_NE(text.find("\"features\":{\"\uFFFD\":\"\uFFFD\"}"), std::string::npos) << text;
}

}  // namespace
}  // namespace krutil_client
