// Evaluations, one after the other and many at once.

#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <memory>
#include <string>
#include <system_error>
#include <vector>

#include "engine/EngineClient.hpp"
#include "engine/ListeningEngine.hpp"
#include "engine/Questions.hpp"
#include "engine/RawPeer.hpp"
#include "foundation/core/posix/OwnedDescriptor.hpp"

namespace bench {
namespace {

using foundation::core::posix::OwnedDescriptor;

constexpr const char* sum = "1+1";
constexpr const char* sumText = "2\n";

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

Contender roundTripsLike(const std::string& code) {
    const Bytes bytes = bytesOf(code);
    return rawRoundTrips(bytes.there, bytes.back);
}

Contender evaluation(const std::string& name, const std::shared_ptr<EngineClient>& client, const std::string& code,
                     const std::string& expected) {
    return {name, [client, request = EngineClient::evaluation(code), expected](std::size_t count) {
                for (std::size_t i = 0; i < count; ++i) {
                    client->evaluate(request, expected);
                }
            }};
}

void evaluations(const Effort& effort) {
    hold({"", {}, {roundTripsLike(sum), evaluation("krutil", std::make_shared<EngineClient>(), sum, sumText)}}, effort);
}

// Two contenders that are the same: their ratio is 1 within its spread, or the harness is wrong.
void nullCase(const Effort& effort) {
    hold({"", {}, {rawRoundTrips(200, 500), rawRoundTrips(200, 500, "raw again")}}, effort);
}

// So many requests are sent before the first answer is waited for.
Contender burst(std::size_t requests) {
    return {"krutil",
            [client = std::make_shared<EngineClient>(std::vector<std::string>{"--max-queued", "100000"}),
             request = EngineClient::evaluation("pass"), requests](std::size_t count) {
                for (std::size_t i = 0; i < count; ++i) {
                    for (std::size_t sent = 0; sent < requests; ++sent) {
                        client->send(request);
                    }
                    client->awaitAll();
                }
            },
            requests};
}

void bursts(const Effort& effort) {
    hold({"", {}, {roundTripsLike("pass"), burst(1'000)}}, effort);
}

void queueLengths(const Effort& effort) {
    for (const std::size_t requests : sizes(effort, 1, 100'000, 10)) {
        hold({"", static_cast<double>(requests), {roundTripsLike("pass"), burst(requests)}}, effort);
    }
}

// Writes of 16 bytes to a socket. What fills it is read in one piece, which counts.
Contender smallWrites() {
    std::array<int, 2> ends{};
    if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends.data()) != 0) {
        throw std::system_error(errno, std::generic_category(), "socketpair");
    }
    return {"write", [in = std::make_shared<OwnedDescriptor>(ends[0]),
                      out = std::make_shared<OwnedDescriptor>(ends[1])](std::size_t count) {
                std::array<char, 16> line{};
                std::array<char, 64 * line.size()> piece{};
                for (std::size_t unread = 0; count-- > 0;) {
                    unread += static_cast<std::size_t>(::write(out->get(), line.data(), line.size()));
                    if (unread >= piece.size() || count == 0) {
                        unread -= static_cast<std::size_t>(::read(in->get(), piece.data(), piece.size()));
                    }
                }
            }};
}

void lines(const Effort& effort) {
    constexpr std::size_t count = 10'000;
    std::string expected;
    for (std::size_t i = 0; i < count; ++i) {
        expected += "line " + std::to_string(i) + '\n';
    }
    Contender printing = evaluation("krutil", std::make_shared<EngineClient>(),
                                    "for i in range(" + std::to_string(count) + "): print('line', i)", expected);
    printing.units = count;
    hold({"", {}, {smallWrites(), printing}}, effort);
}

// An error with so many causes, each raised in its turn.
void causes(const Effort& effort) {
    const auto client = std::make_shared<EngineClient>();
    client->evaluate(
        "def chain(causes):\n"
        "    error = ValueError('the first')\n"
        "    for i in range(causes):\n"
        "        try:\n"
        "            raise error\n"
        "        except ValueError as cause:\n"
        "            error = ValueError('because of the one before')\n"
        "            error.__cause__ = cause\n"
        "    raise error\n",
        "");
    // The first errors of a session take longer than those that follow.
    constexpr int warming = 300;
    for (int i = 0; i < warming; ++i) {
        client->fail("chain(0)", "ValueError");
    }
    std::vector<std::size_t> numbers = sizes(effort, 1, 64, 2);
    numbers.insert(numbers.begin(), 0);
    for (const std::size_t number : numbers) {
        hold({"",
              static_cast<double>(number),
              {evaluation("evaluation", std::make_shared<EngineClient>(), sum, sumText),
               {"krutil",
                [client, code = "chain(" + std::to_string(number) + ")"](std::size_t count) {
                    for (std::size_t i = 0; i < count; ++i) {
                        client->fail(code, "ValueError");
                    }
                }}}},
             effort);
    }
}

// Sessions of one engine that all evaluate at the same time, beside as many raw peers.
void sessions(const Effort& effort) {
    const Bytes bytes = bytesOf(sum);
    const ListeningEngine engine;
    std::vector<std::shared_ptr<EngineClient>> clients;
    std::vector<std::shared_ptr<RawPeer>> peers;
    for (const std::size_t number : sizes(effort, 1, 64, 2)) {
        while (clients.size() < number) {
            clients.push_back(std::make_shared<EngineClient>(engine.connect()));
            peers.push_back(std::make_shared<RawPeer>());
        }
        const Contender raw{"raw",
                            [&peers, data = std::string(bytes.there, 'x'), back = bytes.back](std::size_t count) {
                                for (std::size_t i = 0; i < count; ++i) {
                                    for (const auto& peer : peers) {
                                        peer->send(data.data(), data.size(), back);
                                    }
                                    for (const auto& peer : peers) {
                                        peer->receive(back);
                                    }
                                }
                            },
                            number};
        const Contender ours{"krutil",
                             [&clients, request = EngineClient::evaluation(sum)](std::size_t count) {
                                 for (std::size_t i = 0; i < count; ++i) {
                                     for (const auto& client : clients) {
                                         client->send(request);
                                     }
                                     for (const auto& client : clients) {
                                         client->awaitAll();
                                     }
                                 }
                             },
                             number};
        hold({"", static_cast<double>(number), {raw, ours}}, effort);
    }
}

}  // namespace

std::vector<Question> evaluationQuestions() {
    return {{"null", nullCase},    {"evaluation", evaluations},     {"burst", bursts},
            {"lines", lines},      {"queue-lengths", queueLengths}, {"causes", causes},
            {"sessions", sessions}};
}

}  // namespace bench
