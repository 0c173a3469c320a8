// Calls with arrays, over the socket and in shared memory.

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <memory>
#include <stdexcept>
#include <string>
#include <utility>

#include "engine/EngineClient.hpp"
#include "engine/Questions.hpp"
#include "engine/RawPeer.hpp"
#include "foundation/korveldata/ArrayFactory.hpp"
#include "peers/RoundTripPeers.hpp"

namespace bench {
namespace {

using foundation::korveldata::Array;
using foundation::korveldata::ArrayFactory;
using foundation::korveldata::ElementType;

constexpr std::size_t KiB = std::size_t{1} << 10;
constexpr std::size_t MiB = KiB << 10;
constexpr std::size_t answerBytes = 200;  // of a reply without outputs, roughly

enum class Way { There, Read, ThereAndBack };

Array arrayOf(std::size_t bytes) {
    Array array = ArrayFactory().createArray(ElementType::UInt8, {bytes});
    char* const elements = array.mutableData();
    for (std::size_t i = 0; i < bytes; ++i) {
        elements[i] = static_cast<char>(i % 251);
    }
    return array;
}

bool equal(const Array& left, const Array& right) {
    return left.sizeInBytes() == right.sizeInBytes() && std::memcmp(left.data(), right.data(), left.sizeInBytes()) == 0;
}

// A client to an engine that has the functions, and whose limits are no hindrance.
std::shared_ptr<EngineClient> callingClient(bool sharedMemory) {
    session::Limits limits;
    limits.message = std::uint64_t{16} << 30;
    auto client = std::make_shared<EngineClient>(
        std::vector<std::string>{"--limit-message", "16GiB", "--max-queued-bytes", "16GiB"}, limits, false,
        sharedMemory);
    client->evaluate(
        "def take(array): pass\n"
        "def read(array): array[::64].max()\n"
        "def back(array): return array\n"
        "def last(array): return array[-1000:]\n",
        "");
    return client;
}

// Calls of a function with an array. What the engine has of it, and what comes back, is looked at before.
Contender calls(const std::shared_ptr<EngineClient>& client, const Array& array, Way way) {
    const auto end = client->call("last", {array}, 1);
    const std::size_t seen = std::min<std::size_t>(1000, array.sizeInBytes());
    if (end.at(0).sizeInBytes() != seen ||
        std::memcmp(end[0].data(), array.data() + array.sizeInBytes() - seen, seen) != 0) {
        throw std::runtime_error("array: its last bytes are others in the engine");
    }
    // More than once: the first result of a size and those that follow come in different memory.
    for (int i = 0; way == Way::ThereAndBack && i < 3; ++i) {
        if (!equal(client->call("back", {array}, 1).at(0), array)) {
            throw std::runtime_error("array: what came back is not what was sent");
        }
    }
    return {"krutil", [client, array, way](std::size_t count) {
                EngineClient::Arrays outputs;
                for (std::size_t i = 0; i < count; ++i) {
                    outputs.clear();
                    if (way == Way::ThereAndBack) {
                        outputs = client->call("back", {array}, 1);
                    } else {
                        client->send(way == Way::There ? "take" : "read", {array});
                        client->awaitAll();
                    }
                }
                if (way == Way::ThereAndBack && outputs.at(0).sizeInBytes() != array.sizeInBytes()) {
                    throw std::runtime_error("array: what came back has another size");
                }
            }};
}

Contender calls(const Array& array, Way way) {
    return calls(callingClient(false), array, way);
}

// The array is made when there is somebody to share it with.
Contender sharedCalls(std::size_t bytes, Way way) {
    const auto client = callingClient(true);
    return calls(client, arrayOf(bytes), way);
}

Contender rawArrays(const Array& array, Way way) {
    return {"raw", [peer = std::make_shared<RawPeer>(), array, way](std::size_t count) {
                const auto size = static_cast<std::size_t>(array.sizeInBytes());
                for (std::size_t i = 0; i < count; ++i) {
                    peer->roundTrip(array.data(), size, way == Way::ThereAndBack ? size : answerBytes);
                }
            }};
}

// With the library and with what people use instead.
void holdAll(const std::string& label, const Array& array, Way way, const Effort& effort) {
    Contest contest{label, {}, {rawArrays(array, way), calls(array, way)}};
    const auto size = static_cast<std::size_t>(array.sizeInBytes());
    for (Contender& peer : peerRoundTrips(size, way == Way::There ? answerBytes : size)) {
        contest.contenders.push_back(std::move(peer));
    }
    hold(contest, effort);
}

void arrays(const Effort& effort) {
    for (const auto& [size, name] : {std::pair{MiB, "1 MiB"}, std::pair{64 * MiB, "64 MiB"}}) {
        if (size <= effort.largest) {
            const Array array = arrayOf(size);
            holdAll(name + std::string(" to the engine"), array, Way::There, effort);
            holdAll(name + std::string(" there and back"), array, Way::ThereAndBack, effort);
        }
    }
}

void sharedArrays(const Effort& effort) {
    for (const auto& [size, name] : {std::pair{MiB, "1 MiB"}, std::pair{64 * MiB, "64 MiB"}}) {
        if (size <= effort.largest) {
            const Array array = arrayOf(size);
            for (const auto& [way, what] :
                 {std::pair{Way::There, " to the engine"}, std::pair{Way::Read, " to the engine, which reads it"},
                  std::pair{Way::ThereAndBack, " there and back"}}) {
                hold({name + std::string(what), {}, {rawArrays(array, way), sharedCalls(size, way)}}, effort);
            }
        }
    }
}

void arraySizes(const Effort& effort) {
    for (const std::size_t size : sizes(effort, KiB, effort.largest, 4)) {
        const Array array = arrayOf(size);
        hold({"to the engine", static_cast<double>(size), {rawArrays(array, Way::There), calls(array, Way::There)}},
             effort);
    }
}

void smallCall(const Effort& effort) {
    const auto client = std::make_shared<EngineClient>();
    hold({"",
          {},
          {{"evaluation",
            [client, request = EngineClient::evaluation("1+1")](std::size_t count) {
                for (std::size_t i = 0; i < count; ++i) {
                    client->evaluate(request, "2\n");
                }
            }},
           calls(arrayOf(KiB), Way::ThereAndBack)}},
         effort);
}

}  // namespace

std::vector<Question> arrayQuestions() {
    return {{"call", smallCall}, {"arrays", arrays}, {"shared-arrays", sharedArrays}, {"array-sizes", arraySizes}};
}

}  // namespace bench
