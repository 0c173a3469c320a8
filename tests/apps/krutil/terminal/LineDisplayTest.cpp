// What is written to a terminal for a line that is being edited, and what a terminal makes of it.

#include "krutil/terminal/LineDisplay.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <clocale>
#include <random>
#include <string>

#include "apps/krutil/pseudoterminal/Screen.hpp"

namespace krutil_client {
namespace {

using ::testing::ElementsAre;

const std::string at = Screen::cursor;
const std::string escape = "\x1b[";

class LineDisplayTest : public ::testing::Test {
  protected:
    LineDisplayTest() { std::setlocale(LC_CTYPE, "C.UTF-8"); }

    std::string show(const std::wstring& text, std::size_t cursor) {
        const std::string bytes = display.show({L"> ", text, cursor}, size);
        screen.show(bytes);
        return bytes;
    }

    TerminalSize size{10, 4, 0};
    LineDisplay display;
    Screen screen{10, 4};
};

TEST_F(LineDisplayTest, WhatIsTypedAtTheEndIsAllThatIsWritten) {
    EXPECT_EQ(display.begin(L"", size), "");
    EXPECT_EQ(show(L"", 0), "> ");
    EXPECT_EQ(show(L"a", 1), "a");
    EXPECT_EQ(show(L"ab", 2), "b");
    EXPECT_EQ(show(L"ab", 2), "");
    EXPECT_EQ(show(L"ab", 1), "\r" + escape + "3C");
    EXPECT_EQ(show(L"axb", 2), "\r> axb" + escape + "J\r" + escape + "4C");
    EXPECT_THAT(screen.lines(), ElementsAre("> ax" + at + "b"));
}

TEST_F(LineDisplayTest, ThePromptFollowsOnWhatWasWrittenBefore) {
    screen.show("seen");
    screen.show(display.begin(L"seen", size));
    screen.show(display.show({L"seen> ", L"x", 1}, size));
    EXPECT_THAT(screen.lines(), ElementsAre("seen> x" + at));
    screen.show(display.show({L"seen"}, size));
    EXPECT_THAT(screen.lines(), ElementsAre("seen" + at));
}

TEST_F(LineDisplayTest, AFullRowBeforeThePromptIsLeft) {
    screen.show("0123456789");
    screen.show(display.begin(L"0123456789", size));
    EXPECT_THAT(screen.lines(), ElementsAre("0123456789", at));
    screen.show(display.show({L"0123456789> ", L"x", 1}, size));
    EXPECT_THAT(screen.lines(), ElementsAre("0123456789", "> x" + at));
}

TEST_F(LineDisplayTest, ColoursOfThePromptTakeNoRoom) {
    EXPECT_EQ(display.begin(L"", size), "");
    screen.show(display.show({L"\x1b[31mred\x1b[0m> ", L"12345", 5}, size));
    EXPECT_THAT(screen.lines(), ElementsAre("red> 12345", at));
}

TEST_F(LineDisplayTest, EachRowHasItsStylesToItself) {
    display.begin(L"", size);
    std::vector<Style> styles(12, Style::Literal);
    styles[0] = Style::Keyword;
    styles[11] = Style::Plain;
    EXPECT_EQ(display.show({L"> ", L"abcdefgh\nijk", 12, styles, L". "}, size),
              "> \x1b[0;35ma\x1b[0;32mbcdefgh\x1b[0m\r\n. \x1b[0;32mij\x1b[0mk");
    // A row that wraps.
    EXPECT_EQ(display.show({L"> ", L"0123456789", 10, std::vector<Style>(10, Style::Number)}, size),
              "\x1b[1A\r> \x1b[0;36m01234567\x1b[0m\x1b[0;36m89\x1b[0m\x1b[J");
}

TEST_F(LineDisplayTest, ControlCharactersAreShownAsTheirKeys) {
    display.begin(L"", size);
    show(L"\x01\x7f\t.\u0085", 5);
    EXPECT_THAT(screen.lines(), ElementsAre("> ^A^?  .\uFFFD", at));
}

TEST_F(LineDisplayTest, ALongerLineThanTheTerminalIsShownAroundTheCursor) {
    display.begin(L"", size);
    std::wstring text;
    for (int i = 0; i < 60; ++i) {
        text += static_cast<wchar_t>(L'0' + i % 10);
    }
    show(text, text.size());
    auto lines = screen.lines();
    lines.erase(lines.begin(), lines.end() - 4);
    EXPECT_THAT(lines, ElementsAre("8901234567", "8901234567", "8901234567", "89" + at));
    show(text, 0);
    lines = screen.lines();
    lines.erase(lines.begin(), lines.end() - 4);
    EXPECT_THAT(lines, ElementsAre("> " + at + "01234567", "8901234567", "8901234567", "8901234567"));
}

TEST_F(LineDisplayTest, OnlyTextWhoseEndIsKnownIsMeasured) {
    EXPECT_TRUE(LineDisplay::measures(L""));
    EXPECT_TRUE(LineDisplay::measures(L"a\t\u4e2de\u0301\x1b[1;31mred\x1b[m"));
    EXPECT_FALSE(LineDisplay::measures(L"50%\r60%"));
    EXPECT_FALSE(LineDisplay::measures(L"a\b"));
    EXPECT_FALSE(LineDisplay::measures(L"\x1b[2A"));
    EXPECT_FALSE(LineDisplay::measures(L"\x1b[31"));
    EXPECT_FALSE(LineDisplay::measures(std::wstring(1, L'\0')));
}

// Whatever is shown after whatever: the terminal shows what one that has room for all of it is shown at first.
TEST_F(LineDisplayTest, EveryChangeEndsInAPartOfTheWholePicture) {
    std::mt19937 random(1);
    const auto below = [&random](std::size_t bound) { return random() % bound; };
    const std::vector<std::wstring> pieces{L"a",    L"b",  L"\u4e2d", L"\U0001f600", L"e\u0301",
                                           L"\x01", L"\t", L"\n",     L"0123456789"};
    for (int round = 0; round < 300; ++round) {
        size = {2 + below(12), 1 + below(6)};
        display = LineDisplay();
        screen = Screen(size.columns, size.rows);
        screen.show(display.begin(L"", size));
        std::wstring text;
        for (int step = 0; step < 20; ++step) {
            if (below(3) != 0) {
                text.insert(below(text.size() + 1), pieces[below(pieces.size())]);
            } else {
                text.erase(below(text.size() + 1), below(5));
            }
            // Marks without a width are no place for a cursor.
            std::size_t cursor = below(text.size() + 1);
            while (cursor < text.size() && text[cursor] == L'\u0301') {
                ++cursor;
            }
            show(text, cursor);
            LineDisplay fresh;
            Screen all(size.columns, 1000);
            all.show(fresh.begin(L"", {size.columns, 1000}));
            all.show(fresh.show({L"> ", text, cursor}, {size.columns, 1000}));
            const auto wanted = all.visibleLines();
            const auto shown = screen.visibleLines();
            const auto found = std::search(wanted.begin(), wanted.end(), shown.begin(), shown.end());
            ASSERT_NE(found, wanted.end())
                << "round " << round << ", step " << step << ", " << size.columns << " columns, shown:\n"
                << ::testing::PrintToString(shown);
            EXPECT_TRUE(std::any_of(shown.begin(), shown.end(),
                                    [](const auto& line) { return line.find(at) != std::string::npos; }));
        }
    }
}

TEST_F(LineDisplayTest, ATerminalOfAnotherSizeIsFilledAnew) {
    screen.show("above\r\n");
    display.begin(L"", size);
    show(L"0123456789abcdef", 12);
    EXPECT_THAT(screen.lines(), ElementsAre("above", "> 01234567", "89ab" + at + "cdef"));
    for (const std::size_t columns : {7U, 20U, 5U, 10U}) {
        size = {columns, 6};
        screen.resize(columns, 6);
        show(L"0123456789abcdef", 12);
        Screen expected(columns, 6);
        expected.show("above\r\n> 0123456789abcdef");
        std::string all;
        for (const auto& line : screen.lines()) {
            all += line;
        }
        EXPECT_EQ(all, "above> 0123456789ab" + at + "cdef") << columns << " columns";
        EXPECT_EQ(screen.lines().size(), expected.lines().size()) << columns << " columns";
    }
}

}  // namespace
}  // namespace krutil_client
