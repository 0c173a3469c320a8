#include "krutil/base/Output.hpp"

#include <gtest/gtest.h>

#include <csignal>
#include <thread>

#include "krutil/base/ExitCode.hpp"
#include "krutil/base/Interrupt.hpp"
#include "krutil/base/LastLine.hpp"
#include "support/Pipe.hpp"

namespace krutil_client {
namespace {

class OutputTest : public ::testing::Test {
  protected:
    Interrupt interrupt;
    test_support::Pipe pipe;
};

TEST_F(OutputTest, AllTextArrivesHoweverSlowlyItIsRead) {
    std::string text;
    for (int i = 0; text.size() < 3'000'000; ++i) {
        text += std::to_string(i) + '\n';
    }
    std::string got;
    std::thread reader([&] {
        std::array<char, 777> piece;
        for (ssize_t count = 0; (count = ::read(pipe.read.get(), piece.data(), piece.size())) > 0;) {
            got.append(piece.data(), static_cast<std::size_t>(count));
        }
    });
    Output(pipe.write.get(), "standard output", interrupt).write(text);
    pipe.write.reset();
    reader.join();
    EXPECT_EQ(got == text, true);
}

TEST_F(OutputTest, AReaderThatHasGoneIsNoErrorToReport) {
    std::signal(SIGPIPE, SIG_IGN);
    pipe.read.reset();
    Output output(pipe.write.get(), "standard output", interrupt);
    EXPECT_THROW(output.write("x"), OutputClosed);
}

TEST_F(OutputTest, AFullDiskIsOne) {
    const foundation::core::posix::OwnedDescriptor full(::open("/dev/full", O_WRONLY | O_CLOEXEC));
    Output output(full.get(), "standard output", interrupt);
    try {
        output.write("x");
        FAIL();
    } catch (const Failure& failure) {
        EXPECT_EQ(failure.code(), ExitCode::Stream);
        EXPECT_STREQ(failure.what(), "cannot write to standard output: No space left on device");
    }
}

TEST_F(OutputTest, CtrlCIsDispatchedWhileNobodyReads) {
    Output output(pipe.write.get(), "standard output", interrupt);
    int seen = 0;
    interrupt.setAction([&seen] {
        ++seen;
        throw Cancelled();
    });
    ::kill(::getpid(), SIGINT);
    EXPECT_THROW(output.write(std::string(1'000'000, 'x')), Cancelled);
    EXPECT_EQ(seen, 1);
}

TEST_F(OutputTest, WhatIsOnlyShownIsNotInterruptedWhileSomebodyReads) {
    Output output(pipe.write.get(), "standard output", interrupt);
    ::kill(::getpid(), SIGINT);
    output.show("shown");
    EXPECT_THROW(output.write("written"), Cancelled);
    EXPECT_EQ(pipe.content(), "shown");
}

TEST_F(OutputTest, APipeHasNoLastLine) {
    LastLine lastLine;
    Output(pipe.write.get(), "standard output", interrupt, &lastLine).write("text");
    EXPECT_EQ(lastLine.text(), "");
}

TEST_F(OutputTest, APipeIsNoTerminal) {
    EXPECT_FALSE(Output(pipe.write.get(), "standard output", interrupt).isTerminal());
}

}  // namespace
}  // namespace krutil_client
