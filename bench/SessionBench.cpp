#include "SessionBench.hpp"

#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <boost/make_shared.hpp>
#include <cerrno>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <system_error>
#include <thread>
#include <utility>
#include <vector>

#include "Comparison.hpp"
#include "KrutilProtocol.hpp"
#include "cmddistributor/EvalIIP.hpp"
#include "cmddistributor/FEvalIIP.hpp"
#include "cmddistributor/IIPEnqueueMessage.hpp"
#include "foundation/korveldata/ArrayFactory.hpp"
#include "foundation/msg_svc/transport/layers/session/Session.hpp"
#include "krutil/cmddistributor/IIPReply.hpp"
#include "krutil/io/TextBaseEvent.hpp"

namespace bench {
namespace {

namespace korveldata = foundation::korveldata;
namespace session = foundation::msg_svc::transport::layers::session;
namespace eventmgr = foundation::msg_svc::eventmgr;
namespace exchange = foundation::msg_svc::exchange;
namespace framing = foundation::vantor::carrier::framing;
using exchange::IDType;

constexpr std::size_t textsInABurst = 1'000;
const IDType requestID(1, 2);

std::array<int, 2> socketPair() {
    std::array<int, 2> ends{};
    if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends.data()) != 0) {
        throw std::system_error(errno, std::generic_category(), "socketpair");
    }
    return ends;
}

// Counts what arrives at one end; the other thread waits for a count.
class Counter : public session::SessionHandler {
  public:
    void onReply(framing::StreamID /*stream*/, const boost::shared_ptr<const exchange::Reply>& /*reply*/) override {
        add();
    }
    void onEvent(framing::StreamID /*stream*/, const boost::shared_ptr<const eventmgr::BaseEvent>& /*event*/) override {
        add();
    }
    void onEnd(const session::SessionEnd& /*end*/) override {}

    void waitFor(std::uint64_t count) const {
        for (auto seen = count_.load(); seen < count; seen = count_.load()) {
            count_.wait(seen);
        }
    }

  private:
    void add() {
        ++count_;
        count_.notify_one();
    }

    std::atomic<std::uint64_t> count_{0};
};

// An engine that does to each request what it is told to.
class Server : public session::SessionHandler {
  public:
    std::function<void(framing::StreamID)> serve;

    void onMessage(framing::StreamID stream, const boost::shared_ptr<const exchange::Message>& /*message*/) override {
        serve(stream);
    }
    void onEnd(const session::SessionEnd& /*end*/) override {}
};

// A client and an engine in this process.
class Ends {
  public:
    Ends() {
        krutil::protobuf::KrutilProtocol::init();
        const auto sockets = socketPair();
        std::thread opening([&] { client = open(sockets[0], session::Role::Client); });
        engine = open(sockets[1], session::Role::Engine);
        opening.join();
        server.serve = [this](framing::StreamID stream) { reply(stream); };
        client->start(arrived);
        engine->start(server);
    }

    ~Ends() {
        client.reset();
        engine.reset();
    }
    Ends(const Ends&) = delete;
    Ends& operator=(const Ends&) = delete;

    void ask(const boost::shared_ptr<const cmddistributor::IIP>& request) const {
        client->send(
            client->newStreamID(),
            boost::shared_ptr<const exchange::Message>(boost::make_shared<const cmddistributor::IIPEnqueueMessage>(
                request, requestID, 3, boost::none, nullptr, krutil::cmddistributor::WhenToDequeue::DEQUEUE_AT_IDLE,
                u"name", capabilities::CapabilityList(), nullptr, false)));
    }

    void reply(framing::StreamID stream) const {
        engine->send(
            stream, boost::shared_ptr<const exchange::Reply>(boost::make_shared<const krutil::cmddistributor::IIPReply>(
                        requestID, std::make_unique<cmddistributor::IIPResult>(requestID, boost::none))));
    }

    Counter arrived;
    Server server;
    std::unique_ptr<session::Session> client;
    std::unique_ptr<session::Session> engine;

  private:
    static std::unique_ptr<session::Session> open(int socket, session::Role role) {
        session::SessionConfig config;
        config.role = role;
        config.protocol = krutil::protobuf::KrutilProtocol::protocolName;
        config.version = krutil::protobuf::KrutilProtocol::protocolVersion;
        return session::Session::open(socket, ::dup(socket), std::move(config));
    }
};

void writeAll(int socket, const char* data, std::size_t size) {
    while (size > 0) {
        const auto written = ::write(socket, data, size);
        if (written <= 0) {
            throw std::system_error(errno, std::generic_category(), "write");
        }
        data += written;
        size -= static_cast<std::size_t>(written);
    }
}

// False at the end of the stream.
bool readAll(int socket, char* data, std::size_t size) {
    while (size > 0) {
        const auto got = ::read(socket, data, size);
        if (got <= 0) {
            return false;
        }
        data += got;
        size -= static_cast<std::size_t>(got);
    }
    return true;
}

// A socket pair with a thread at its other end, which runs `serve` until that returns false.
class RawPeer {
  public:
    explicit RawPeer(std::function<bool(int socket)> serve)
        : sockets_(socketPair()), thread_([this, serve = std::move(serve)] {
              while (serve(sockets_[1])) {
              }
          }) {}
    ~RawPeer() {
        ::shutdown(sockets_[0], SHUT_RDWR);
        thread_.join();
        ::close(sockets_[0]);
        ::close(sockets_[1]);
    }
    RawPeer(const RawPeer&) = delete;
    RawPeer& operator=(const RawPeer&) = delete;

    int socket() const { return sockets_[0]; }

  private:
    std::array<int, 2> sockets_;
    std::thread thread_;
};

boost::shared_ptr<const cmddistributor::IIP> evaluation() {
    return boost::make_shared<const cmddistributor::EvalIIP>(
        "eval", cmddistributor::IqmStreamID::ekIqmCmdWinStream, nullptr, krutil::io::SinkTraits(),
        krutil::io::SinkTraits(), u"print(6 * 7)", cmddistributor::CodeType::CodeBlockType);
}

boost::shared_ptr<const eventmgr::BaseEvent> text() {
    return boost::make_shared<const krutil::io::TextBaseEvent>(requestID, krutil::io::StreamTypeEnum::OUTPUT_STREAM,
                                                               u"a line of text as programs print them, 12345\n");
}

// Bytes that `action` has one end write.
template <class Action>
std::size_t bytesOf(const session::Session& end, const Action& action) {
    const auto before = end.traffic().written;
    action();
    return static_cast<std::size_t>(end.traffic().written - before);
}

void addRoundTrip() {
    std::size_t there = 0;
    std::size_t back = 0;
    {
        const Ends ends;
        there = bytesOf(*ends.client, [&] {
            back = bytesOf(*ends.engine, [&] {
                ends.ask(evaluation());
                ends.arrived.waitFor(1);
                ends.engine->waitUntilWritten();
            });
        });
    }
    compare(
        "session/round trip", Clock::Wall,
        [](benchmark::State& state) {
            const Ends ends;
            const auto request = evaluation();
            std::uint64_t expected = 0;
            for (auto _ : state) {
                ends.ask(request);
                ends.arrived.waitFor(++expected);
            }
        },
        [there, back](benchmark::State& state) {
            const RawPeer peer(
                [there, back, in = std::string(there, 'x'), out = std::string(back, 'x')](int socket) mutable {
                    if (!readAll(socket, in.data(), there)) {
                        return false;
                    }
                    writeAll(socket, out.data(), back);
                    return true;
                });
            const std::string out(there, 'x');
            std::string in(back, 'x');
            for (auto _ : state) {
                writeAll(peer.socket(), out.data(), there);
                readAll(peer.socket(), in.data(), back);
            }
        });
}

void addText() {
    std::size_t size = 0;
    {
        const Ends ends;
        size = bytesOf(*ends.engine, [&] {
            ends.engine->send(0, text());
            ends.engine->waitUntilWritten();
        });
    }
    compare(
        "session/text", Clock::Wall,
        [](benchmark::State& state) {
            const Ends ends;
            const auto event = text();
            std::uint64_t expected = 0;
            for (auto _ : state) {
                for (std::size_t i = 0; i < textsInABurst; ++i) {
                    ends.engine->send(0, event);
                    ends.engine->waitForRoom();
                }
                expected += textsInABurst;
                ends.arrived.waitFor(expected);
            }
        },
        [size](benchmark::State& state) {
            const std::size_t burst = size * textsInABurst;
            const RawPeer peer([burst, piece = std::string(1U << 16, 'x')](int socket) mutable {
                for (std::size_t left = burst; left > 0;) {
                    const auto got = ::read(socket, piece.data(), std::min(piece.size(), left));
                    if (got <= 0) {
                        return false;
                    }
                    left -= static_cast<std::size_t>(got);
                }
                writeAll(socket, "x", 1);
                return true;
            });
            const std::string event(size, 'x');
            char answer = 0;
            for (auto _ : state) {
                for (std::size_t i = 0; i < textsInABurst; ++i) {
                    writeAll(peer.socket(), event.data(), event.size());
                }
                readAll(peer.socket(), &answer, 1);
            }
        });
}

void addArray(std::size_t bytes) {
    compare(
        "session/array/" + std::to_string(bytes) + " bytes", Clock::Wall,
        [bytes](benchmark::State& state) {
            using cmddistributor::FEvalIIP;
            const Ends ends;
            const auto array = korveldata::ArrayFactory().createArray(korveldata::ElementType::Double, {bytes / 8});
            std::uint64_t expected = 0;
            for (auto _ : state) {
                std::vector<korveldata::Array> arguments{array};
                ends.ask(boost::make_shared<const FEvalIIP>(
                    "eval", "f", 1UL,
                    FEvalIIP::Data::makeClientSideData(krutil::cmddistributor::EDIDataWrapper(std::move(arguments))),
                    cmddistributor::IqmStreamID::ekIqmCmdWinStream, krutil::io::SinkTraits(), krutil::io::SinkTraits(),
                    krutil::contextmgr::QvmID{1}, krutil::contextmgr::QvmID{2}, true));
                ends.arrived.waitFor(++expected);
            }
        },
        [bytes](benchmark::State& state) {
            const RawPeer peer([bytes](int socket) {
                const std::unique_ptr<char[]> received(new char[bytes]);
                if (!readAll(socket, received.get(), bytes)) {
                    return false;
                }
                writeAll(socket, "x", 1);
                return true;
            });
            const std::vector<char> array(bytes);
            char answer = 0;
            for (auto _ : state) {
                writeAll(peer.socket(), array.data(), bytes);
                readAll(peer.socket(), &answer, 1);
            }
        });
}

}  // namespace

void addSessionBenches() {
    addRoundTrip();
    addText();
    for (const std::size_t bytes : {std::size_t{1} << 12, std::size_t{1} << 20, std::size_t{1} << 26}) {
        addArray(bytes);
    }
}

}  // namespace bench
