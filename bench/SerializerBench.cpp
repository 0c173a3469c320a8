// What the library costs beside the least that the same work can cost: serializers beside bare Protocol Buffers calls
// on the same messages, arrays beside a copy of their bytes, text conversion beside a copy of the text. The last lines
// are ratios; a ratio of 1 means that the library adds nothing.

#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstring>
#include <map>
#include <string>
#include <vector>

#include "EvalIIPSerializer.hpp"
#include "QDASerializer.hpp"
#include "Samples.hpp"
#include "TestTransport.hpp"
#include "TextBaseEventSerializer.hpp"
#include "foundation/korveldata/ArrayFactory.hpp"
#include "krutil.protobuf.TextBaseEvent.pb.h"
#include "msg_svc/protobuf/ustring.hpp"

namespace {

namespace korveldata = foundation::korveldata;

const std::shared_ptr<const transport::Registry>& registry() {
    static const std::shared_ptr<const transport::Registry> filled = transport::sessionRegistry();
    return filled;
}

boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent> textEvent(std::size_t length) {
    using namespace krutil::io;
    return boost::make_shared<TextBaseEvent>(foundation::msg_svc::exchange::IDType(1, 2), StreamTypeEnum::ERROR_STREAM,
                                             std::u16string(length, u'x'));
}

std::string textBytes(std::size_t length) {
    const auto event = boost::dynamic_pointer_cast<const krutil::io::TextBaseEvent>(textEvent(length));
    return krutil::protobuf_serializer::TextBaseEventSerializer::toProtobuf(*event).SerializeAsString();
}

void writeTextEvent(benchmark::State& state) {
    const krutil::protobuf_serializer::TextBaseEventSerializer serializer;
    const auto event = textEvent(static_cast<std::size_t>(state.range(0)));
    for (auto _ : state) {
        const auto stream = std::make_shared<transport::RecordingStream>();
        serializer.serialize(event, 7, 1, stream, registry(), transport::SerializationContext());
        benchmark::DoNotOptimize(stream->frames.data());
    }
}

void writeTextEventBaseline(benchmark::State& state) {
    const std::string text(static_cast<std::size_t>(state.range(0)), 'x');
    for (auto _ : state) {
        krutil::protobuf::TextBaseEvent message;
        message.mutable_id()->set_hi(1);
        message.mutable_id()->set_lo(2);
        message.set_stream(krutil::protobuf::ERROR_STREAM);
        message.set_text(text);
        std::string bytes;
        message.SerializeToString(&bytes);
        benchmark::DoNotOptimize(bytes.data());
    }
}

void readTextEvent(benchmark::State& state) {
    const krutil::protobuf_serializer::TextBaseEventSerializer serializer;
    const std::string bytes = textBytes(static_cast<std::size_t>(state.range(0)));
    for (auto _ : state) {
        const auto message = transport::makeMessage("krutil:TextBaseEvent", bytes);
        benchmark::DoNotOptimize(serializer.deserialize(1, message, registry(), transport::SerializationContext()));
    }
}

void readTextEventBaseline(benchmark::State& state) {
    const std::string bytes = textBytes(static_cast<std::size_t>(state.range(0)));
    for (auto _ : state) {
        krutil::protobuf::TextBaseEvent message;
        message.ParseFromString(bytes);
        benchmark::DoNotOptimize(message);
    }
}

korveldata::Array array(std::size_t bytes) {
    return korveldata::ArrayFactory().createArray(korveldata::ElementType::Double, {bytes / 8});
}

void writeArray(benchmark::State& state) {
    const krutil::protobuf_serializer::QDASerializer serializer({});
    const korveldata::Array elements = array(static_cast<std::size_t>(state.range(0)));
    for (auto _ : state) {
        const auto stream = std::make_shared<transport::RecordingStream>();
        serializer.serialize(elements, 7, 1, stream, registry(), transport::SerializationContext());
        benchmark::DoNotOptimize(stream->frames.data());
    }
}

void writeArrayBaseline(benchmark::State& state) {
    const korveldata::Array elements = array(static_cast<std::size_t>(state.range(0)));
    for (auto _ : state) {
        std::unique_ptr<char[]> copy(new char[elements.sizeInBytes()]);
        std::memcpy(copy.get(), elements.data(), elements.sizeInBytes());
        benchmark::DoNotOptimize(copy.get());
        benchmark::ClobberMemory();
    }
}

void textToWire(benchmark::State& state) {
    const std::u16string text(static_cast<std::size_t>(state.range(0)), u'x');
    for (auto _ : state) {
        benchmark::DoNotOptimize(msg_svc::protobuf::ustring_to_utf8(text));
    }
}

void textToWireBaseline(benchmark::State& state) {
    const std::u16string text(static_cast<std::size_t>(state.range(0)), u'x');
    for (auto _ : state) {
        std::u16string copy = text;
        benchmark::DoNotOptimize(copy.data());
    }
}

// Prints what the console prints, and remembers the times.
class Ratios : public benchmark::ConsoleReporter {
  public:
    void ReportRuns(const std::vector<Run>& runs) override {
        ConsoleReporter::ReportRuns(runs);
        for (const Run& run : runs) {
            if (run.run_type == Run::RT_Aggregate && run.aggregate_name == "median") {
                times_[run.run_name.str()] = run.GetAdjustedCPUTime();
            }
        }
    }

    void print() const {
        std::printf("\n%-28s %8s\n", "median against its baseline", "ratio");
        for (const auto& [name, time] : times_) {
            const std::string::size_type slash = name.find('/');
            const auto baseline = times_.find(name.substr(0, slash) + "Baseline" + name.substr(slash));
            if (baseline != times_.end()) {
                std::printf("%-28s %8.2f\n", name.c_str(), time / baseline->second);
            }
        }
    }

  private:
    std::map<std::string, double> times_;
};

}  // namespace

BENCHMARK(writeTextEvent)->Arg(16)->Arg(4096)->Repetitions(5)->ReportAggregatesOnly();
BENCHMARK(writeTextEventBaseline)->Arg(16)->Arg(4096)->Repetitions(5)->ReportAggregatesOnly();
BENCHMARK(readTextEvent)->Arg(16)->Arg(4096)->Repetitions(5)->ReportAggregatesOnly();
BENCHMARK(readTextEventBaseline)->Arg(16)->Arg(4096)->Repetitions(5)->ReportAggregatesOnly();
BENCHMARK(writeArray)->Arg(1024)->Arg(1 << 20)->Arg(1 << 26)->Repetitions(5)->ReportAggregatesOnly();
BENCHMARK(writeArrayBaseline)->Arg(1024)->Arg(1 << 20)->Arg(1 << 26)->Repetitions(5)->ReportAggregatesOnly();
BENCHMARK(textToWire)->Arg(16)->Arg(4096)->Repetitions(5)->ReportAggregatesOnly();
BENCHMARK(textToWireBaseline)->Arg(16)->Arg(4096)->Repetitions(5)->ReportAggregatesOnly();

int main(int argc, char** argv) {
    benchmark::Initialize(&argc, argv);
    if (benchmark::ReportUnrecognizedArguments(argc, argv)) {
        return 2;
    }
    Ratios reporter;
    benchmark::RunSpecifiedBenchmarks(&reporter);
    reporter.print();
    return 0;
}
