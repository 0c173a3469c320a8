#include "SerializerBench.hpp"

#include <google/protobuf/descriptor.h>
#include <google/protobuf/message.h>

#include <boost/make_shared.hpp>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "Comparison.hpp"
#include "foundation/korveldata/ArrayFactory.hpp"
#include "krutil/io/TextBaseEvent.hpp"
#include "krutil_protobuf/support/TestTransport.hpp"
#include "msg_svc/protobuf/ustring.hpp"
#include "samples/Samples.hpp"

namespace bench {
namespace {

namespace korveldata = foundation::korveldata;

const std::shared_ptr<const transport::Registry>& registry() {
    static const std::shared_ptr<const transport::Registry> filled = transport::sessionRegistry();
    return filled;
}

// One object with all that measuring it needs: the frames that it becomes, and their messages with all fields filled.
struct Subject {
    Subject(const std::string& serializerName, const samples::Object& theObject)
        : serializer(*registry()->find(serializerName)),
          object(theObject),
          frames(transport::writtenFrames(serializer, object, registry())) {
        for (const auto& frame : frames) {
            if (!frame.tagged) {
                continue;
            }
            const std::string& name = samples::sampleSet(frame.tag).message;
            const auto* type = google::protobuf::DescriptorPool::generated_pool()->FindMessageTypeByName(name);
            messages.emplace_back(google::protobuf::MessageFactory::generated_factory()->GetPrototype(type)->New());
            messages.back()->ParsePartialFromString(frame.bytes);
        }
    }

    const transport::SerializerBase& serializer;
    const samples::Object& object;
    std::vector<transport::FrameContent> frames;
    std::vector<std::unique_ptr<google::protobuf::Message>> messages;
};

void compareWrite(const std::string& name, const std::shared_ptr<const Subject>& subject) {
    compare(
        name, Clock::Cpu,
        [subject](benchmark::State& state) {
            for (auto _ : state) {
                const auto stream = std::make_shared<transport::RecordingStream>();
                samples::write(subject->serializer, subject->object, 7, 1, stream, registry(),
                               transport::SerializationContext());
                benchmark::DoNotOptimize(stream->frames.data());
            }
        },
        [subject](benchmark::State& state) {
            for (auto _ : state) {
                for (const auto& filled : subject->messages) {
                    const std::unique_ptr<google::protobuf::Message> message(filled->New());
                    message->CopyFrom(*filled);
                    std::string bytes;
                    message->SerializePartialToString(&bytes);
                    benchmark::DoNotOptimize(bytes.data());
                }
            }
        });
}

// Reading consumes a message, so some are made ahead, off the clock.
template <class Read>
void readBatches(benchmark::State& state, const Subject& subject, const Read& read) {
    constexpr std::size_t batch = 64;
    std::vector<std::unique_ptr<transport::Message>> received(batch);
    while (state.KeepRunningBatch(batch)) {
        state.PauseTiming();
        for (auto& message : received) {
            message = transport::makeMessage(subject.frames);
        }
        state.ResumeTiming();
        for (const auto& message : received) {
            read(message);
        }
    }
}

void compareRead(const std::string& name, const std::shared_ptr<const Subject>& subject) {
    compare(
        name, Clock::Cpu,
        [subject](benchmark::State& state) {
            const auto own = static_cast<transport::FrameIndex>(subject->frames.size());
            readBatches(state, *subject, [&](const std::unique_ptr<transport::Message>& message) {
                benchmark::DoNotOptimize(
                    samples::read(subject->serializer, own, message, registry(), transport::SerializationContext()));
            });
        },
        [subject](benchmark::State& state) {
            readBatches(state, *subject, [&](const std::unique_ptr<transport::Message>& message) {
                auto filled = subject->messages.begin();
                for (const auto& frame : subject->frames) {
                    const std::unique_ptr<transport::Frame> taken = message->release(frame.index);
                    if (frame.tagged) {
                        const std::unique_ptr<google::protobuf::Message> parsed((*filled++)->New());
                        parsed->ParsePartialFromArray(taken->data(), static_cast<int>(taken->size()));
                        benchmark::DoNotOptimize(parsed.get());
                    }
                }
            });
        });
}

void addRows() {
    for (const auto& set : samples::sampleSets()) {
        const auto subject = std::make_shared<const Subject>(set.serializer, set.samples.front().object);
        const std::string name = set.serializer + "/" + set.samples.front().name;
        compareWrite("write/" + name, subject);
        compareRead("read/" + name, subject);
    }
}

void addLongText() {
    using namespace krutil::io;
    static const samples::Object event =
        boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent>(boost::make_shared<TextBaseEvent>(
            foundation::msg_svc::exchange::IDType(1, 2), StreamTypeEnum::ERROR_STREAM, std::u16string(4096, u'x')));
    const auto subject = std::make_shared<const Subject>("krutil:TextBaseEvent", event);
    compareWrite("write/krutil:TextBaseEvent/4096 characters", subject);
    compareRead("read/krutil:TextBaseEvent/4096 characters", subject);
}

void addArrays() {
    for (const std::size_t bytes : {std::size_t{1} << 10, std::size_t{1} << 20, std::size_t{1} << 26}) {
        const auto elements = std::make_shared<const samples::Object>(
            korveldata::ArrayFactory().createArray(korveldata::ElementType::Double, {bytes / 8}));
        compare(
            "array to frames/" + std::to_string(bytes) + " bytes", Clock::Cpu,
            [elements](benchmark::State& state) {
                const auto& serializer = *registry()->find("krutil:QDA");
                for (auto _ : state) {
                    const auto stream = std::make_shared<transport::RecordingStream>();
                    samples::write(serializer, *elements, 7, 1, stream, registry(), transport::SerializationContext());
                    benchmark::DoNotOptimize(stream->frames.data());
                }
            },
            [elements](benchmark::State& state) {
                const auto& array = std::get<korveldata::Array>(*elements);
                for (auto _ : state) {
                    const std::unique_ptr<char[]> copy(new char[array.sizeInBytes()]);
                    std::memcpy(copy.get(), array.data(), array.sizeInBytes());
                    benchmark::DoNotOptimize(copy.get());
                    benchmark::ClobberMemory();
                }
            });
    }
}

void compareText(const std::string& kind, const std::u16string& pattern) {
    for (const std::size_t length : {std::size_t{16}, std::size_t{4096}}) {
        std::u16string text;
        while (text.size() < length) {
            text += pattern;
        }
        const std::string utf8 = msg_svc::protobuf::ustring_to_utf8(text);
        const std::string suffix = " text/" + std::to_string(length) + " characters";
        const auto copyOf = [](const auto& source) {
            return [source](benchmark::State& state) {
                for (auto _ : state) {
                    auto copy = source;
                    benchmark::DoNotOptimize(copy.data());
                }
            };
        };
        compare(
            "to UTF-8/" + kind + suffix, Clock::Cpu,
            [text](benchmark::State& state) {
                for (auto _ : state) {
                    benchmark::DoNotOptimize(msg_svc::protobuf::ustring_to_utf8(text));
                }
            },
            copyOf(text));
        compare(
            "to UTF-16/" + kind + suffix, Clock::Cpu,
            [utf8](benchmark::State& state) {
                for (auto _ : state) {
                    benchmark::DoNotOptimize(msg_svc::protobuf::utf8_to_ustring(utf8));
                }
            },
            copyOf(utf8));
    }
}

}  // namespace

void addSerializerBenches() {
    addRows();
    addLongText();
    addArrays();
    compareText("ASCII", u"x");
    compareText("Greek", u"\u03b1\u03b2");
}

}  // namespace bench
