#include "seeds/RecordedSession.hpp"

#include <fstream>
#include <future>
#include <iterator>
#include <limits>
#include <stdexcept>
#include <utility>
#include <variant>

#include "common/Recording.hpp"
#include "input/SessionEnds.hpp"
#include "samples/Samples.hpp"

namespace fuzz {
namespace {

// What one end reads.
class ReadBytes final : public session::SessionRecorder {
  public:
    void record(Direction direction, Part /*part*/, std::span<const iovec> unit) noexcept override {
        for (const iovec& piece : unit) {
            if (direction == Direction::Received) {
                bytes.append(static_cast<const char*>(piece.iov_base), piece.iov_len);
            }
        }
    }

    std::string bytes;
};

// Gives what it is told to two recorders.
class BothRecorders final : public session::SessionRecorder {
  public:
    BothRecorders(SessionRecorder& one, SessionRecorder& other) : one_(one), other_(other) {}

    void record(Direction direction, Part part, std::span<const iovec> unit) noexcept override {
        one_.record(direction, part, unit);
        other_.record(direction, part, unit);
    }

  private:
    SessionRecorder& one_;
    SessionRecorder& other_;
};

// The first samples of a type.
template <class Ptr, class Action>
void forSamples(const char* serializer, const Action& action) {
    const auto& all = samples::sampleSet(serializer).samples;
    for (std::size_t i = 0; i < std::min<std::size_t>(all.size(), 3); ++i) {
        action(std::get<boost::shared_ptr<const Ptr>>(all[i].object));
    }
}

}  // namespace

RecordedSession recordSession(const std::filesystem::path& folder) {
    const std::filesystem::path path = folder / "session";
    ReadBytes client;
    ReadBytes engine;
    {
        apps::Recording recording({path.string(), std::numeric_limits<std::uint64_t>::max(), 0},
                                  [](const std::string& why) { throw std::runtime_error(why); });
        recording.setClock([] { return timespec{1'700'000'000, 0}; });
        recording.beginSession(session::Role::Client, "krutil 0");
        BothRecorders both(client, recording);
        SocketPair sockets;
        const auto open = [](int socket, session::Role role, session::SessionRecorder& recorder) {
            session::SessionConfig config = configOf(role);
            config.recorder = &recorder;
            return session::Session::open(socket, socket, std::move(config));
        };
        auto opening = std::async(std::launch::async, open, sockets.near.release(), session::Role::Client,
                                  std::ref<session::SessionRecorder>(both));
        const auto engineEnd = open(sockets.far.release(), session::Role::Engine, engine);
        const auto clientEnd = opening.get();
        Witness atClient;
        Witness atEngine;
        clientEnd->start(atClient);
        engineEnd->start(atEngine);
        const auto stream = clientEnd->newStreamID();
        bool first = true;
        forSamples<exchange::Message>("krutil:IIPEnqueueMessage", [&](const auto& message) {
            clientEnd->send(std::exchange(first, false) ? stream : clientEnd->newStreamID(), message);
        });
        clientEnd->sayGoodbye();
        atEngine.waitForLastWord();
        forSamples<eventmgr::BaseEvent>("krutil:TextBaseEvent",
                                        [&](const auto& event) { engineEnd->send(stream, event); });
        forSamples<eventmgr::BaseEvent>("krutil:IIPStartedEvent",
                                        [&](const auto& event) { engineEnd->send(stream, event); });
        engineEnd->send(stream, std::get<boost::shared_ptr<const exchange::Reply>>(
                                    samples::sampleSet("krutil:IIPReply").samples.front().object));
        engineEnd->send(0, std::get<boost::shared_ptr<const eventmgr::BaseEvent>>(
                               samples::sampleSet("krutil:QVMShutdownEvent").samples.front().object));
        engineEnd->close();
        atClient.waitForEnd();
    }
    std::ifstream file(path, std::ios::binary);
    RecordedSession recorded{std::move(client.bytes),
                             std::move(engine.bytes),
                             {std::istreambuf_iterator<char>(file), std::istreambuf_iterator<char>()}};
    std::filesystem::remove(path);
    return recorded;
}

}  // namespace fuzz
