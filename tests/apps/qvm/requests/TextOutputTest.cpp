#include "qvm/requests/TextOutput.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <future>
#include <thread>

#include "apps/qvm/requests/TestRequests.hpp"

namespace qvm_test {
namespace {

using cmddistributor::IqmStreamID;
using krutil::io::SinkTraits;
using krutil::io::StreamTypeEnum;
using qvm::FlushTimer;
using qvm::TextOutput;
using qvm::TextSource;
using qvm::TextTarget;
using testing::ElementsAre;

// Long enough that nothing is handed on because of the time.
constexpr std::chrono::milliseconds never = std::chrono::hours(1);

class TextOutputTest : public testing::Test {
  protected:
    struct Piece {
        TextTarget target;
        std::u16string text;
    };

    void make(TextOutput::Settings settings) {
        timer_.reset();
        output_.emplace(
            settings,
            [this](const TextTarget& target, std::u16string text) {
                const std::lock_guard lock(mutex_);
                pieces_.push_back({target, std::move(text)});
                arrived_.notify_all();
            },
            [this](FlushTimer::Time due) { timer_->expect(due); });
        timer_.emplace([this](FlushTimer::Time now) { return output_->flushDue(now); });
    }

    void makeWithLineGap(std::chrono::milliseconds gap) {
        TextOutput::Settings settings{8192, 32768, never, never};
        settings.lineGap = gap;
        make(settings);
    }

    void SetUp() override { make({8192, 32768, never, never}); }

    std::vector<std::u16string> texts() {
        const std::lock_guard lock(mutex_);
        std::vector<std::u16string> result;
        for (const Piece& piece : pieces_) {
            result.push_back(piece.text);
        }
        return result;
    }

    void awaitPieces(std::size_t count) {
        std::unique_lock lock(mutex_);
        ASSERT_TRUE(arrived_.wait_for(lock, std::chrono::seconds(60), [&] { return pieces_.size() >= count; }));
    }

    void writeOnOtherThread(TextSource source, std::u16string_view text) {
        std::thread([&] { output_->write(source, text); }).join();
    }

    std::mutex mutex_;
    std::condition_variable arrived_;
    std::vector<Piece> pieces_;
    std::optional<TextOutput> output_;
    std::optional<FlushTimer> timer_;
};

TEST_F(TextOutputTest, NewlineHandsOnWhatIsHeld) {
    EXPECT_FALSE(output_->write(TextSource::Output, u"a"));
    EXPECT_FALSE(output_->write(TextSource::Output, u"b"));
    EXPECT_THAT(texts(), ElementsAre());
    EXPECT_TRUE(output_->write(TextSource::Output, u"c\nd"));
    EXPECT_THAT(texts(), ElementsAre(u"abc\nd"));
}

TEST_F(TextOutputTest, LinesThatFollowAreHandedOnTogether) {
    makeWithLineGap(never);
    EXPECT_TRUE(output_->write(TextSource::Output, u"first\n"));
    EXPECT_FALSE(output_->write(TextSource::Output, u"second\n"));
    EXPECT_FALSE(output_->write(TextSource::Output, u"third\n"));
    EXPECT_THAT(texts(), ElementsAre(u"first\n"));
    EXPECT_TRUE(output_->flush());
    EXPECT_THAT(texts(), ElementsAre(u"first\n", u"second\nthird\n"));
}

TEST_F(TextOutputTest, LineAfterASilenceDoesNotWait) {
    makeWithLineGap(std::chrono::milliseconds(0));
    EXPECT_TRUE(output_->write(TextSource::Output, u"first\n"));
    EXPECT_TRUE(output_->write(TextSource::Output, u"second\n"));
    EXPECT_THAT(texts(), ElementsAre(u"first\n", u"second\n"));
}

TEST_F(TextOutputTest, LinesThatFollowAreHandedOnWhenNothingFollowsThem) {
    makeWithLineGap(std::chrono::milliseconds(1));
    output_->write(TextSource::Output, u"first\n");
    output_->write(TextSource::Output, u"second\n");
    awaitPieces(2);
    EXPECT_THAT(texts(), ElementsAre(u"first\n", u"second\n"));
}

TEST_F(TextOutputTest, LineThatWaitsIsHandedOnBeforeTextForAnotherTarget) {
    makeWithLineGap(never);
    output_->begin(makeRequest());
    output_->write(TextSource::Output, u"first\n");
    output_->write(TextSource::Output, u"second\n");
    EXPECT_TRUE(output_->write(TextSource::Error, u"third\n"));
    EXPECT_THAT(texts(), ElementsAre(u"first\n", u"second\n"));
    output_->end();
    EXPECT_THAT(texts(), ElementsAre(u"first\n", u"second\n", u"third\n"));
}

TEST_F(TextOutputTest, EmptyTextIsNothing) {
    EXPECT_FALSE(output_->write(TextSource::Output, u""));
    EXPECT_FALSE(output_->flush());
    EXPECT_THAT(texts(), ElementsAre());
}

TEST_F(TextOutputTest, AmountHandsOnWithoutANewline) {
    EXPECT_FALSE(output_->write(TextSource::Output, std::u16string(8191, u'x')));
    EXPECT_TRUE(output_->write(TextSource::Output, u"y"));
    EXPECT_THAT(texts(), ElementsAre(std::u16string(8191, u'x') + u"y"));
}

TEST_F(TextOutputTest, TimeHandsOnWithoutANewline) {
    make({8192, 32768, std::chrono::milliseconds(1), never});
    output_->write(TextSource::Output, u"slow");
    awaitPieces(1);
    output_->write(TextSource::Output, u"again");
    awaitPieces(2);
    EXPECT_THAT(texts(), ElementsAre(u"slow", u"again"));
}

TEST_F(TextOutputTest, NextWriteTellsOfTextThatTheTimeHandedOn) {
    make({8192, 32768, std::chrono::milliseconds(1), never});
    EXPECT_FALSE(output_->write(TextSource::Output, u"slow"));
    awaitPieces(1);
    // Another flush comes after the timer has let go of the text.
    EXPECT_FALSE(output_->flush());
    RequestParts parts;
    parts.flushSparingly = true;
    output_->begin(makeRequest(parts));
    EXPECT_TRUE(output_->write(TextSource::Output, u"held"));
    EXPECT_FALSE(output_->write(TextSource::Output, u"held too"));
    output_->end();
}

TEST_F(TextOutputTest, FlushHandsOn) {
    output_->write(TextSource::Output, u"now");
    EXPECT_TRUE(output_->flush());
    EXPECT_THAT(texts(), ElementsAre(u"now"));
}

TEST_F(TextOutputTest, DestructionHandsOn) {
    output_->write(TextSource::Output, u"rest");
    output_.reset();
    EXPECT_THAT(texts(), ElementsAre(u"rest"));
}

TEST_F(TextOutputTest, SparingRequestIsNotHandedOnByNewlines) {
    RequestParts parts;
    parts.flushSparingly = true;
    output_->begin(makeRequest(parts));
    EXPECT_FALSE(output_->write(TextSource::Output, u"a\nb\n"));
    EXPECT_THAT(texts(), ElementsAre());
    output_->end();
    EXPECT_THAT(texts(), ElementsAre(u"a\nb\n"));
}

TEST_F(TextOutputTest, SparingRequestIsHandedOnByItsOwnTime) {
    make({8192, 32768, never, std::chrono::milliseconds(1)});
    RequestParts parts;
    parts.flushSparingly = true;
    output_->begin(makeRequest(parts));
    output_->write(TextSource::Output, u"a\n");
    awaitPieces(1);
    output_->end();
}

TEST_F(TextOutputTest, ChangeOfTargetKeepsTheOrderOfWriting) {
    output_->begin(makeRequest());
    output_->write(TextSource::Output, u"1");
    output_->write(TextSource::Error, u"2");
    output_->write(TextSource::ShownOutput, u"3");
    output_->write(TextSource::Output, u"4");
    output_->end();
    EXPECT_THAT(texts(), ElementsAre(u"1", u"2", u"3", u"4"));
    EXPECT_EQ(pieces_[0].target.type, StreamTypeEnum::OUTPUT_STREAM);
    EXPECT_EQ(pieces_[1].target.type, StreamTypeEnum::ERROR_STREAM);
    EXPECT_EQ(pieces_[2].target.type, StreamTypeEnum::OUTPUT_STREAM);
    EXPECT_FALSE(pieces_[1].target.shown);
    EXPECT_TRUE(pieces_[2].target.shown);
}

TEST_F(TextOutputTest, LongTextIsSplitBetweenCharacters) {
    make({4, 5, never, never});
    // Units 4 and 5 are one character, which would lie across the first cut.
    output_->write(TextSource::Output, u"abcd\U0001F600efgh");
    EXPECT_THAT(texts(), ElementsAre(u"abcd", u"\U0001F600efg", u"h"));
}

TEST_F(TextOutputTest, TextOfNoRequestIsGeneric) {
    output_->write(TextSource::Error, u"x\n");
    ASSERT_EQ(pieces_.size(), 1U);
    EXPECT_EQ(pieces_[0].target, TextTarget());
    EXPECT_EQ(pieces_[0].target.type, StreamTypeEnum::GENERIC_STREAM);
}

TEST_F(TextOutputTest, TextOfTheRequestCarriesItsNumberStreamAndTraits) {
    RequestParts parts;
    parts.number = 7;
    parts.out = SinkTraits(false, false, false, true, false, false);
    parts.err = SinkTraits(false, false, false, false, false, true);
    output_->begin(makeRequest(parts));
    output_->write(TextSource::Output, u"o\n");
    output_->write(TextSource::Error, u"e\n");
    output_->end();
    const foundation::msg_svc::exchange::IDType id(0, 7);
    EXPECT_EQ(pieces_[0].target, (TextTarget{7, id, StreamTypeEnum::OUTPUT_STREAM, false, true, false}));
    EXPECT_EQ(pieces_[1].target, (TextTarget{7, id, StreamTypeEnum::ERROR_STREAM, false, false, true}));
}

TEST_F(TextOutputTest, RequestWithoutStreamsDropsItsText) {
    RequestParts parts;
    parts.streams = IqmStreamID::ekIqmNoStreams;
    output_->begin(makeRequest(parts));
    EXPECT_FALSE(output_->write(TextSource::Output, u"x\n"));
    EXPECT_FALSE(output_->write(TextSource::ShownOutput, u"x\n"));
    output_->end();
    EXPECT_THAT(texts(), ElementsAre());
}

TEST_F(TextOutputTest, OtherThreadsAreGenericUnlessTheRequestHasAllStreams) {
    for (const auto& [streams, number] :
         {std::pair(IqmStreamID::ekIqmCmdWinStream, 0U), std::pair(IqmStreamID::ekIqmNoStreams, 0U),
          std::pair(static_cast<IqmStreamID>(7), 0U), std::pair(IqmStreamID::ekIqmAllStreams, 1U),
          std::pair(IqmStreamID::ekIqmJavaStream, 1U)}) {
        pieces_.clear();
        RequestParts parts;
        parts.streams = streams;
        output_->begin(makeRequest(parts));
        writeOnOtherThread(TextSource::Output, u"x\n");
        output_->end();
        ASSERT_EQ(pieces_.size(), 1U);
        EXPECT_EQ(pieces_[0].target.stream, number);
        EXPECT_EQ(pieces_[0].target.id.lo(), number);
        EXPECT_EQ(pieces_[0].target.type, StreamTypeEnum::GENERIC_STREAM);
    }
}

TEST_F(TextOutputTest, NestedRequestsGiveWayToTheOuterOne) {
    RequestParts inner;
    inner.number = 2;
    output_->begin(makeRequest());
    output_->write(TextSource::Output, u"outer");
    output_->begin(makeRequest(inner));
    output_->write(TextSource::Output, u"inner");
    output_->end();
    output_->write(TextSource::Output, u"outer again");
    output_->end();
    ASSERT_THAT(texts(), ElementsAre(u"outer", u"inner", u"outer again"));
    EXPECT_EQ(pieces_[0].target.stream, 1U);
    EXPECT_EQ(pieces_[1].target.stream, 2U);
    EXPECT_EQ(pieces_[2].target.stream, 1U);
}

TEST_F(TextOutputTest, NoTextOfOtherThreadsJoinsARequestAfterItsEnd) {
    RequestParts parts;
    parts.streams = IqmStreamID::ekIqmAllStreams;
    std::atomic<bool> stop{false};
    std::thread writer([&] {
        while (!stop) {
            output_->write(TextSource::Output, u"x\n");
        }
    });
    for (int i = 0; i < 200; ++i) {
        output_->begin(makeRequest(parts));
        output_->end();
        std::size_t count = 0;
        {
            const std::lock_guard lock(mutex_);
            count = pieces_.size();
        }
        awaitPieces(count + 2);
        const std::lock_guard lock(mutex_);
        for (std::size_t k = count; k < pieces_.size(); ++k) {
            EXPECT_EQ(pieces_[k].target.stream, 0U);
        }
    }
    stop = true;
    writer.join();
}

}  // namespace
}  // namespace qvm_test
