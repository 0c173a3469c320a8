// krutil_codec_instructions [PART]: runs every way of every codec sample, each within a part of its own, so that
// callgrind can count the instructions of each part. Without callgrind it runs them for nothing. With a name it runs
// that part alone, for a profile.

#include <valgrind/callgrind.h>

#include <cstdio>
#include <string>
#include <vector>

#include "codec/CodecSamples.hpp"

namespace bench {
namespace {

constexpr int rounds = 100;

// Counts what `once` does in rounds 2 to 100; the first one fills what is kept from call to call. `prepare` makes what
// `once` consumes and is not counted.
template <class Prepare, class Once>
void count(const char* only, const std::string& part, const Prepare& prepare, const Once& once) {
    if (only != nullptr && part != only) {
        return;
    }
    for (int i = 0; i < rounds; ++i) {
        const auto prepared = prepare();
        if (i > 0) {
            CALLGRIND_TOGGLE_COLLECT;
        }
        once(prepared);
        if (i > 0) {
            CALLGRIND_TOGGLE_COLLECT;
        }
    }
    CALLGRIND_DUMP_STATS_AT(part.c_str());
}

void run(const char* only) {
    const std::shared_ptr<transport::MessageStream> stream = std::make_shared<DroppingStream>();
    const TakeBytes take = [](const char*, std::size_t) {};
    const auto nothing = [] { return 0; };
    for (const CodecSample& sample : codecSamples()) {
        const auto receive = [&] { return transport::makeMessage(sample.frames); };
        count(only, "serialize/" + sample.name, nothing, [&](int) { sample.serialize(stream); });
        count(only, "serialize/" + sample.name + "/baseline", nothing, [&](int) { sample.serializeBare(take); });
        count(only, "deserialize/" + sample.name, receive, [&](const auto& message) { sample.deserialize(message); });
        count(only, "deserialize/" + sample.name + "/baseline", receive,
              [&](const auto& message) { sample.deserializeBare(*message); });
    }
}

}  // namespace
}  // namespace bench

int main(int argc, char** argv) {
    bench::run(argc > 1 ? argv[1] : nullptr);
    return 0;
}
