// The history that programs share.

#include "krutil/terminal/LineHistory.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <clocale>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "krutil/base/Text.hpp"
#include "support/AnotherUser.hpp"
#include "support/Pipe.hpp"
#include "support/TemporaryDirectory.hpp"

namespace krutil_client {
namespace {

using test_support::AnotherUser;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::SizeIs;

class LineHistoryTest : public ::testing::Test {
  protected:
    LineHistoryTest() { std::setlocale(LC_CTYPE, "C.UTF-8"); }

    // As two programs do it: the library of the editor is for one thread of a process.
    template <class Action>
    static pid_t inAnotherProcess(const Action& action) {
        const pid_t child = ::fork();
        if (child == 0) {
            action();
            ::_exit(0);
        }
        return child;
    }

    static int exitStatusOf(pid_t child) {
        int status = 0;
        return ::waitpid(child, &status, 0) == child && WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    }

    // The newest one first.
    static std::vector<std::string> linesOf(const LineHistory& history) {
        std::vector<std::string> lines;
        HistEventW event{};
        for (int more = ::history_w(history.get(), &event, H_FIRST); more >= 0;
             more = ::history_w(history.get(), &event, H_NEXT)) {
            lines.push_back(toUtf8(event.str));
        }
        return lines;
    }

    std::vector<std::string> linesInFile() const { return linesOf(LineHistory(file)); }

    static unsigned modeOf(const std::string& path) {
        struct stat status {};
        return ::lstat(path.c_str(), &status) == 0 ? status.st_mode & 0777U : 0;
    }

    test_support::TemporaryDirectory directory;
    const std::string file = directory.file("state/history");
};

TEST_F(LineHistoryTest, LinesAreKeptAsTheyAre) {
    {
        LineHistory history(file);
        history.add(L"x = '\u00e4 \U0001f600'  # \\n\n");
        history.add(L"def f():\n    return 1\n\n");
        EXPECT_THAT(linesOf(history), ElementsAre("def f():\n    return 1\n\n", "x = '\u00e4 \U0001f600'  # \\n\n"));
    }
    EXPECT_THAT(linesInFile(), ElementsAre("def f():\n    return 1\n\n", "x = '\u00e4 \U0001f600'  # \\n\n"));
}

TEST_F(LineHistoryTest, ALineIsInTheFileAtOnce) {
    LineHistory history(file);
    history.add(L"1\n");
    EXPECT_THAT(linesInFile(), ElementsAre("1\n"));
}

TEST_F(LineHistoryTest, TwoAtOnceLoseNoLineOfEachOther) {
    constexpr int count = 200;
    const auto write = [this](const wchar_t* name) {
        LineHistory history(file);
        for (int i = 0; i < count; ++i) {
            history.add((name + std::to_wstring(i) + L"\n").c_str());
        }
    };
    const pid_t first = inAnotherProcess([&] { write(L"first "); });
    const pid_t second = inAnotherProcess([&] { write(L"second "); });
    EXPECT_EQ(exitStatusOf(first), 0);
    EXPECT_EQ(exitStatusOf(second), 0);
    const auto lines = linesInFile();
    EXPECT_THAT(lines, SizeIs(2 * count));
    // Each one's own lines in order, whatever the other one did.
    for (const std::string name : {"first ", "second "}) {
        int next = count;
        for (const auto& line : lines) {
            if (line.rfind(name, 0) == 0) {
                EXPECT_EQ(line, name + std::to_string(--next) + "\n");
            }
        }
        EXPECT_EQ(next, 0);
    }
}

TEST_F(LineHistoryTest, TheFileIsCutToTheNewestLines) {
    {
        LineHistory history(file);
        for (int i = 0; i < LineHistory::lines + 10; ++i) {
            history.add((std::to_wstring(i) + L"\n").c_str());
        }
    }
    const auto sizeBefore = std::filesystem::file_size(file);
    const auto lines = linesInFile();
    ASSERT_THAT(lines, SizeIs(LineHistory::lines));
    EXPECT_EQ(lines.front(), std::to_string(LineHistory::lines + 9) + "\n");
    EXPECT_EQ(lines.back(), "10\n");
    EXPECT_LT(std::filesystem::file_size(file), sizeBefore);
    EXPECT_EQ(modeOf(file), 0600U);
    EXPECT_EQ(std::distance(std::filesystem::directory_iterator(std::filesystem::path(file).parent_path()), {}), 1);
}

TEST_F(LineHistoryTest, CuttingLosesNoLineThatAnotherAddsMeanwhile) {
    LineHistory other(file);
    for (int i = 0; i < LineHistory::lines; ++i) {
        other.add((L"before " + std::to_wstring(i) + L"\n").c_str());
    }
    constexpr int count = 300;
    test_support::Pipe done;
    const pid_t cutting = inAnotherProcess([&] {
        done.write.reset();
        // Readable, because at its end, once the test closes its own side.
        pollfd watched{done.read.get(), POLLIN, 0};
        while (::poll(&watched, 1, 0) == 0) {
            const LineHistory cut(file);
        }
    });
    for (int i = 0; i < count; ++i) {
        other.add((L"meanwhile " + std::to_wstring(i) + L"\n").c_str());
    }
    done.write.reset();
    EXPECT_EQ(exitStatusOf(cutting), 0);
    auto lines = linesInFile();
    ASSERT_THAT(lines, SizeIs(LineHistory::lines));
    lines.resize(count);
    std::vector<std::string> wanted;
    for (int i = count; i > 0; --i) {
        wanted.push_back("meanwhile " + std::to_string(i - 1) + "\n");
    }
    EXPECT_EQ(lines, wanted);
}

TEST_F(LineHistoryTest, TheFileIsForItsOwnerOnly) {
    LineHistory history(file);
    EXPECT_FALSE(std::filesystem::exists(file));
    history.add(L"1\n");
    EXPECT_EQ(modeOf(file), 0600U);
    std::filesystem::permissions(file, std::filesystem::perms(0644));
    history.add(L"2\n");
    EXPECT_EQ(modeOf(file), 0600U);
}

TEST_F(LineHistoryTest, AFileThatMayBeAnotherUsersIsRefused) {
    const std::string precious = directory.file("precious");
    LineHistory(file).add(L"before\n");
    std::filesystem::create_hard_link(file, precious);
    {
        LineHistory history(file);
        EXPECT_EQ(history.refusal(),
                  "the history '" + file + "' is not used: the file has 2 names; move it away, or use --no-history");
        EXPECT_THAT(linesOf(history), IsEmpty());
        history.add(L"1\n");
        EXPECT_THAT(linesOf(history), ElementsAre("1\n"));
    }
    std::filesystem::remove(precious);
    EXPECT_THAT(linesInFile(), ElementsAre("before\n"));
    EXPECT_EQ(LineHistory(file).refusal(), "");
}

TEST_F(LineHistoryTest, AFileOfAnotherUserIsRefused) {
    if (!AnotherUser::isPossible()) {
        GTEST_SKIP() << "needs a file of another user";
    }
    LineHistory(file).add(L"a trap\n");
    std::filesystem::permissions(file, std::filesystem::perms(0666));
    ASSERT_EQ(::chown(file.c_str(), AnotherUser::number, AnotherUser::number), 0);
    LineHistory history(file);
    EXPECT_EQ(history.refusal(),
              "the history '" + file + "' is not used: it belongs to user 65534; move it away, or use --no-history");
    EXPECT_THAT(linesOf(history), IsEmpty());
    const auto size = std::filesystem::file_size(file);
    history.add(L"1\n");
    EXPECT_EQ(std::filesystem::file_size(file), size);
    EXPECT_EQ(modeOf(file), 0666U);
}

TEST_F(LineHistoryTest, WithoutAFileLinesAreRememberedOnly) {
    LineHistory history{std::string()};
    history.add(L"1\n");
    EXPECT_THAT(linesOf(history), ElementsAre("1\n"));
}

TEST_F(LineHistoryTest, WhatCannotBeAHistoryIsLeftAlone) {
    const std::string target = directory.file("target");
    std::ofstream(target) << "precious\n";
    std::filesystem::create_directories(std::filesystem::path(file).parent_path());
    std::filesystem::create_symlink(target, file);
    {
        LineHistory history(file);
        history.add(L"1\n");
        EXPECT_THAT(linesOf(history), ElementsAre("1\n"));
        EXPECT_EQ(history.refusal(),
                  "the history '" + file + "' is not used: it is no regular file; move it away, or use --no-history");
    }
    EXPECT_EQ(std::filesystem::file_size(target), 9U);
    LineHistory(directory.file("")).add(L"1\n");
    LineHistory("/dev/null/history").add(L"1\n");
    EXPECT_EQ(LineHistory("/dev/null/history").refusal(), "");
}

}  // namespace
}  // namespace krutil_client
