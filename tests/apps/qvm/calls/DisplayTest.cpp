// Pictures and other forms of values: how an engine announces them, keeps them, and hands them over.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <fstream>
#include <string>
#include <vector>

#include "apps/qvm/calls/CallFixture.hpp"
#include "korvel/lang/diagnostic/IssuedEnabledWarningEvent.hpp"
#include "msg_svc/protobuf/ustring.hpp"
#include "support/TemporaryDirectory.hpp"

namespace qvm_test {
namespace {

using capabilities::Capability;
using capabilities::CapabilityList;
using korvel::lang::diagnostic::IssuedEnabledWarningEvent;
using msg_svc::protobuf::ustring_to_utf8;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::StartsWith;

// Forms of values as tests need them. A picture is as much of a PNG file as an engine looks at.
constexpr const char* forms = R"(
def png(width, height, rest=b''):
    return (b'\x89PNG\r\n\x1a\n\x00\x00\x00\rIHDR' + width.to_bytes(4, 'big') + height.to_bytes(4, 'big') + rest)
class Picture:
    def __init__(self, width=3, height=2, rest=b''):
        self.content = png(width, height, rest)
    def _repr_png_(self):
        return self.content
    def __repr__(self):
        return 'a picture'
def forms(**methods):
    return type('Formed', (), {'__repr__': lambda self: 'formed',
                               **{name: (lambda self, made=made: made()) for name, made in methods.items()}})()
def fail():
    raise ValueError('no ink')
)";

std::vector<std::string> warningsOf(const Evaluation& evaluation) {
    std::vector<std::string> texts;
    for (const Happening& event : evaluation.events) {
        if (const auto* const issued = dynamic_cast<const IssuedEnabledWarningEvent*>(event.event.get())) {
            texts.push_back(issued->getWarning().getIdentifier() + ": " +
                            ustring_to_utf8(issued->getWarning().getMessage()));
        }
    }
    return texts;
}

std::string bytesOf(const Array& array) {
    return {array.data(), array.sizeInBytes()};
}

std::string png(char width, char height) {
    return std::string("\x89PNG\r\n\x1a\n\0\0\0\rIHDR", 16) + std::string("\0\0\0", 3) + width +
           std::string("\0\0\0", 3) + height;
}

class EngineDisplayTest : public testing::Test {
  protected:
    explicit EngineDisplayTest(const CapabilityList& capabilities = {Capability::WebWindow})
        : engine_({}, {}, capabilities) {
        EXPECT_EQ(eval(forms).errorText(), "");
    }

    Evaluation eval(const std::string& code) { return engine_.client.eval(code); }

    // The description, after which the pictures' bytes are in data_.
    std::string take() {
        const std::vector<Array> outputs = call(engine_.client, "qvm.take_displays", {}, 2);
        if (outputs.size() != 2) {
            return "";
        }
        data_ = bytesOf(outputs[1]);
        return ustring_to_utf8(outputs[0].toText());
    }

    EngineSession engine_;
    std::string data_;
};

TEST_F(EngineDisplayTest, PictureIsAnnouncedInAnEventOfItsOwnAndTakenOnce) {
    const Evaluation result = eval("print('before'); Picture()");
    EXPECT_THAT(result.kinds(), ElementsAre("IIPStartedEvent", "TextBaseEvent", "SinkTextEvent", "SinkTextEvent",
                                            "IIPCompletedEvent", "LastIIPEvent"));
    EXPECT_EQ(result.events.at(result.events.size() - 3).text, "[picture 1: image/png, 3 x 2]\n");
    EXPECT_EQ(result.shown(), "a picture\n[picture 1: image/png, 3 x 2]\n");
    EXPECT_EQ(take(), R"([{"number": 1, "formats": [{"type": "image/png", "bytes": 24, "width": 3, "height": 2}]}])");
    EXPECT_EQ(data_, png(3, 2));
    EXPECT_EQ(take(), "[]");
    EXPECT_EQ(data_, "");
}

TEST_F(EngineDisplayTest, AllFormsOfAValueAreOneDisplay) {
    EXPECT_EQ(eval("forms(_repr_html_=lambda: '<b>\\u00e4\\ud800</b>', _repr_svg_=lambda: '<svg/>',"
                   " _repr_png_=lambda: png(255, 1))")
                  .shown(),
              "formed\n[picture 1: image/png, image/svg+xml, text/html, 255 x 1]\n");
    EXPECT_EQ(eval("forms(_repr_svg_=lambda: ('<svg></svg>', {'isolated': True}))").shown(),
              "formed\n[picture 2: image/svg+xml]\n");
    EXPECT_EQ(take(),
              "[{\"number\": 1, \"formats\": [{\"type\": \"image/png\", \"bytes\": 24, \"width\": 255, \"height\": 1}, "
              "{\"type\": \"image/svg+xml\", \"text\": \"<svg/>\"}, "
              "{\"type\": \"text/html\", \"text\": \"<b>\u00e4?</b>\"}]}, "
              "{\"number\": 2, \"formats\": [{\"type\": \"image/svg+xml\", \"text\": \"<svg></svg>\"}]}]");
    EXPECT_EQ(data_, png('\xff', 1));
}

TEST_F(EngineDisplayTest, PicturesFollowOneAnotherInTheBytes) {
    eval("import sys\nfor width in 1, 2: sys.displayhook(Picture(width))");
    EXPECT_EQ(take(), R"([{"number": 1, "formats": [{"type": "image/png", "bytes": 24, "width": 1, "height": 2}]}, )"
                      R"({"number": 2, "formats": [{"type": "image/png", "bytes": 24, "width": 2, "height": 2}]}])");
    EXPECT_EQ(data_, png(1, 2) + png(2, 2));
}

TEST_F(EngineDisplayTest, FormsAreLookedUpOnTheType) {
    EXPECT_EQ(eval("value = forms(); value._repr_png_ = lambda: png(1, 1); value").shown(), "formed\n");
    EXPECT_EQ(eval("Picture.__name__").shown(), "'Picture'\n");
    EXPECT_THAT(eval("Picture").shown(), StartsWith("<class "));
    EXPECT_EQ(eval("class Sealed(Picture):\n  _repr_png_ = None\nSealed()").shown(), "a picture\n");
    EXPECT_EQ(eval("forms(_repr_png_=lambda: None)").shown(), "formed\n");
    EXPECT_EQ(take(), "[]");
}

TEST_F(EngineDisplayTest, FormThatFailsIsAWarning) {
    const Evaluation failed = eval("forms(_repr_png_=fail, _repr_html_=lambda: '<p>')");
    EXPECT_EQ(failed.errorText(), "");
    EXPECT_EQ(failed.shown(), "formed\n[picture 1: text/html]\n");
    EXPECT_THAT(warningsOf(failed), ElementsAre("RuntimeWarning: Formed._repr_png_() has failed, so this form is not "
                                                "shown: ValueError: no ink"));
    const Evaluation wrong = eval("forms(_repr_png_=lambda: 'text', _repr_svg_=lambda: b'<svg/>')");
    EXPECT_EQ(wrong.shown(), "formed\n");
    EXPECT_THAT(warningsOf(wrong),
                ElementsAre("RuntimeWarning: Formed._repr_png_() has failed, so this form is not shown: TypeError: "
                            "expected bytes, got str",
                            "RuntimeWarning: Formed._repr_svg_() has failed, so this form is not shown: TypeError: "
                            "expected str, got bytes"));
    const Evaluation none = eval("forms(_repr_png_=lambda: b'GIF89a')");
    EXPECT_THAT(warningsOf(none), ElementsAre("RuntimeWarning: Formed._repr_png_() has failed, so this form is not "
                                              "shown: ValueError: the bytes are not those of a PNG picture"));
}

TEST_F(EngineDisplayTest, InterruptInAFormEndsTheRequest) {
    const Evaluation result = eval("def stop(): raise KeyboardInterrupt\nforms(_repr_png_=stop)");
    ASSERT_TRUE(result.error);
    EXPECT_EQ(result.error->getExecutionStatus(), krutil::cmddistributor::inEXECUTION_CTRLC);
    EXPECT_EQ(take(), "[]");
}

TEST_F(EngineDisplayTest, OldestOfTooManyAreDroppedWithOneSentence) {
    const Evaluation result = eval("import sys\nfor i in range(103): sys.displayhook(Picture())");
    EXPECT_THAT(warningsOf(result),
                ElementsAre("RuntimeWarning: The oldest pictures are dropped: at most 100 of 33554432 bytes together "
                            "are kept until the client takes them, which it does when the request has ended"));
    EXPECT_THAT(result.shown(), HasSubstr("[picture 103: image/png, 3 x 2]\n"));
    EXPECT_THAT(take(), StartsWith(R"([{"number": 4, )"));
    EXPECT_EQ(data_.size(), 100 * png(3, 2).size());
}

TEST_F(EngineDisplayTest, BytesThatAreKeptAreBounded) {
    const Evaluation result = eval("import sys\nfor i in range(3): sys.displayhook(Picture(rest=bytes(15 << 20)))");
    EXPECT_EQ(warningsOf(result).size(), 1U);
    EXPECT_THAT(take(), StartsWith(R"([{"number": 2, )"));
    EXPECT_EQ(data_.size(), 2 * (png(3, 2).size() + (15U << 20U)));
    const Evaluation large = eval("Picture(rest=bytes(32 << 20))");
    EXPECT_EQ(large.shown(), "a picture\n");
    EXPECT_THAT(warningsOf(large), ElementsAre("RuntimeWarning: A picture of 33554456 bytes is not shown: at most "
                                               "33554432 are kept for the client"));
}

TEST_F(EngineDisplayTest, ForkedChildKeepsNothing) {
    eval("import os, sys\nif os.fork() == 0:\n  sys.displayhook(Picture())\n  os._exit(0)\nos.wait()");
    EXPECT_EQ(take(), "[]");
}

class EngineNoDisplayTest : public EngineDisplayTest {
  protected:
    EngineNoDisplayTest() : EngineDisplayTest({Capability::InteractiveCommandLine}) {}
};

TEST_F(EngineNoDisplayTest, NothingIsAskedOrKeptForAClientThatCannotShowIt) {
    const Evaluation result = eval("forms(_repr_png_=fail)");
    EXPECT_EQ(result.shown(), "formed\n");
    EXPECT_THAT(warningsOf(result), IsEmpty());
    EXPECT_EQ(take(), "[]");
}

// matplotlib with files of its own, so that neither the user's nor the working directory's count.
class EngineFigureTest : public testing::Test {
  protected:
    EngineFigureTest() {
        ::setenv("MPLCONFIGDIR", directory_.path().c_str(), 1);
        ::unsetenv("MPLBACKEND");
        ::unsetenv("MATPLOTLIBRC");
    }
    ~EngineFigureTest() override { ::unsetenv("MPLCONFIGDIR"); }

    static std::string backendIn(EngineSession& engine) {
        return engine.client.eval("import matplotlib; print(dict.get(matplotlib.rcParams, 'backend'))").output();
    }

    const test_support::TemporaryDirectory directory_;
};

TEST_F(EngineFigureTest, FiguresAreShownWhereTheyAreAndAtTheEnd) {
    EngineSession engine({}, {}, {Capability::WebWindow});
    const auto shown = [&engine](const std::string& code) { return engine.client.eval(code).shown(); };
    const Evaluation first = engine.client.eval(R"(
import matplotlib.pyplot as plt
plt.figure(figsize=(2, 1), dpi=50)
plt.show()
print('between')
plt.figure(figsize=(1, 2), dpi=50).show()
plt.figure(figsize=(3, 1), dpi=50)
print('end')
)");
    EXPECT_EQ(first.errorText(), "");
    std::string all;
    for (const Happening& event : first.events) {
        all += event.text;
    }
    EXPECT_EQ(all,
              "[picture 1: image/png, 100 x 50]\nbetween\n[picture 2: image/png, 50 x 100]\nend\n"
              "[picture 3: image/png, 150 x 50]\n");
    EXPECT_EQ(shown("plt.get_fignums()"), "[]\n");
    EXPECT_EQ(shown("plt.show()"), "");
    // One that is left open when the code fails, and one that cannot be drawn.
    EXPECT_EQ(shown("plt.figure(figsize=(1, 1), dpi=50)\n1/0"), "[picture 4: image/png, 50 x 50]\n");
    const Evaluation broken = engine.client.eval("plt.figure().savefig = None");
    EXPECT_EQ(broken.errorText(), "");
    EXPECT_THAT(warningsOf(broken), ElementsAre("RuntimeWarning: A figure that was left open cannot be shown: "
                                                "TypeError: 'NoneType' object is not callable"));
    EXPECT_EQ(shown("plt.get_fignums()"), "[]\n");
    EXPECT_EQ(engine.client.eval("plt.switch_backend('agg'); plt.figure()").shown(),
              "<Figure size 640x480 with 0 Axes>\n");
}

TEST_F(EngineFigureTest, ShowNamesSavefigWhereNothingCanBeShown) {
    EngineSession engine;
    const Evaluation result = engine.client.eval("import matplotlib.pyplot as plt\nplt.figure()\nplt.show()");
    ASSERT_THAT(warningsOf(result), ElementsAre("RuntimeWarning: show() shows nothing here: the client cannot show "
                                                "pictures; write one to a file with savefig()"));
    EXPECT_EQ(result.shown(), "");
    EXPECT_EQ(engine.client.eval("plt.get_fignums()").shown(), "[1]\n");
}

TEST_F(EngineFigureTest, BackendThatTheUserHasChosenIsKept) {
    {
        EngineSession engine;
        EXPECT_EQ(backendIn(engine), "module://qvm_pictures\n");
        EXPECT_EQ(engine.client.eval("import os; os.environ.get('MPLBACKEND')").shown(), "");
    }
    std::ofstream(directory_.path() + "/matplotlibrc") << "lines.linewidth: 2\n";
    {
        EngineSession engine;
        EXPECT_EQ(backendIn(engine), "module://qvm_pictures\n");
    }
    std::ofstream(directory_.path() + "/matplotlibrc") << "backend: svg\n";
    {
        EngineSession engine;
        EXPECT_EQ(backendIn(engine), "svg\n");
    }
    ::setenv("MPLBACKEND", "agg", 1);
    EngineSession engine;
    ::unsetenv("MPLBACKEND");
    EXPECT_EQ(backendIn(engine), "agg\n");
}

}  // namespace
}  // namespace qvm_test
