#include "SerializerBench.hpp"

#include <google/protobuf/descriptor.h>
#include <google/protobuf/message.h>
#include <unicode/ustring.h>

#include <boost/make_shared.hpp>
#include <cstring>
#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

#include "Comparison.hpp"
#include "codec/CodecSamples.hpp"
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

// Reading consumes a message, so some are made ahead, off the clock. They are few: a session has one at a time, and
// what reading it releases is at hand for the next one.
template <class Read>
void readBatches(benchmark::State& state, const std::vector<transport::FrameContent>& frames, const Read& read) {
    constexpr std::size_t batch = 6;
    std::vector<std::unique_ptr<transport::Message>> received(batch);
    while (state.KeepRunningBatch(batch)) {
        state.PauseTiming();
        for (auto& message : received) {
            message = transport::makeMessage(frames);
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
            readBatches(state, subject->frames, [&](const std::unique_ptr<transport::Message>& message) {
                benchmark::DoNotOptimize(
                    samples::read(subject->serializer, own, message, registry(), transport::SerializationContext()));
            });
        },
        [subject](benchmark::State& state) {
            readBatches(state, subject->frames, [&](const std::unique_ptr<transport::Message>& message) {
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

// The whole way of an object, beside bare code for the same object. Both ways read messages of the same kind, so that
// heap and caches are alike.
void addCodecSamples() {
    for (const CodecSample& sample : codecSamples()) {
        compare(
            "serialize/" + sample.name, Clock::Cpu,
            [&sample](benchmark::State& state) {
                const std::shared_ptr<transport::MessageStream> stream = std::make_shared<DroppingStream>();
                for (auto _ : state) {
                    sample.serialize(stream);
                }
            },
            [&sample](benchmark::State& state) {
                const TakeBytes take = [](const char* bytes, std::size_t) { benchmark::DoNotOptimize(bytes); };
                for (auto _ : state) {
                    sample.serializeBare(take);
                }
            });
        compare(
            "deserialize/" + sample.name, Clock::Cpu,
            [&sample](benchmark::State& state) {
                readBatches(state, sample.frames,
                            [&sample](const auto& message) { benchmark::DoNotOptimize(sample.deserialize(message)); });
            },
            [&sample](benchmark::State& state) {
                readBatches(state, sample.frames, [&sample](const auto& message) {
                    benchmark::DoNotOptimize(sample.deserializeBare(*message));
                });
            });
    }
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

// What a program without this library writes: room for the longest result, and one call.
std::string utf8ByIcu(const std::u16string& text) {
    std::string utf8(3 * text.size(), '\0');
    std::int32_t length = 0;
    UErrorCode status = U_ZERO_ERROR;
    u_strToUTF8WithSub(utf8.data(), static_cast<std::int32_t>(utf8.size()), &length, text.data(),
                       static_cast<std::int32_t>(text.size()), 0xFFFD, nullptr, &status);
    utf8.resize(static_cast<std::size_t>(length));
    return utf8;
}

std::u16string utf16ByIcu(const std::string& utf8) {
    std::u16string text(utf8.size(), u'\0');
    std::int32_t length = 0;
    UErrorCode status = U_ZERO_ERROR;
    u_strFromUTF8WithSub(text.data(), static_cast<std::int32_t>(text.size()), &length, utf8.data(),
                         static_cast<std::int32_t>(utf8.size()), 0xFFFD, nullptr, &status);
    text.resize(static_cast<std::size_t>(length));
    return text;
}

void compareText(const std::string& kind, const std::u16string& pattern) {
    for (const std::size_t length : {std::size_t{16}, std::size_t{80}, std::size_t{4096}}) {
        std::u16string text;
        while (text.size() < length) {
            text += pattern;
        }
        const std::string utf8 = msg_svc::protobuf::ustring_to_utf8(text);
        if (utf8 != utf8ByIcu(text) || msg_svc::protobuf::utf8_to_ustring(utf8) != utf16ByIcu(utf8)) {
            throw std::logic_error(kind + " text: expected both conversions to agree");
        }
        const std::string suffix = " text/" + std::to_string(length) + " characters";
        const auto repeat = [](const auto& source, const auto& convert) {
            return [source, convert](benchmark::State& state) {
                for (auto _ : state) {
                    benchmark::DoNotOptimize(convert(source));
                }
            };
        };
        compare("to UTF-8/" + kind + suffix, Clock::Cpu, repeat(text, msg_svc::protobuf::ustring_to_utf8),
                repeat(text, utf8ByIcu));
        compare("to UTF-16/" + kind + suffix, Clock::Cpu, repeat(utf8, msg_svc::protobuf::utf8_to_ustring),
                repeat(utf8, utf16ByIcu));
    }
}

}  // namespace

void addSerializerBenches() {
    addCodecSamples();
    addRows();
    addLongText();
    addArrays();
    compareText("ASCII", u"x");
    compareText("Latin", u"d\u00e9j\u00e0 vu, \u00e7a alors! ");
    compareText("Greek", u"\u03b1\u03b2");
    compareText("CJK", u"\u6f22\u5b57");
    compareText("emoji", u"\U0001f600\U0001f680");
}

}  // namespace bench
