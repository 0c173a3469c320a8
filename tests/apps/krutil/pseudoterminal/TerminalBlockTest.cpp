// Code of several lines as a person edits it, and the history of it.

#include <string>

#include "apps/krutil/pseudoterminal/TerminalFixture.hpp"

namespace krutil_client {
namespace {

class TerminalBlockTest : public TerminalReplTest {
  protected:
    // With the cursor at the end of a block, which has fewer lines than this erases.
    void leaveBlock() {
        std::string keys;
        for (int i = 0; i < 8; ++i) {
            keys += std::string(eraseToBegin) + backspace;
        }
        leave(keys + "\x04");
    }
};

TEST_F(TerminalBlockTest, PastedLinesAreOnePieceOfCode) {
    begin();
    const std::vector<std::string> block{">>> def f():", "...     a = 41", "...", "...     return a + 1", "... " + at};
    terminal->expectBottom({">>> " + at});
    terminal->type(std::string(pasteBegin) + "def f():\r    a = 41\r\r    return a + 1\r" + pasteEnd);
    terminal->expectBottom(block);
    terminal->type("\r");
    terminal->expectBottom({"...     return a + 1", "...", ">>> " + at});
    terminal->type(std::string(pasteBegin) + "f() +\\\n    1" + pasteEnd);
    terminal->expectBottom({">>> f() +\\", "...     1" + at});
    terminal->type("\r");
    terminal->expectBottom({">>> f() +\\", "...     1", "43", ">>> " + at});
    // Into the last entry, through it, and to the one before.
    terminal->type(std::string(up) + up + up);
    terminal->expectBottom(block);
    leaveBlock();
    begin();
    terminal->type(up);
    terminal->expectBottom({">>> f() +\\", "...     1" + at});
    leaveBlock();
}

TEST_F(TerminalBlockTest, ABlockIsOneEntryAndEditedAsOne) {
    begin();
    evaluate("2 * 21", "42\r\n");
    terminal->type("def f(n):\r");
    terminal->expectBottom({">>> def f(n):", "...     " + at});
    terminal->type("return n\r");
    terminal->expectBottom({"...     return n", "... " + at});
    terminal->type("\r");
    terminal->expectBottom({">>> def f(n):", "...     return n", "...", ">>> " + at});
    evaluate("f(5)", "5\r\n");
    terminal->type(std::string(up) + up);
    terminal->expectBottom({">>> def f(n):", "...     return n", "... " + at});
    terminal->type(up);
    terminal->expectBottom({">>> def f(n):", "... " + at + "    return n", "..."});
    terminal->type(std::string(lineEnd) + " + 1");
    terminal->expectBottom({">>> def f(n):", "...     return n + 1" + at, "..."});
    // In the middle of a block Enter begins a line; at its end it has the block evaluated.
    terminal->type(std::string(up) + lineEnd);
    terminal->expectBottom({">>> def f(n):" + at, "...     return n + 1", "..."});
    terminal->type("\r");
    terminal->expectBottom({">>> def f(n):", "...     " + at, "...     return n + 1", "..."});
    terminal->type("n = 10 * n");
    terminal->expectBottom({">>> def f(n):", "...     n = 10 * n" + at, "...     return n + 1", "..."});
    terminal->type(std::string(down) + down + "\r");
    terminal->expectBottom({"...     return n + 1", "...", ">>> " + at});
    evaluate("f(5)", "51\r\n");
    // The first line of an entry leads to the entry before, and its last one to the entry behind.
    terminal->type(std::string(up) + up + up + up + up);
    terminal->expectBottom({">>> " + at + "def f(n):", "...     n = 10 * n", "...     return n + 1", "..."});
    terminal->type(std::string(up) + down);
    terminal->expectBottom({">>> def f(n):", "...     n = 10 * n", "...     return n + 1", "... " + at});
    leaveBlock();
}

TEST_F(TerminalBlockTest, WhatIsErasedIsOfOneLine) {
    begin();
    terminal->type(std::string(pasteBegin) + "a = 1\rbc = 23\rd = 4" + pasteEnd + up);
    terminal->expectBottom({">>> a = 1", "... bc = " + at + "23", "... d = 4"});
    terminal->type(eraseToEnd);
    terminal->expectBottom({">>> a = 1", "... bc = " + at, "... d = 4"});
    terminal->type(bringBack);
    terminal->expectBottom({">>> a = 1", "... bc = 23" + at, "... d = 4"});
    terminal->type(std::string(left) + eraseToBegin);
    terminal->expectBottom({">>> a = 1", "... " + at + "3", "... d = 4"});
    terminal->type(bringBack);
    terminal->expectBottom({">>> a = 1", "... bc = 2" + at + "3", "... d = 4"});
    // At the begin or the end of a line the newline goes.
    terminal->type(std::string(lineEnd) + eraseToEnd);
    terminal->expectBottom({">>> a = 1", "... bc = 23" + at + "d = 4"});
    terminal->type(std::string(lineBegin) + eraseToBegin);
    terminal->expectBottom({">>> a = 1" + at + "bc = 23d = 4"});
    // Where there is nothing to erase, what was erased last is still there.
    terminal->type(std::string(lineEnd) + eraseToEnd + lineBegin + eraseToBegin + lineEnd + bringBack + "e" +
                   eraseWord);
    terminal->expectBottom({">>> a = 1bc = 23d = 4", "... " + at});
    leaveBlock();
}

TEST_F(TerminalBlockTest, LinesAreIndentedAsTheirBlock) {
    begin();
    terminal->type("def f(a):\r");
    terminal->expectBottom({">>> def f(a):", "...     " + at});
    terminal->type("if a:\r");
    terminal->expectBottom({"...     if a:", "...         " + at});
    terminal->type("b = (\r");
    terminal->expectBottom({"...         b = (", "...             " + at});
    // A statement of several lines is as deep as its first one.
    terminal->type("a)\r");
    terminal->expectBottom({"...             a)", "...         " + at});
    terminal->type("return b\r");
    terminal->expectBottom({"...         return b", "...     " + at});
    terminal->type("for c in ():\r");
    terminal->expectBottom({"...     for c in ():", "...         " + at});
    terminal->type("if c:\r");
    terminal->expectBottom({"...         if c:", "...             " + at});
    terminal->type("c = 0\r");
    terminal->expectBottom({"...             c = 0", "...             " + at});
    // One step back for each.
    terminal->type(std::string(backspace) + backspace + "return 0\r");
    terminal->expectBottom({"...     return 0", "... " + at});
    terminal->type("\r");
    expectPrompt();
    evaluate("f(3), f(0)", "(3, 0)\r\n");
    // A string is left as it is typed.
    terminal->type("'''a:\r");
    terminal->expectBottom({">>> '''a:", "... " + at});
    terminal->type("b'''\r");
    terminal->expectBottom({">>> '''a:", "... b'''", "'a:\\nb'", ">>> " + at});
    leave();
}

TEST_F(TerminalBlockTest, TabIndents) {
    begin();
    terminal->type("if True:\r");
    terminal->expectBottom({">>> if True:", "...     " + at});
    terminal->type(std::string(backspace) + " \tif True:\r");
    terminal->expectBottom({"...     if True:", "...         " + at});
    terminal->type("\tprint(6 * 7)");
    terminal->expectBottom({"...     if True:", "...             print(6 * 7)" + at});
    terminal->type("\r\r");
    terminal->expectBottom({"...", "42", ">>> " + at});
    leave();
}

TEST_F(TerminalBlockTest, TheHistoryIsSearched) {
    begin();
    evaluate("'first ' + 'line'", "'first line'\r\n");
    evaluate("'second ' + 'line'", "'second line'\r\n");
    terminal->type(searchKey + std::string("line"));
    terminal->expectBottom({"search: line >>> 'second ' + '" + at + "line'"});
    terminal->type(searchKey);
    terminal->expectBottom({"search: line >>> 'first ' + '" + at + "line'"});
    terminal->type(searchKey);
    terminal->expectBottom({"not found: line >>> 'first ' + '" + at + "line'"});
    terminal->type(backspace);
    terminal->expectBottom({"search: lin >>> 'second ' + '" + at + "line'"});
    terminal->type("\x07");
    terminal->expectBottom({">>> " + at});
    terminal->type(searchKey + std::string("fir") + right + "--");
    terminal->expectBottom({">>> 'f--" + at + "irst ' + 'line'"});
    terminal->type(std::string("\x15") + searchKey + "fir\r");
    terminal->expect("'first line'\r\n");
    expectPrompt();
    leave();
}

TEST_F(TerminalBlockTest, CodeIsColouredWhereColoursAreWanted) {
    terminal = std::make_unique<Terminal>(command({"repl"}), environment(""));
    expectPrompt();
    terminal->type("None if f(1) else 'a'");
    terminal->expect(
        "\x1b[0;35mNone\x1b[0m \x1b[0;35mif\x1b[0m f(\x1b[0;36m1\x1b[0m) \x1b[0;35melse\x1b[0m \x1b[0;32m'a'");
    terminal->type(std::string(lineBegin) + "(0)");
    terminal->expect("\x1b[0;1;4m(\x1b[0;36m0\x1b[0;1;4m)\x1b[0;35mNone");
    terminal->expectBottom({">>> (0)" + at + "None if f(1) else 'a'"});
    leave("\x05\x15\x04");
    begin();
    terminal->type("None if f(1) else 'a'");
    terminal->expectBottom({">>> None if f(1) else 'a'" + at});
    EXPECT_EQ(terminal->sent().find("\x1b[0"), std::string::npos);
    leave("\x15\x04");
}

}  // namespace
}  // namespace krutil_client
