// Pictures on terminals that draw them, and on those that do not.

#include <gmock/gmock.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <utility>
#include <vector>

#include "apps/krutil/pseudoterminal/TerminalFixture.hpp"

namespace krutil_client {
namespace {

// What the client asks a terminal, and what terminals answer.
const std::string questions = "\x1b_Gi=31,s=1,v=1,a=q,t=d,f=24;AAAA\x1b\\\x1b]1337;ReportCellSize\x1b\\\x1b[c";
const std::string device = "\x1b[?62;22c";
const std::string kitty = "\x1b_Gi=31;OK\x1b\\";
const std::string iterm = "\x1b]1337;ReportCellSize=17.50;8.00\x1b\\";

// As much of a PNG file as the client looks at, 3 pixels wide, and in base 64.
const std::string png = std::string("\x89PNG\r\n\x1a\n\0\0\0\rIHDR\0\0\0\3\0\0\0\2", 24);
const std::string encoded = "iVBORw0KGgoAAAANSUhEUgAAAAMAAAAC";

class TerminalPictureTest : public TerminalReplTest {
  protected:
    TerminalPictureTest() {
        std::filesystem::create_directory(pictures);
        const std::string module = (directory / "picture.py").string();
        std::ofstream(module) << R"(
class Picture:
    def __init__(self, rest=b''):
        self.rest = rest
    def __repr__(self):
        return 'a picture'
    def _repr_png_(self):
        return b'\x89PNG\r\n\x1a\n\x00\x00\x00\rIHDR\x00\x00\x00\x03\x00\x00\x00\x02' + self.rest
def stop():
    breakpoint()
    print('left')
)";
        // Without a prompt in the middle of what is expected.
        begin();
        evaluate("import sys; sys.path.insert(0, '" + directory.string() + "'); from picture import Picture, stop");
    }

    void begin(const std::vector<std::string>& arguments = {"repl"},
               const std::vector<std::pair<std::string, std::string>>& more = {}) {
        auto variables = environment();
        variables.insert(variables.end(), more.begin(), more.end());
        variables.emplace_back("TMPDIR", pictures.string());
        terminal = std::make_unique<Terminal>(command(arguments), variables);
        expectPrompt();
    }

    // With a program of the test in the place of img2sixel.
    void beginWithSixels(const std::string& script) {
        leave();
        const std::filesystem::path programs = directory / "programs";
        std::filesystem::create_directory(programs);
        std::ofstream(programs / "img2sixel") << "#!/bin/sh\n" << script << "\n";
        std::filesystem::permissions(programs / "img2sixel", std::filesystem::perms::owner_all);
        begin({"repl"}, {{"PATH", programs.string() + ":" + std::getenv("PATH")}});
        evaluate("import sys; sys.path.insert(0, '" + directory.string() + "'); from picture import Picture, stop");
    }

    // Evaluates it, and waits for the terminal to be asked.
    void showFirst(const std::string& code = "Picture()") {
        enter(code);
        terminal->expect("a picture\r\n[picture 1: image/png, 3 x 2]\r\n");
        terminal->expect(questions);
    }

    // The only file; its name has been said.
    void expectFile() {
        std::vector<std::filesystem::path> files_;
        for (const auto& entry : std::filesystem::directory_iterator(pictures)) {
            files_.push_back(entry.path());
        }
        ASSERT_EQ(files_.size(), 1U);
        std::ifstream file(files_.front(), std::ios::binary);
        EXPECT_EQ(std::string(std::istreambuf_iterator<char>(file), {}), png);
        EXPECT_THAT(terminal->sent(), ::testing::HasSubstr("krutil: picture 1 is in " + files_.front().string()));
    }

    bool drewNothing() const {
        return terminal->sent().find("a=T") == std::string::npos && terminal->sent().find("File=") == std::string::npos;
    }

    const std::filesystem::path pictures = directory / "pictures";
};

TEST_F(TerminalPictureTest, KittysProtocolDrawsWhereTheTerminalKnowsIt) {
    showFirst();
    terminal->type(kitty + device);
    terminal->expect("\x1b_Ga=T,f=100,q=2,m=0;" + encoded + "\x1b\\\r\n");
    expectPrompt();
    // It is asked once.
    enter("Picture()");
    terminal->expect("a picture\r\n[picture 2: image/png, 3 x 2]\r\n\x1b_Ga=T,f=100,q=2,m=0;" + encoded + "\x1b\\\r\n");
    expectPrompt();
    // Nobody sees the questions to the engine.
    evaluate(":queue", "Nothing runs, and nothing waits.\r\n");
    leave();
    EXPECT_TRUE(std::filesystem::is_empty(pictures));
}

TEST_F(TerminalPictureTest, LargePictureGoesInPiecesAndFitsTheTerminal) {
    // One more byte than a piece holds.
    terminal->resize(Terminal::columns, Terminal::rows, 2);
    showFirst("Picture(bytes(3049))");
    terminal->type(kitty + device);
    terminal->expect("\x1b_Ga=T,f=100,q=2,c=100,m=1;" + encoded + std::string(4096 - encoded.size(), 'A') +
                     "\x1b\\\x1b_Gq=2,m=0;AA==\x1b\\\r\n");
    expectPrompt();
    leave();
}

TEST_F(TerminalPictureTest, ITermsProtocolDrawsWhereTheTerminalKnowsIt) {
    showFirst();
    terminal->type(iterm + device);
    terminal->expect("\x1b]1337;File=inline=1;size=24:" + encoded + "\a\r\n");
    terminal->resize(Terminal::columns, Terminal::rows, 2);
    enter("Picture()");
    terminal->expect("\x1b]1337;File=inline=1;size=24;width=100%:" + encoded + "\a\r\n");
    expectPrompt();
    leave();
}

TEST_F(TerminalPictureTest, SixelsAreDrawnWhereTheTerminalKnowsThem) {
    beginWithSixels("printf '\\033Pq%s\\033\\\\' \"$*\"");
    showFirst();
    terminal->type("\x1b[?62;4;22c");
    terminal->expect("\x1bPq\x1b\\\r\n");
    expectPrompt();
    terminal->resize(Terminal::columns, Terminal::rows, 2);
    enter("Picture()");
    terminal->expect("\x1bPq-w 2\x1b\\\r\n");
    expectPrompt();
    leave();
    EXPECT_TRUE(std::filesystem::is_empty(pictures));
}

TEST_F(TerminalPictureTest, SixelsThatCannotBeMadeAreAFileInstead) {
    beginWithSixels("printf '\\033Pq~\\033[2J\\033\\\\'");
    showFirst();
    terminal->type("\x1b[?62;22;4c");
    terminal->expect("krutil: picture 1 is in ");
    expectPrompt();
    leave();
    expectFile();
    EXPECT_EQ(terminal->sent().find("\x1bPq"), std::string::npos);
}

TEST_F(TerminalPictureTest, TerminalThatDrawsNothingHasAFileInstead) {
    showFirst();
    terminal->type(device);
    terminal->expect("krutil: picture 1 is in ");
    expectPrompt();
    leave();
    expectFile();
    EXPECT_TRUE(drewNothing());
}

TEST_F(TerminalPictureTest, TerminalThatRefusesItsOwnProtocolHasAFileInstead) {
    showFirst();
    terminal->type("\x1b_Gi=31;ENOTSUPPORTED:no\x1b\\" + device);
    terminal->expect("krutil: picture 1 is in ");
    expectPrompt();
    leave();
    EXPECT_TRUE(drewNothing());
}

TEST_F(TerminalPictureTest, TerminalThatDoesNotAnswerHoldsNothingUp) {
    showFirst();
    terminal->expect("krutil: picture 1 is in ");
    expectPrompt();
    evaluate("6 * 7", "42\r\n");
    leave();
    expectFile();
}

TEST_F(TerminalPictureTest, KeysThatAreTypedMeanwhileAreNotLost) {
    showFirst();
    terminal->type("6 *" + kitty + " 7" + device);
    terminal->expect(encoded + "\x1b\\\r\n");
    terminal->expect("6 * 7");
    terminal->type("\r");
    terminal->expect("42\r\n");
    expectPrompt();
    leave();
}

TEST_F(TerminalPictureTest, TerminalIsNotAskedWhenSomethingWasTypedBefore) {
    // In one write, so that the second line waits when the first one is done.
    terminal->type("Picture()\r6 * 7\r");
    terminal->expect("krutil: picture 1 is in ");
    terminal->expect("42\r\n");
    expectPrompt();
    leave();
    EXPECT_EQ(terminal->sent().find(questions), std::string::npos);
    expectFile();
}

TEST_F(TerminalPictureTest, PictureAtADebugPromptIsShownThere) {
    evaluate("stop()", "Stopped in stop ", "debug> ");
    showFirst();
    terminal->type(kitty + device);
    terminal->expect(encoded + "\x1b\\\r\n");
    terminal->expect("debug> ");
    enter(":c");
    terminal->expect("left\r\n");
    expectPrompt();
    leave();
}

TEST_F(TerminalPictureTest, EvalDrawsToo) {
    terminal = std::make_unique<Terminal>(command({"eval", "import sys; sys.path.insert(0, '" + directory.string() +
                                                               "'); from picture import Picture\n"
                                                               "Picture()"}),
                                          environment());
    terminal->expect(questions);
    terminal->type(kitty + device);
    terminal->expect("\x1b_Ga=T,f=100,q=2,m=0;" + encoded + "\x1b\\\r\n");
    EXPECT_EQ(terminal->exitCode(), 0);
}

}  // namespace
}  // namespace krutil_client
