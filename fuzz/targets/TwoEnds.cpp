// A client and an engine with a relay between them that damages what passes. The input says, in steps of three bytes,
// what the ends send and what the relay does: forward, drop, flip, repeat, reorder, cut. Without damage everything
// arrives; with any, both sessions end, once each.

#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdint>
#include <exception>
#include <future>
#include <memory>
#include <string>
#include <utility>
#include <variant>

#include "foundation/msg_svc/transport/layers/session/SessionError.hpp"
#include "input/Require.hpp"
#include "input/SessionEnds.hpp"
#include "samples/Samples.hpp"

namespace {

using fuzz::require;
namespace session = fuzz::session;

// What a relay holds of one direction.
struct Direction {
    int from;
    int to;
    std::string held;

    // What has come.
    void collect() {
        std::array<char, 65'536> bytes;
        ssize_t got = 0;
        while ((got = ::recv(from, bytes.data(), bytes.size(), MSG_DONTWAIT)) > 0) {
            held.append(bytes.data(), static_cast<std::size_t>(got));
        }
    }

    // A receiver that has ended takes no more.
    void forward() {
        std::size_t sent = 0;
        while (sent < held.size()) {
            const ssize_t took = ::send(to, held.data() + sent, held.size() - sent, MSG_NOSIGNAL);
            if (took < 0 && errno != EINTR) {
                break;
            }
            sent += static_cast<std::size_t>(std::max<ssize_t>(took, 0));
        }
        held.clear();
    }

    // Exactly so many bytes of the handshake. The clock that watches a search interrupts what waits.
    std::string read(std::size_t size) const {
        std::string bytes(size, '\0');
        std::size_t done = 0;
        while (done < size) {
            const ssize_t got = ::recv(from, bytes.data() + done, size - done, 0);
            require(got > 0 || (got < 0 && errno == EINTR), "an end shakes hands");
            done += static_cast<std::size_t>(std::max<ssize_t>(got, 0));
        }
        return bytes;
    }

    // A head that ends in the size of what follows, as four bytes.
    void forwardSized(std::size_t head) {
        held = read(head);
        std::size_t size = 0;
        for (std::size_t i = 0; i < 4; ++i) {
            size |= static_cast<std::size_t>(static_cast<unsigned char>(held[head - 4 + i])) << (8 * i);
        }
        held += read(size);
        forward();
    }
};

class Ends {
  public:
    Ends() {
        auto opening = std::async(std::launch::async, [this] {
            return session::Session::open(client_.near.get(), client_.near.get(), configOf(session::Role::Client));
        });
        auto engineOpening = std::async(std::launch::async, [this] {
            return session::Session::open(engine_.near.get(), engine_.near.get(), configOf(session::Role::Engine));
        });
        for (const std::size_t head : {16U, 4U}) {
            toEngine.forwardSized(head);
            toClient.forwardSized(head);
        }
        client = opening.get();
        engine = engineOpening.get();
        client_.near.release();
        engine_.near.release();
        client->start(atClient);
        engine->start(atEngine);
    }

    // Nothing passes any more.
    void cut() {
        client_.far.reset();
        engine_.far.reset();
    }

  private:
    static session::SessionConfig configOf(session::Role role) {
        session::SessionConfig config = fuzz::configOf(role);
        config.keepAlive = std::chrono::milliseconds(0);
        return config;
    }

    fuzz::SocketPair client_;
    fuzz::SocketPair engine_;

  public:
    fuzz::Witness atClient;
    fuzz::Witness atEngine;
    std::unique_ptr<session::Session> client;
    std::unique_ptr<session::Session> engine;
    Direction toEngine{client_.far.get(), engine_.far.get(), {}};
    Direction toClient{engine_.far.get(), client_.far.get(), {}};
};

// One of the samples of a type.
template <class T>
const T& sampleOf(const char* serializer, unsigned number) {
    const auto& all = samples::sampleSet(serializer).samples;
    return std::get<T>(all[number % all.size()].object);
}

using MessagePtr = boost::shared_ptr<const fuzz::exchange::Message>;
using ReplyPtr = boost::shared_ptr<const fuzz::exchange::Reply>;
using EventPtr = boost::shared_ptr<const fuzz::eventmgr::BaseEvent>;

class Play {
  public:
    void step(unsigned what, unsigned a, unsigned b) {
        Direction& direction = (a & 1U) == 0 ? ends_.toEngine : ends_.toClient;
        switch (what % 11) {
            case 0:
                send(*ends_.client, ends_.toEngine, asked_,
                     [&](auto& end) { end.send(end.newStreamID(), request(b)); });
                break;
            case 1:
                send(*ends_.engine, ends_.toClient, answered_, [&](auto& end) { end.send(a % 4, event(b)); });
                break;
            case 2:
                send(*ends_.engine, ends_.toClient, answered_, [&](auto& end) { end.send(a % 4, reply(b)); });
                break;
            case 3:
                ends_.client->sayGoodbye();
                break;
            case 4:
                over_ = true;
                send(*ends_.engine, ends_.toClient, answered_,
                     [&](auto& end) { end.send(0, sampleOf<EventPtr>("krutil:QVMShutdownEvent", b)); });
                break;
            case 5:
                direction.collect();
                direction.forward();
                break;
            default:
                direction.collect();
                if (!direction.held.empty()) {
                    damage(direction, what % 11, a, b);
                }
        }
    }

    void finish() {
        for (Direction* direction : {&ends_.toEngine, &ends_.toClient}) {
            direction->collect();
            direction->forward();
        }
        ends_.cut();
        ends_.atEngine.waitForLastWord();
        ends_.engine->close(std::chrono::milliseconds(0));
        ends_.atEngine.waitForEnd();
        ends_.atClient.waitForEnd();
        ends_.client.reset();
        ends_.engine.reset();
        // Behind its shutdown event an engine does not listen.
        require(damaged_ || over_ || ends_.atEngine.arrived() == asked_, "an engine hears what was said");
        require(damaged_ || ends_.atClient.arrived() == answered_, "a client hears what was said");
    }

  private:
    static const MessagePtr& request(unsigned number) {
        return sampleOf<MessagePtr>("krutil:IIPEnqueueMessage", number);
    }
    static const EventPtr& event(unsigned number) { return sampleOf<EventPtr>("krutil:TextBaseEvent", number); }
    static const ReplyPtr& reply(unsigned number) { return sampleOf<ReplyPtr>("krutil:IIPReply", number); }

    // What the order of a session does not allow is not sent.
    template <class Action>
    void send(session::Session& end, Direction& direction, unsigned& count, const Action& action) {
        try {
            action(end);
            ++count;
            end.waitUntilWritten();
        } catch (const std::exception&) {
        }
        direction.collect();
    }

    void damage(Direction& direction, unsigned what, unsigned a, unsigned b) {
        damaged_ = true;
        std::string& held = direction.held;
        const std::size_t place = (a >> 1U | b << 7U) % held.size();
        switch (what) {
            case 6:
                held[place] = static_cast<char>(held[place] ^ (1 << (b & 7U)));
                break;
            case 7:
                held.erase(place, 1 + (b & 31U));
                break;
            case 8:
                held += std::string(held);
                break;
            case 9:
                std::rotate(held.begin(), held.begin() + static_cast<std::ptrdiff_t>(place), held.end());
                break;
            default:
                held.resize(place);
                direction.forward();
                ::shutdown(direction.to, SHUT_WR);
        }
    }

    Ends ends_;
    unsigned asked_ = 0;
    unsigned answered_ = 0;
    bool over_ = false;
    bool damaged_ = false;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    Play play;
    for (std::size_t i = 0; i + 3 <= std::min<std::size_t>(size, 96); i += 3) {
        play.step(data[i], data[i + 1], data[i + 2]);
    }
    play.finish();
    return 0;
}
