// Sessions without an engine: what the layers below cost.

#include <cstddef>
#include <memory>
#include <string>
#include <utility>

#include "engine/EngineClient.hpp"
#include "engine/Questions.hpp"
#include "engine/RawPeer.hpp"
#include "engine/SessionPeer.hpp"
#include "krutil/session/EngineProcess.hpp"
#include "peers/RoundTripPeers.hpp"

namespace bench {
namespace {

constexpr std::size_t largestMessage = std::size_t{4} << 20;

std::shared_ptr<EngineClient> sessionClient(bool counting) {
    return std::make_shared<EngineClient>(krutil_client::EngineProcess::start({"/proc/self/exe", sessionPeerArgument}),
                                          session::Limits(), counting);
}

Contender requests(std::size_t characters) {
    return {"krutil", [client = sessionClient(false),
                       request = EngineClient::evaluation(std::string(characters, 'x'))](std::size_t count) {
                for (std::size_t i = 0; i < count; ++i) {
                    client->send(request);
                    client->awaitAll();
                }
            }};
}

// A request with a command of so many characters, and its reply.
void messageSizes(const Effort& effort) {
    for (const std::size_t characters : sizes(effort, 16, largestMessage, 4)) {
        const auto counted = sessionClient(true);
        counted->send(std::string(characters, 'x'));
        counted->awaitAll();
        const Bytes bytes = counted->takeBytes();
        Contest contest{
            "", static_cast<double>(characters), {rawRoundTrips(bytes.there, bytes.back), requests(characters)}};
        for (Contender& peer : peerRoundTrips(bytes.there, bytes.back)) {
            contest.contenders.push_back(std::move(peer));
        }
        hold(contest, effort);
    }
}

}  // namespace

std::vector<Question> messageQuestions() {
    return {{"message-sizes", messageSizes}};
}

}  // namespace bench
