#include "peers/SmallMessages.hpp"

#include <memory>
#include <stdexcept>
#include <utility>
#include <variant>
#include <vector>

#include "Comparison.hpp"
#include "krutil/cmddistributor/IIPReply.hpp"
#include "peers/SmallMessageBench.hpp"

namespace bench {
namespace {

const CodecSample& sampleNamed(const std::string& begin) {
    for (const CodecSample& sample : codecSamples()) {
        if (sample.name.starts_with(begin)) {
            return sample;
        }
    }
    throw std::logic_error("no sample named " + begin);
}

template <class Base>
Base objectOf(const CodecSample& sample) {
    return std::get<Base>(sample.deserialize(transport::makeMessage(sample.frames)));
}

const Line& line() {
    static const auto object =
        objectOf<boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent>>(sampleNamed("text event"));
    return dynamic_cast<const Line&>(*object);
}

const Error& error() {
    static const auto object =
        objectOf<boost::shared_ptr<const foundation::msg_svc::exchange::Reply>>(sampleNamed("exception"));
    return *dynamic_cast<const krutil::cmddistributor::IIPReply&>(*object).getResult()->getException();
}

void compareWays(const CodecSample& sample, const std::string& contender, std::function<void()> write,
                 std::function<void()> read) {
    compare(
        "small-messages/serialize " + sample.name, Clock::Cpu,
        [write = std::move(write)](benchmark::State& state) {
            for (auto _ : state) {
                write();
            }
        },
        [&sample](benchmark::State& state) {
            for (auto _ : state) {
                sample.serializeBare([](const char* bytes, std::size_t) { benchmark::DoNotOptimize(bytes); });
            }
        },
        contender);
    compare(
        "small-messages/deserialize " + sample.name, Clock::Cpu,
        [read = std::move(read)](benchmark::State& state) {
            for (auto _ : state) {
                read();
            }
        },
        [&sample, message = std::shared_ptr<transport::Message>(transport::makeMessage(sample.frames))](
            benchmark::State& state) {
            for (auto _ : state) {
                benchmark::DoNotOptimize(sample.deserializeBare(*message));
            }
        },
        contender);
}

// What is written of `object`, when what is read of that is equal to it.
template <class Object, class Write, class Read, class Equal>
std::string checkedBytes(const std::string& format, const Object& object, const Write& write, const Read& read,
                         const Equal& equal) {
    std::string bytes;
    write(object, [&bytes](const char* begin, std::size_t size) { bytes.assign(begin, size); });
    if (!equal(read(bytes.data(), bytes.size()))) {
        throw std::logic_error(format + ": expected to read what was written");
    }
    return bytes;
}

const TakeBytes drop = [](const char* bytes, std::size_t) { benchmark::DoNotOptimize(bytes); };

void addFormat(const SmallFormat& format) {
    const auto lineBytes = checkedBytes(format.name, line(), format.writeLine, format.readLine, [](const auto& got) {
        return got->getText() == line().getText() && got->getRequestId() == line().getRequestId() &&
               got->getStreamType() == line().getStreamType();
    });
    compareWays(
        sampleNamed("text event"), format.name, [write = format.writeLine] { write(line(), drop); },
        [read = format.readLine, lineBytes] { benchmark::DoNotOptimize(read(lineBytes.data(), lineBytes.size())); });
    const auto errorBytes = checkedBytes(format.name, error(), format.writeError, format.readError,
                                         [](const Error& got) { return got == error(); });
    compareWays(
        sampleNamed("exception"), format.name, [write = format.writeError] { write(error(), drop); },
        [read = format.readError, errorBytes] {
            benchmark::DoNotOptimize(read(errorBytes.data(), errorBytes.size()));
        });
}

}  // namespace

void addSmallMessageBenches() {
    for (const SmallFormat& format : {capnProtoFormat(), flatBuffersFormat(), messagePackFormat(), jsonFormat()}) {
        addFormat(format);
    }
}

}  // namespace bench
