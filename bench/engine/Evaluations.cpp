// Evaluations, one after the other and many at once.

#include <memory>
#include <string>

#include "engine/EngineClient.hpp"
#include "engine/Questions.hpp"
#include "engine/RawPeer.hpp"

namespace bench {
namespace {

// What `code` takes on the stream. The engine has evaluated it before, so nothing is counted that comes but once.
Bytes bytesOf(const std::string& code) {
    EngineClient client({}, {}, true);
    for (int i = 0; i < 2; ++i) {
        client.takeBytes();
        client.send(code);
        client.awaitAll();
    }
    return client.takeBytes();
}

// A framed round trip of as many bytes.
Contender rawRoundTrip(const std::string& name, Bytes bytes) {
    return {name, [peer = std::make_shared<RawPeer>(), data = std::string(bytes.there, 'x'), bytes](std::size_t count) {
                for (std::size_t i = 0; i < count; ++i) {
                    peer->roundTrip(data.data(), bytes.there, bytes.back);
                }
            }};
}

Contender evaluation(const std::string& code, const std::string& expected) {
    return {"krutil", [client = std::make_shared<EngineClient>(), code, expected](std::size_t count) {
                for (std::size_t i = 0; i < count; ++i) {
                    client->evaluate(code, expected);
                }
            }};
}

void evaluations(const Effort& effort) {
    const Bytes bytes = bytesOf("1+1");
    hold({"", {}, {rawRoundTrip("raw", bytes), evaluation("1+1", "2\n")}}, effort);
}

// Two contenders that are the same: their ratio is 1 within its spread, or the harness is wrong.
void nullCase(const Effort& effort) {
    const Bytes bytes{200, 500};
    hold({"", {}, {rawRoundTrip("raw", bytes), rawRoundTrip("raw again", bytes)}}, effort);
}

}  // namespace

std::vector<Question> evaluationQuestions() {
    return {{"null", nullCase}, {"evaluation", evaluations}};
}

}  // namespace bench
