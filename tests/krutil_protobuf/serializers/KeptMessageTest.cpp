// Messages that threads keep from one write to the next: what was written before leaves no trace, and what is kept is
// bounded.

#include "KeptMessage.hpp"

#include <gtest/gtest.h>

#include <algorithm>
#include <boost/make_shared.hpp>
#include <string>
#include <thread>
#include <vector>

#include "Families.hpp"
#include "krutil.protobuf.RuntimeException.pb.h"
#include "krutil.protobuf.TextBaseEvent.pb.h"
#include "krutil/io/TextBaseEvent.hpp"
#include "krutil_protobuf/serializers/AllocationRecorder.hpp"
#include "krutil_protobuf/serializers/SerializerTest.hpp"

namespace krutil::protobuf_serializer {
namespace {

namespace wire = krutil::protobuf;
using foundation::msg_svc::eventmgr::BaseEvent;
using foundation::msg_svc::exchange::IDType;
using transport::FrameContent;
using transport::Registry;

using KeptText = KeptMessage<wire::TextBaseEvent>;
using KeptException = KeptMessage<wire::RuntimeException>;

// A thread that has written nothing yet runs `action`, and has ended on return.
template <class Action>
void onFreshThread(const Action& action) {
    std::thread(action).join();
}

boost::shared_ptr<const BaseEvent> textEvent(const std::u16string& text) {
    return boost::make_shared<const io::TextBaseEvent>(IDType(1, 2), io::StreamTypeEnum::OUTPUT_STREAM, text);
}

std::vector<FrameContent> written(const std::shared_ptr<const Registry>& registry,
                                  const boost::shared_ptr<const BaseEvent>& event) {
    const auto stream = std::make_shared<transport::RecordingStream>();
    transport::serializer<EventFamily>(*registry, "krutil:TextBaseEvent").serialize(event, 7, 1, stream, registry, {});
    return transport::contentOf(stream->frames);
}

class KeptMessageTest : public testing::Test {
  protected:
    std::shared_ptr<const Registry> registry_ = transport::sessionRegistry();
};

TEST_F(KeptMessageTest, WhatWasWrittenBeforeLeavesNoTrace) {
    for (const samples::SampleSet& set : samples::sampleSets()) {
        const auto& serializer = *registry_->find(set.serializer);
        std::vector<std::vector<FrameContent>> alone(set.samples.size());
        for (std::size_t i = 0; i < set.samples.size(); ++i) {
            onFreshThread([&] { alone[i] = transport::writtenFrames(serializer, set.samples[i].object, registry_); });
        }
        for (const samples::Sample& before : set.samples) {
            for (std::size_t i = 0; i < set.samples.size(); ++i) {
                transport::writtenFrames(serializer, before.object, registry_);
                EXPECT_EQ(transport::writtenFrames(serializer, set.samples[i].object, registry_), alone[i])
                    << set.serializer << ": " << set.samples[i].name << " after " << before.name;
            }
        }
    }
}

TEST_F(KeptMessageTest, AThreadGetsItsOwnMessageAgain) {
    onFreshThread([] {
        const wire::TextBaseEvent* first = nullptr;
        {
            KeptText kept;
            first = &*kept;
            kept.keep();
        }
        onFreshThread([first] { EXPECT_NE(&*KeptText(), first); });
        EXPECT_EQ(&*KeptText(), first);
    });
}

TEST_F(KeptMessageTest, AMessageThatWasNotWrittenIsNotKept) {
    onFreshThread([] {
        {
            KeptText kept;
            (*kept).set_text("of a write that failed");
        }
        EXPECT_EQ((*KeptText()).text(), "");
    });
}

TEST_F(KeptMessageTest, OneThatIsInUseIsNotHandedOutTwice) {
    onFreshThread([] {
        KeptText outer;
        {
            KeptText inner;
            EXPECT_NE(&*inner, &*outer);
            (*inner).set_text("inner");
            inner.keep();
        }
        (*outer).set_text("outer");
        outer.keep();
        EXPECT_EQ((*KeptText()).text(), "inner");
    });
}

// Writes another event of the same type, on a stream of its own, while one is appended.
class InterruptingStream final : public transport::RecordingStream {
  public:
    InterruptingStream(std::shared_ptr<const Registry> registry, std::vector<FrameContent>& second)
        : registry_(std::move(registry)), second_(second) {}

    void append(std::unique_ptr<transport::Frame>& frame) override {
        second_ = written(registry_, textEvent(u"second"));
        RecordingStream::append(frame);
    }

  private:
    std::shared_ptr<const Registry> registry_;
    std::vector<FrameContent>& second_;
};

TEST_F(KeptMessageTest, AStreamMayWriteAnObjectOfTheSameType) {
    std::vector<FrameContent> second;
    const auto stream = std::make_shared<InterruptingStream>(registry_, second);
    for (int i = 0; i < 2; ++i) {
        transport::serializer<EventFamily>(*registry_, "krutil:TextBaseEvent")
            .serialize(textEvent(u"first"), 7, 1, stream, registry_, {});
        EXPECT_EQ(transport::parsed<wire::TextBaseEvent>(*stream->frames.back()).text(), "first");
        EXPECT_EQ(second, written(registry_, textEvent(u"second")));
    }
}

TEST_F(KeptMessageTest, AfterAFailedWriteTheNextOneIsRight) {
    const auto full = std::make_shared<transport::ThrowingStream>(0);
    EXPECT_EQ(transport::errorText<std::runtime_error>([&] {
                  transport::serializer<EventFamily>(*registry_, "krutil:TextBaseEvent")
                      .serialize(textEvent(u"lost"), 7, 1, full, registry_, {});
              }),
              "stream is full");
    const auto frames = written(registry_, textEvent(u"kept"));
    wire::TextBaseEvent proto;
    ASSERT_TRUE(proto.ParseFromString(frames.at(0).bytes));
    EXPECT_EQ(proto.text(), "kept");
}

TEST_F(KeptMessageTest, ALargeMessageIsNotKept) {
    onFreshThread([] {
        for (const std::size_t size : {KeptText::mostBytes - 100, KeptText::mostBytes + 1}) {
            KeptText kept;
            EXPECT_EQ((*kept).text(), "");
            (*kept).set_text(std::string(size, 'x'));
            (*kept).ByteSizeLong();
            kept.keep();
            // Given up at once, or with the next one.
            KeptText next;
            EXPECT_EQ((*next).text().empty(), size > KeptText::mostBytes);
            (*next).ByteSizeLong();
            next.keep();
        }
    });
}

TEST_F(KeptMessageTest, AMessageOfTheBoundIsKeptOnce) {
    onFreshThread([] {
        for (int i = 0; i < 2; ++i) {
            {
                KeptText kept;
                // The field's number and length take four bytes.
                (*kept).set_text(std::string(KeptText::mostBytes - 4, 'x'));
                EXPECT_EQ((*kept).ByteSizeLong(), KeptText::mostBytes);
                kept.keep();
            }
            {
                KeptText same;
                EXPECT_EQ((*same).text().size(), KeptText::mostBytes - 4);
                (*same).set_text("x");
                (*same).ByteSizeLong();
                same.keep();
            }
            EXPECT_EQ((*KeptText()).text(), "");
        }
    });
}

// Each write makes another part large, so that without a bound all parts would be large in the end.
TEST_F(KeptMessageTest, WhatIsKeptDoesNotGrowWithTheNumberOfWrites) {
    constexpr int parts = 1000;
    constexpr std::size_t large = 10'000;
    onFreshThread([] {
        for (int i = 0; i < parts; ++i) {
            KeptException kept;
            (*kept).clear_frames();
            for (int part = 0; part < parts; ++part) {
                (*kept).add_frames()->set_func(part == i ? std::string(large, 'x') : "f");
            }
            (*kept).ByteSizeLong();
            kept.keep();
            EXPECT_LT((*KeptException()).SpaceUsedLong(), 4 * KeptException::mostBytes);
        }
    });
}

// Destroyed after what the thread keeps, because it was made before.
struct WritesAtTheVeryEnd {
    std::shared_ptr<const Registry> registry;
    std::vector<FrameContent>* frames = nullptr;
    ~WritesAtTheVeryEnd() {
        for (int i = 0; registry && i < 2; ++i) {
            *frames = written(registry, textEvent(u"last words"));
        }
    }
};

TEST_F(KeptMessageTest, AThreadMayWriteToItsVeryEnd) {
    std::vector<FrameContent> frames;
    onFreshThread([&] {
        static thread_local WritesAtTheVeryEnd atTheEnd;
        atTheEnd.registry = registry_;
        atTheEnd.frames = &frames;
        written(registry_, textEvent(u"first words"));
    });
    EXPECT_EQ(frames, written(registry_, textEvent(u"last words")));
}

struct KeepsAtTheVeryEnd {
    std::string* found = nullptr;
    ~KeepsAtTheVeryEnd() {
        {
            KeptText kept;
            (*kept).set_text("last words");
            kept.keep();
        }
        *found = (*KeptText()).text();
    }
};

TEST_F(KeptMessageTest, AThreadThatEndsKeepsNothing) {
    std::string found = "nobody has looked";
    onFreshThread([&found] {
        static thread_local KeepsAtTheVeryEnd atTheEnd;
        atTheEnd.found = &found;
        KeptText().keep();
    });
    EXPECT_EQ(found, "");
}

class DroppingStream final : public transport::MessageStream {
  public:
    void append(std::unique_ptr<transport::Frame>& frame) override { frame.reset(); }
};

struct Allocations {
    const char* serializer;
    std::size_t writing;
    std::size_t reading;
};

template <class Action>
std::size_t allocationsOf(const Action& action) {
    const AllocationRecorder recorder;
    action();
    return recorder.allocations();
}

// Writing allocates each frame, its bytes, and texts that are too long to stand in a string itself. Reading allocates
// the object, such texts, and the parts of the message unless they are on an arena.
TEST_F(KeptMessageTest, EachAllocationIsCounted) {
    const std::shared_ptr<transport::MessageStream> stream = std::make_shared<DroppingStream>();
    for (const Allocations& expected : {
             Allocations{"krutil:TextBaseEvent", 2, 4},
             Allocations{"krutil:IIPEnqueueMessage", 6, 13},
             Allocations{"krutil:IIPResult", 3, 7},
             Allocations{"krutil:IIPReply", 4, 3},
             Allocations{"korvel:lang:diagnostic:IssuedWarningEvent", 3, 14},
             Allocations{"korvel:lang:diagnostic:IssuedEnabledWarningEvent", 3, 21},
             Allocations{"krutil:PrintableErrorEvent", 4, 9},
         }) {
        const samples::SampleSet& set = samples::sampleSet(expected.serializer);
        const auto& serializer = *registry_->find(set.serializer);
        const samples::Object& typical =
            std::find_if(set.samples.begin(), set.samples.end(), [](const samples::Sample& sample) {
                return sample.name == "typical";
            })->object;
        const auto write = [&] { samples::write(serializer, typical, 7, 1, stream, registry_, {}); };
        write();
        EXPECT_EQ(allocationsOf(write), expected.writing) << set.serializer;

        const auto frames = transport::writtenFrames(serializer, typical, registry_);
        const auto message = transport::makeMessage(frames);
        EXPECT_EQ(allocationsOf([&] {
                      samples::read(serializer, static_cast<transport::FrameIndex>(frames.size()), message, registry_,
                                    {});
                  }),
                  expected.reading)
            << set.serializer;
    }
}

}  // namespace
}  // namespace krutil::protobuf_serializer
