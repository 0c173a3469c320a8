// Serializers that many threads share: what is made once for a process is made right when all threads ask for it first,
// and no conversion sees another one's.

#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <barrier>
#include <cstddef>
#include <cstdio>
#include <cstdlib>
#include <iterator>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "KrutilProtocol.hpp"
#include "foundation/msg_svc/transport/layers/session/ProtocolRegistry.hpp"
#include "krutil_protobuf/support/Goldens.hpp"
#include "krutil_protobuf/support/TestTransport.hpp"
#include "samples/Samples.hpp"
#include "support/FileContent.hpp"

namespace {

using foundation::msg_svc::transport::layers::session::ProtocolRegistry;
using krutil::protobuf::KrutilProtocol;
using transport::FrameContent;
using transport::Registry;

constexpr int sharers = 16;

#if defined(KRUTIL_SANITIZED)
constexpr int calls = 20'000;
#else
constexpr int calls = 1'000'000;
#endif

enum class Direction { Write, Read };

/// Writes or reads one sample, and what comes of it when one thread does it.
struct Conversion {
    const samples::SampleSet* set;
    const samples::Sample* sample;
    Direction direction;
    std::vector<FrameContent> frames;  // what is written, or read
    std::string text;                  // of the object that is read

    // What is wrong about it with these serializers; "" for nothing. May throw what they throw.
    std::string complaint(const std::shared_ptr<const Registry>& registry) const {
        const transport::SerializerBase& serializer = *registry->find(set->serializer);
        if (direction == Direction::Write) {
            return transport::writtenFrames(serializer, sample->object, registry) == frames
                       ? ""
                       : set->serializer + " wrote other bytes for " + sample->name;
        }
        const samples::Object object = samples::read(serializer, frames.back().index, transport::makeMessage(frames),
                                                     registry, transport::SerializationContext());
        return set->describe(object, samples::View::AsIs) == text
                   ? ""
                   : set->serializer + " read another object for " + sample->name;
    }
};

// Those of all samples of a set, as the golden files have them: nothing is converted for it.
std::vector<Conversion> conversions(const samples::SampleSet& set, Direction direction) {
    std::vector<Conversion> all;
    const auto golden = goldens::parse(test_support::contentOf(goldens::fileOf(set.serializer)));
    for (const samples::Sample& sample : set.samples) {
        all.push_back(
            {&set, &sample, direction, golden.at(sample.name), set.describe(sample.object, samples::View::AfterTrip)});
    }
    return all;
}

// Calls `work(number)` on as many threads as share the serializers. Returns what the first of them complained about, or
// threw; "" for nothing.
template <class Work>
std::string complaintOfThreads(const Work& work) {
    std::array<std::string, sharers> complaints;
    std::vector<std::thread> threads;
    for (std::size_t number = 0; number < sharers; ++number) {
        threads.emplace_back([&work, &complaints, number] {
            try {
                complaints[number] = work(number);
            } catch (const std::exception& error) {
                complaints[number] = error.what();
            }
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    for (const std::string& complaint : complaints) {
        if (!complaint.empty()) {
            return complaint;
        }
    }
    return "";
}

// All threads register the protocol, then make serializers, then convert for the first time in the process, each of
// these at the same moment.
std::string complaintOfFirstUses(const samples::SampleSet& set, Direction direction) {
    const std::vector<Conversion> all = conversions(set, direction);
    std::array<std::shared_ptr<Registry>, sharers> registries;
    std::barrier together(sharers);
    return complaintOfThreads([&](std::size_t number) -> std::string {
        together.arrive_and_wait();
        KrutilProtocol::init();
        const auto protocol = ProtocolRegistry::getRegistry()->find("krutil");
        registries[number] = std::make_shared<Registry>();
        together.arrive_and_wait();
        protocol.initialize(registries[number], KrutilProtocol::protocolVersion, {{"ZEROCOPY", "enable"}});
        together.arrive_and_wait();
        for (const Conversion& each : all) {
            const std::string complaint = each.complaint(registries[0]);
            if (!complaint.empty()) {
                return complaint;
            }
        }
        return "";
    });
}

[[noreturn]] void exitAfterFirstUses(const samples::SampleSet& set, Direction direction) {
    const std::string complaint = complaintOfFirstUses(set, direction);
    std::fprintf(stderr, "<%s>\n", complaint.c_str());
    std::_Exit(complaint.empty() ? 0 : 1);
}

// "threadsafe" makes a fresh process of each, in which nothing was used before.
TEST(SharedSerializersDeathTest, FirstUsesByManyThreadsAtOnce) {
    testing::FLAGS_gtest_death_test_style = "threadsafe";
    for (const samples::SampleSet& set : samples::sampleSets()) {
        EXPECT_EXIT(exitAfterFirstUses(set, Direction::Write), testing::ExitedWithCode(0), "<>") << set.serializer;
        EXPECT_EXIT(exitAfterFirstUses(set, Direction::Read), testing::ExitedWithCode(0), "<>") << set.serializer;
    }
}

TEST(SharedSerializersTest, ConversionsOfManyThreadsAreThoseOfOne) {
    std::vector<Conversion> all;
    for (const samples::SampleSet& set : samples::sampleSets()) {
        for (const Direction direction : {Direction::Write, Direction::Read}) {
            std::ranges::move(conversions(set, direction), std::back_inserter(all));
        }
    }
    const std::shared_ptr<const Registry> registry = transport::sessionRegistry();
    for (const Conversion& each : all) {
        ASSERT_EQ(each.complaint(registry), "");
    }
    // Each thread begins elsewhere, so that most of the time they do different things.
    EXPECT_EQ(complaintOfThreads([&](std::size_t number) -> std::string {
                  std::size_t next = number * all.size() / sharers;
                  for (int left = calls / sharers; left > 0; --left) {
                      const std::string complaint = all[next++ % all.size()].complaint(registry);
                      if (!complaint.empty()) {
                          return complaint;
                      }
                  }
                  return "";
              }),
              "");
}

}  // namespace
