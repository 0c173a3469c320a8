// Pictures that code shows, in the hands of who runs the client: files, and what is said about them.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <nlohmann/json.hpp>
#include <sstream>
#include <string>
#include <vector>

#include "programs/support/Program.hpp"
#include "support/TemporaryDirectory.hpp"

namespace programs_test {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::MatchesRegex;
using ::testing::Not;
using ::testing::StartsWith;

// As much of a PNG file as the programs look at.
const std::string png = std::string("\x89PNG\r\n\x1a\n\0\0\0\rIHDR\0\0\0\3\0\0\0\2", 24);

// Values with forms of their own.
const std::string forms = R"(
def png(): return b'\x89PNG\r\n\x1a\n\x00\x00\x00\rIHDR\x00\x00\x00\x03\x00\x00\x00\x02'
def forms(**methods):
    return type('Formed', (), {'__repr__': lambda self: 'formed',
                               **{name: (lambda self, made=made: made) for name, made in methods.items()}})()
)";

std::string contentOf(const std::filesystem::path& path) {
    std::ifstream file(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(file), {}};
}

class PictureTest : public ::testing::Test {
  protected:
    Ran eval(const std::string& code, std::vector<std::string> options = {}) {
        options.insert(options.begin(), "eval");
        options.push_back(forms + code);
        return runClient(options, {.environment = {"TMPDIR=" + files_.path(), "MPLCONFIGDIR=" + others_.path(),
                                                   "MPLBACKEND=", "MATPLOTLIBRC="}});
    }

    // What has been written, by name.
    std::vector<std::filesystem::path> written() const {
        std::vector<std::filesystem::path> paths;
        for (const auto& entry : std::filesystem::directory_iterator(files_.path())) {
            paths.push_back(entry.path());
        }
        std::sort(paths.begin(), paths.end(),
                  [](const auto& a, const auto& b) { return a.extension() < b.extension(); });
        return paths;
    }

    const test_support::TemporaryDirectory files_;
    const test_support::TemporaryDirectory others_;
};

TEST_F(PictureTest, PictureIsWrittenToAFileThatStandardErrorNames) {
    const Ran ran = eval("print('before')\nforms(_repr_png_=png(), _repr_html_='<b>', _repr_svg_='<svg/>')");
    EXPECT_EQ(ran.exitCode, 0);
    EXPECT_EQ(ran.out, "before\nformed\n[picture 1: image/png, image/svg+xml, text/html, 3 x 2]\n");
    ASSERT_EQ(written().size(), 1U);
    const std::filesystem::path file = written().front();
    EXPECT_EQ(ran.err, "krutil: picture 1 is in " + file.string() + "\n");
    EXPECT_THAT(file.filename().string(), MatchesRegex("krutil-picture-[A-Za-z0-9]{6}\\.png"));
    EXPECT_EQ(contentOf(file), png);
    struct stat status {};
    ASSERT_EQ(::stat(file.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777U, 0600U);
}

TEST_F(PictureTest, DrawingIsWrittenAndAPageIsLeftToPrograms) {
    const Ran drawing = eval("forms(_repr_svg_='<svg>\\u00e4</svg>')");
    EXPECT_EQ(drawing.out, "formed\n[picture 1: image/svg+xml]\n");
    ASSERT_EQ(written().size(), 1U);
    EXPECT_EQ(written().front().extension(), ".svg");
    EXPECT_EQ(contentOf(written().front()), "<svg>\u00e4</svg>");
    const Ran page = eval("forms(_repr_html_='<b>')");
    EXPECT_EQ(page.out, "formed\n");
    EXPECT_EQ(page.err, "");
    EXPECT_EQ(written().size(), 1U);
}

TEST_F(PictureTest, JsonHasEveryFormAndNothingOfTheQuestionForThem) {
    const Ran ran = eval("forms(_repr_png_=png(), _repr_html_='<b>')", {"--json"});
    EXPECT_EQ(ran.err, "");
    std::vector<std::string> events;
    std::vector<nlohmann::json> pictures;
    std::istringstream lines(ran.out);
    for (std::string line; std::getline(lines, line);) {
        const auto object = nlohmann::json::parse(line);
        events.push_back(object.at("event"));
        if (events.back() == "picture") {
            pictures.push_back(object);
        }
    }
    EXPECT_THAT(events, ElementsAre("connected", "started", "value", "value", "completed", "last", "reply", "picture",
                                    "picture", "shutdown"));
    ASSERT_EQ(written().size(), 2U);
    const auto page = written()[0];
    const auto image = written()[1];
    EXPECT_EQ(contentOf(page), "<b>");
    EXPECT_EQ(contentOf(image), png);
    EXPECT_THAT(
        pictures,
        ElementsAre(
            nlohmann::json({{"event", "picture"},
                            {"number", 1},
                            {"type", "image/png"},
                            {"width", 3},
                            {"height", 2},
                            {"file", image.string()}}),
            nlohmann::json({{"event", "picture"}, {"number", 1}, {"type", "text/html"}, {"file", page.string()}})));
}

TEST_F(PictureTest, NothingIsAskedAfterARequestWithoutPictures) {
    const std::string trace = others_.file("trace");
    // What code prints is never taken for the engine's line.
    const Ran ran = eval("print('[picture 1: image/png, 3 x 2]')\n6 * 7", {"--trace-to", trace});
    EXPECT_EQ(ran.out, "[picture 1: image/png, 3 x 2]\n42\n");
    EXPECT_THAT(contentOf(trace), Not(HasSubstr("FEvalIIP")));
    eval("forms(_repr_png_=png())", {"--trace-to", trace});
    EXPECT_THAT(contentOf(trace), HasSubstr("FEvalIIP"));
}

TEST_F(PictureTest, LineOfAPictureThatIsNotThereHarmsNothing) {
    const Ran ran = eval("class Liar:\n  def __repr__(self): return '[picture 7: image/png, 3 x 2]'\nLiar()");
    EXPECT_EQ(ran.exitCode, 0);
    EXPECT_EQ(ran.out, "[picture 7: image/png, 3 x 2]\n");
    EXPECT_EQ(ran.err, "");
    EXPECT_THAT(written(), IsEmpty());
}

TEST_F(PictureTest, PicturesOfACallAreShownToo) {
    std::ofstream(others_.file("plots.py")) << forms << R"(
import sys
def plot():
    sys.displayhook(forms(_repr_png_=png()))
)";
    const Ran ran = runClient({"call", "--nout", "0", "plots.plot"},
                              {.environment = {"TMPDIR=" + files_.path(), "PYTHONPATH=" + others_.path()}});
    EXPECT_EQ(ran.exitCode, 0);
    EXPECT_EQ(ran.out, "formed\n[picture 1: image/png, 3 x 2]\n");
    ASSERT_EQ(written().size(), 1U);
    EXPECT_EQ(ran.err, "krutil: picture 1 is in " + written().front().string() + "\n");
}

TEST_F(PictureTest, PictureThatCannotBeWrittenIsSaidAndHarmsNothing) {
    const std::string nowhere = files_.file("nowhere");
    const Ran ran =
        runClient({"eval", forms + "print('code')\nforms(_repr_png_=png())"}, {.environment = {"TMPDIR=" + nowhere}});
    EXPECT_EQ(ran.exitCode, 0);
    EXPECT_EQ(ran.out, "code\nformed\n[picture 1: image/png, 3 x 2]\n");
    EXPECT_THAT(ran.err, StartsWith("krutil: pictures cannot be shown: "));
    EXPECT_THAT(ran.err, HasSubstr("No such file or directory"));
}

// The engine's answer is replaced by code, and the client asks because of a line.
TEST_F(PictureTest, AnswersThatAreNoneAreSaidAndHarmNothing) {
    const auto answered = [this](const std::string& answer) {
        const Ran ran = eval("import qvm, numpy\nqvm.take_displays = lambda: " + answer +
                             "\nclass Liar:\n  def __repr__(self): return '[picture 7: image/png, 3 x 2]'\nLiar()");
        EXPECT_EQ(ran.exitCode, 0);
        EXPECT_EQ(ran.out, "[picture 7: image/png, 3 x 2]\n");
        EXPECT_THAT(written(), IsEmpty());
        return ran.err;
    };
    const std::string cannot = "krutil: pictures cannot be shown: ";
    EXPECT_EQ(answered("1 / 0"), cannot + "the engine cannot hand them over\n");
    EXPECT_EQ(answered("('[]',)"), cannot + "the engine cannot hand them over\n");
    EXPECT_EQ(answered("(1.5, '')"), cannot + "expected a text and an array of bytes\n");
    EXPECT_EQ(answered("('[]', [1.5, 2.5])"), cannot + "expected a text and an array of bytes\n");
    EXPECT_THAT(answered("('[', '')"), StartsWith(cannot + "their description cannot be read: "));
    EXPECT_THAT(answered("('[{}]', '')"), StartsWith(cannot + "their description cannot be read: "));
    EXPECT_THAT(answered("('7', '')"), StartsWith(cannot + "their description cannot be read: "));
    const std::string described = R"('[{"number":1,"formats":[{"type":"image/png","bytes":24}]}]')";
    EXPECT_EQ(answered("(" + described + ", '')"), cannot + "expected 24 bytes of a picture, got 0\n");
    EXPECT_EQ(answered("(" + described + ", numpy.zeros(24, numpy.uint8))"),
              cannot + "expected a PNG picture, got other bytes\n");
    EXPECT_EQ(answered(R"(('[' + ','.join(['{"number":1,"formats":[]}'] * 1001) + ']', ''))"),
              cannot + "expected at most 1000, got more\n");
    EXPECT_EQ(answered(R"(('[{"number":1,"formats":[{"type":"image/jxl","bytes":5}]}]', ''))"), "");
}

TEST_F(PictureTest, FigureOfMatplotlibIsAFileOfItsSize) {
    const Ran ran = eval(
        "import matplotlib.pyplot as plt\nplt.figure(figsize=(3, 2), dpi=50)\nplt.plot([1, 4, 9])\nplt.show()\n"
        "print('after')");
    EXPECT_EQ(ran.out, "[picture 1: image/png, 150 x 100]\nafter\n");
    ASSERT_EQ(written().size(), 1U) << ran.err;
    EXPECT_THAT(ran.err, HasSubstr("krutil: picture 1 is in " + written().front().string() + "\n"));
    const std::string content = contentOf(written().front());
    EXPECT_THAT(content.substr(0, 24), std::string("\x89PNG\r\n\x1a\n\0\0\0\rIHDR\0\0\0\x96\0\0\0\x64", 24));
    EXPECT_EQ(content.substr(content.size() - 8, 4), "IEND");
}

}  // namespace
}  // namespace programs_test
