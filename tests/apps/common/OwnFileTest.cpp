// Who may say where text of a session goes, and who may read it.
#include "common/OwnFile.hpp"

#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <stdexcept>
#include <string>

#include "support/AnotherUser.hpp"
#include "support/TemporaryDirectory.hpp"

namespace apps {
namespace {

using test_support::AnotherUser;

class OwnFileTest : public ::testing::Test {
  protected:
    void write(const std::string& path) const { std::ofstream(path) << "there\n"; }

    std::string content(const std::string& path) const {
        std::ifstream in(path);
        return {std::istreambuf_iterator<char>(in), {}};
    }

    mode_t mode() const {
        struct stat status {};
        EXPECT_EQ(::stat(file_.c_str(), &status), 0);
        return status.st_mode & 07777U;
    }

    // What is said about the file.
    std::string refusal() const {
        std::string said;
        for (const Begin begin : {Begin::Empty, Begin::AtEnd}) {
            try {
                openOwnFile(file_, begin, "cannot");
                return "none";
            } catch (const std::runtime_error& error) {
                EXPECT_TRUE(said.empty() || said == error.what()) << error.what();
                said = error.what();
            }
        }
        return said;
    }

    const test_support::TemporaryDirectory directory_;
    const std::string file_ = directory_.file("file");
    const std::string other_ = directory_.file("other");
};

TEST_F(OwnFileTest, ANewOneIsForThisUserAloneWhateverTheMask) {
    const mode_t before = ::umask(0);
    const OwnFile made = openOwnFile(file_, Begin::AtEnd, "cannot");
    ::umask(before);
    EXPECT_TRUE(made.regular);
    EXPECT_EQ(mode(), 0600U);
}

TEST_F(OwnFileTest, OneThatIsEmptiedLosesItsReaders) {
    write(file_);
    ::chmod(file_.c_str(), 0644);
    openOwnFile(file_, Begin::Empty, "cannot");
    EXPECT_EQ(content(file_), "");
    EXPECT_EQ(mode(), 0600U);
}

TEST_F(OwnFileTest, OneThatIsGoneOnWithKeepsItsReaders) {
    write(file_);
    ::chmod(file_.c_str(), 0640);
    const OwnFile file = openOwnFile(file_, Begin::AtEnd, "cannot");
    EXPECT_EQ(::write(file.descriptor.get(), "more\n", 5), 5);
    EXPECT_EQ(content(file_), "there\nmore\n");
    EXPECT_EQ(mode(), 0640U);
}

TEST_F(OwnFileTest, DevicesAreAnybodys) {
    EXPECT_FALSE(openOwnFile("/dev/null", Begin::Empty, "cannot").regular);
}

TEST_F(OwnFileTest, LinksOfThisUserAreFollowed) {
    write(other_);
    std::filesystem::create_symlink(other_, file_);
    const OwnFile file = openOwnFile(file_, Begin::AtEnd, "cannot");
    EXPECT_EQ(::write(file.descriptor.get(), "more\n", 5), 5);
    EXPECT_EQ(content(other_), "there\nmore\n");
}

TEST_F(OwnFileTest, SeveralNamesAreRefused) {
    write(other_);
    std::filesystem::create_hard_link(other_, file_);
    EXPECT_EQ(refusal(), "cannot: the file has 2 names; name a file of your own");
    EXPECT_EQ(content(other_), "there\n");
}

TEST_F(OwnFileTest, ALinkToSeveralNamesIsRefused) {
    write(other_);
    std::filesystem::create_hard_link(other_, directory_.file("again"));
    std::filesystem::create_symlink(other_, file_);
    EXPECT_EQ(refusal(), "cannot: the file has 2 names; name a file of your own");
    EXPECT_EQ(content(other_), "there\n");
}

TEST_F(OwnFileTest, WhatCannotBeOpenedSaysWhy) {
    std::filesystem::create_directory(file_);
    EXPECT_EQ(refusal(), "cannot: Is a directory");
}

// What another user has put there before.
class ForeignFileTest : public OwnFileTest {
  protected:
    void SetUp() override {
        if (!AnotherUser::isPossible()) {
            GTEST_SKIP() << "needs a file of another user";
        }
        ::chmod(directory_.path().c_str(), 0777);
    }
};

TEST_F(ForeignFileTest, IsRefused) {
    write(file_);
    ::chmod(file_.c_str(), 0666);
    ASSERT_EQ(::chown(file_.c_str(), AnotherUser::number, AnotherUser::number), 0);
    EXPECT_EQ(refusal(), "cannot: it belongs to user 65534; name a file of your own");
    EXPECT_EQ(content(file_), "there\n");
    EXPECT_EQ(mode(), 0666U);
}

// Nobody reads from it, so that to open it would take for ever.
TEST_F(ForeignFileTest, APipeIsRefusedBeforeItIsOpened) {
    ASSERT_EQ(::mkfifo(file_.c_str(), 0666), 0);
    ASSERT_EQ(::chown(file_.c_str(), AnotherUser::number, AnotherUser::number), 0);
    EXPECT_EQ(refusal(), "cannot: it belongs to user 65534; name a file of your own");
}

TEST_F(ForeignFileTest, ALinkIsRefusedThoughTheFileIsThisUsers) {
    write(other_);
    {
        const AnotherUser nobody;
        ASSERT_EQ(::symlink(other_.c_str(), file_.c_str()), 0);
    }
    EXPECT_EQ(refusal(), "cannot: it is a symbolic link that belongs to user 65534; name a file of your own");
    EXPECT_EQ(content(other_), "there\n");
}

TEST_F(ForeignFileTest, ALinkToItIsRefused) {
    write(other_);
    ASSERT_EQ(::chown(other_.c_str(), AnotherUser::number, AnotherUser::number), 0);
    ASSERT_EQ(::symlink(other_.c_str(), file_.c_str()), 0);
    EXPECT_EQ(refusal(), "cannot: it belongs to user 65534; name a file of your own");
    EXPECT_EQ(content(other_), "there\n");
}

TEST_F(ForeignFileTest, LinksOfTheAdministratorAreFollowed) {
    ASSERT_EQ(::symlink("/dev/null", file_.c_str()), 0);
    const AnotherUser nobody;
    EXPECT_FALSE(openOwnFile(file_, Begin::AtEnd, "cannot").regular);
}

}  // namespace
}  // namespace apps
