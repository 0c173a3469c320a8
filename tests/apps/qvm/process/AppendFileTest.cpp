// What a file of text says and keeps when there is no room for all of it.
#include "qvm/process/AppendFile.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/resource.h>

#include <csignal>
#include <fstream>
#include <iterator>

#include "support/TemporaryDirectory.hpp"

namespace qvm_test {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;

// While an object lives, files of this process end at `bytes`.
class FileSizeBound {
  public:
    explicit FileSizeBound(rlim_t bytes) : handling_(std::signal(SIGXFSZ, SIG_IGN)) {
        EXPECT_EQ(::getrlimit(RLIMIT_FSIZE, &before_), 0);
        const struct rlimit small { bytes, before_.rlim_max };
        EXPECT_EQ(::setrlimit(RLIMIT_FSIZE, &small), 0);
    }
    ~FileSizeBound() {
        ::setrlimit(RLIMIT_FSIZE, &before_);
        std::signal(SIGXFSZ, handling_);
    }
    FileSizeBound(const FileSizeBound&) = delete;
    FileSizeBound& operator=(const FileSizeBound&) = delete;

  private:
    void (*handling_)(int);
    struct rlimit before_ {};
};

class AppendFileTest : public testing::Test {
  protected:
    std::string content() const {
        std::ifstream in(path_);
        return {std::istreambuf_iterator<char>(in), {}};
    }

    const test_support::TemporaryDirectory directory_;
    const std::string path_ = directory_.file("diary");
    std::vector<std::string> said_;
    qvm::AppendFile file_{path_, [this](const std::string& sentence) { said_.push_back(sentence); }};
};

TEST_F(AppendFileTest, NothingIsSaidWhileThereIsRoom) {
    file_.append("one\n");
    file_.append("two");
    file_.append(" words\n");
    EXPECT_TRUE(file_.finish());
    EXPECT_EQ(content(), "one\ntwo words\n");
    EXPECT_THAT(said_, IsEmpty());
}

TEST_F(AppendFileTest, LossIsSaidOnceAndCountedAtTheEnd) {
    file_.append("fits\n");
    {
        const FileSizeBound full(8);
        file_.append("12345\n");
        file_.append("67\n");
    }
    EXPECT_THAT(
        said_, ElementsAre("cannot write to '" + path_ + "': File too large; text for it is lost until there is room"));
    EXPECT_FALSE(file_.finish());
    EXPECT_FALSE(file_.finish());
    ASSERT_EQ(said_.size(), 2U);
    EXPECT_EQ(said_[1], "'" + path_ + "' is not complete: 6 bytes are lost");
    EXPECT_EQ(content(), "fits\n123");
}

TEST_F(AppendFileTest, WhatFollowsALossBeginsALine) {
    {
        const FileSizeBound full(3);
        file_.append("12345\n");
    }
    file_.append("next\n");
    {
        const FileSizeBound full(content().size());
        file_.append("lost");
    }
    // What is there ends with a line already.
    file_.append("last\n");
    EXPECT_EQ(content(), "123\nnext\nlast\n");
    EXPECT_FALSE(file_.finish());
    EXPECT_EQ(said_.back(), "'" + path_ + "' is not complete: 7 bytes are lost");
}

TEST_F(AppendFileTest, ALineThatCannotBeEndedIsNotGoneOnWith) {
    {
        const FileSizeBound full(3);
        file_.append("12345\n");
        file_.append("6\n");
    }
    file_.append("7\n");
    EXPECT_EQ(content(), "123\n7\n");
    EXPECT_FALSE(file_.finish());
    EXPECT_EQ(said_.back(), "'" + path_ + "' is not complete: 5 bytes are lost");
}

TEST_F(AppendFileTest, AForkedProcessCountsItsOwnLosses) {
    {
        const FileSizeBound full(0);
        file_.append("lost");
        file_.startOver();
        EXPECT_TRUE(file_.finish());
        file_.append("!");
    }
    EXPECT_FALSE(file_.finish());
    EXPECT_THAT(said_,
                ElementsAre("cannot write to '" + path_ + "': File too large; text for it is lost until there is room",
                            "cannot write to '" + path_ + "': File too large; text for it is lost until there is room",
                            "'" + path_ + "' is not complete: 1 byte is lost"));
}

}  // namespace
}  // namespace qvm_test
