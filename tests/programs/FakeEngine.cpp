// An engine that does one thing wrong, for tests of the client: session_fake_engine SCENE [ARGUMENT...]
//
//   other-version         offers protocol version (2, 7) and a value of ZEROCOPY that nobody knows
//   cut BYTES COMMAND...  relays a session with the engine COMMAND, and ends after BYTES bytes to the client;
//                         with BYTES "count" relays all and writes their number to the file named next
//   leaves-its-stream     ends without an answer, while a process that it started keeps the stream open
//   ignores-goodbye       answers, and then neither shuts down nor ends
//   event TAG HEX         answers a request, with an event whose content is the request's identifier and these bytes
//   result TAG HEX        answers a request with a result whose content is that
//   anything else         shakes hands, waits for a request, and sends what the scene is named for
//
// Frames are put together here byte by byte, because no session would send them.

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <boost/make_shared.hpp>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <functional>
#include <future>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "cmddistributor/IIPEnqueueMessage.hpp"
#include "common/KrutilSession.hpp"
#include "foundation/msg_svc/transport/layers/session/FrameHeader.hpp"
#include "foundation/msg_svc/transport/layers/session/ProtocolRegistry.hpp"
#include "foundation/msg_svc/transport/layers/session/Session.hpp"
#include "krutil.protobuf.IIPReply.pb.h"
#include "krutil.protobuf.IIPResult.pb.h"
#include "krutil.protobuf.TextBaseEvent.pb.h"
#include "krutil/cmddistributor/IIPReply.hpp"

namespace {

namespace session = foundation::msg_svc::transport::layers::session;
namespace exchange = foundation::msg_svc::exchange;
namespace framing = foundation::vantor::carrier::framing;

constexpr auto object = framing::FrameType::Object;
constexpr auto control = framing::FrameType::Control;

void writeAll(int fd, const char* data, std::size_t size) {
    while (size > 0) {
        const auto written = ::write(fd, data, size);
        if (written > 0) {
            data += written;
            size -= static_cast<std::size_t>(written);
        } else if (errno == EAGAIN) {
            pollfd watched{fd, POLLOUT, 0};
            ::poll(&watched, 1, -1);
        } else if (errno != EINTR) {
            std::exit(1);
        }
    }
}

// One frame as bytes. A last frame ends its message.
std::string frame(session::FrameKind kind, bool last, framing::FrameType type, std::uint32_t stream,
                  std::uint64_t index, const std::string& tag, const std::string& content) {
    session::FrameHeader header;
    header.kind = static_cast<std::uint8_t>(kind);
    header.last = last;
    header.type = type;
    header.tagSize = static_cast<std::uint16_t>(tag.size());
    header.stream = stream;
    header.index = index;
    header.contentSize = content.size();
    const auto bytes = encode(header);
    return std::string(bytes.data(), bytes.size()) + tag + content;
}

std::string tagged(bool last, std::uint32_t stream, std::uint64_t index, const std::string& tag,
                   const std::string& content = {}, framing::FrameType type = object) {
    return frame(session::FrameKind::Tagged, last, type, stream, index, tag, content);
}

std::string data(bool last, std::uint32_t stream, std::uint64_t index) {
    return frame(session::FrameKind::Data, last, framing::FrameType{4}, stream, index, {}, "12345678");
}

std::string result(const exchange::IDType& id) {
    krutil::protobuf::IIPResult message;
    message.mutable_id()->set_hi(id.hi());
    message.mutable_id()->set_lo(id.lo());
    return message.SerializeAsString();
}

std::string reply(const exchange::IDType& id, std::uint64_t resultIndex) {
    krutil::protobuf::IIPReply message;
    message.mutable_id()->set_hi(id.hi());
    message.mutable_id()->set_lo(id.lo());
    message.set_resultid(resultIndex);
    return message.SerializeAsString();
}

std::string wholeReply(std::uint32_t stream, const exchange::IDType& id) {
    return tagged(false, stream, 1, "krutil:IIPResult", result(id)) +
           tagged(true, stream, 2, "krutil:IIPReply", reply(id, 1));
}

std::string started(std::uint32_t stream) {
    return tagged(true, stream, 1, "krutil:IIPStartedEvent");
}

std::string ended(std::uint32_t stream) {
    return tagged(true, stream, 1, "krutil:IIPCompletedEvent") + tagged(true, stream, 1, "krutil:detail::LastIIPEvent");
}

// All that a request without output is answered with.
std::string answer(std::uint32_t stream, const exchange::IDType& id) {
    return started(stream) + ended(stream) + wholeReply(stream, id);
}

std::string shutdown() {
    return tagged(true, 0, 1, "krutil:QVMShutdownEvent");
}

// What pairs of hexadecimal digits stand for.
std::string bytesOf(const std::string& digits) {
    std::string bytes;
    for (std::size_t i = 0; i + 1 < digits.size(); i += 2) {
        bytes += static_cast<char>(std::stoi(digits.substr(i, 2), nullptr, 16));
    }
    return bytes;
}

// Content that begins with the identifier: events and results have it in the same field, but for one type of results,
// which holds a result of the other type.
std::string withIdentifier(const std::string& tag, const exchange::IDType& id, const std::string& bytes) {
    const std::string head = result(id);
    const bool nested = tag == "krutil:FEvalResult";
    return (nested ? "\x0a" + std::string(1, static_cast<char>(head.size())) : std::string()) + head + bytes;
}

using Scene = std::function<std::string(std::uint32_t stream, const exchange::IDType& id)>;

const std::map<std::string, Scene> scenes{
    {"unknown-tag", [](auto stream, const auto&) { return tagged(true, stream, 1, "krutil:Nonsense"); }},
    {"result-as-root",
     [](auto stream, const auto& id) { return tagged(true, stream, 1, "krutil:IIPResult", result(id)); }},
    {"new-exchange",
     [](auto, const auto&) {
         return tagged(false, 1234, 1, "krutil:EvalIIP") +
                tagged(true, 1234, 2, "krutil:IIPEnqueueMessage", {}, control);
     }},
    {"data-last", [](auto stream, const auto&) { return data(true, stream, 1); }},
    {"reply-to-nothing", [](auto, const auto& id) { return wholeReply(1234, id); }},
    {"second-reply", [](auto stream, const auto& id) { return answer(stream, id) + wholeReply(stream, id); }},
    {"reply-of-another-request",
     [](auto stream, const auto& id) { return answer(stream, exchange::IDType(id.hi() ^ 1U, id.lo())); }},
    {"event-of-nothing", [](auto, const auto&) { return tagged(true, 1234, 1, "krutil:TextBaseEvent"); }},
    {"wrong-index", [](auto stream, const auto&) { return tagged(true, stream, 2, "krutil:TextBaseEvent"); }},
    {"index-zero", [](auto stream, const auto&) { return tagged(true, stream, 0, "krutil:TextBaseEvent"); }},
    {"wrong-frame-type",
     [](auto stream, const auto&) { return tagged(true, stream, 1, "krutil:TextBaseEvent", {}, control); }},
    {"reply-without-its-result",
     [](auto stream, const auto& id) { return tagged(true, stream, 1, "krutil:IIPReply", reply(id, 7)); }},
    {"empty-tag", [](auto stream, const auto&) { return tagged(true, stream, 1, ""); }},
    {"long-tag", [](auto stream, const auto&) { return tagged(true, stream, 1, std::string(129, 'x')); }},
    {"huge-frame",
     [](auto stream, const auto&) {
         session::FrameHeader header;
         header.kind = static_cast<std::uint8_t>(session::FrameKind::Tagged);
         header.last = true;
         header.tagSize = 1;
         header.stream = stream;
         header.index = 1;
         header.contentSize = ~std::uint64_t{0};
         const auto bytes = encode(header);
         return std::string(bytes.data(), bytes.size()) + "x";
     }},
    {"text-after-reply",
     [](auto stream, const auto& id) { return answer(stream, id) + tagged(true, stream, 1, "krutil:TextBaseEvent"); }},
    {"nothing-after-shutdown",
     [](auto stream, const auto&) { return shutdown() + tagged(true, stream, 1, "krutil:TextBaseEvent"); }},
    {"bad-text",
     [](auto stream, const auto& id) {
         // A string field with a byte that no UTF-8 text has; parsers report it and go on.
         return started(stream) +
                tagged(true, stream, 1, "krutil:TextBaseEvent",
                       std::string("\x1a\x04"
                                   "a\xff"
                                   "bc")) +
                ended(stream) + wholeReply(stream, id) + shutdown();
     }},
    {"reply-without-result",
     [](auto stream, const auto& id) {
         return started(stream) + ended(stream) + tagged(true, stream, 1, "krutil:IIPReply", reply(id, 0)) + shutdown();
     }},
    {"leaves-its-stream", [](auto, const auto&) { return std::string(); }},
    {"ignores-goodbye", [](auto stream, const auto& id) { return answer(stream, id); }},
};

// The scenes that need more than a name.
Scene eventOf(const std::string& tag, const std::string& bytes) {
    return [=](auto stream, const auto& id) {
        return started(stream) + tagged(true, stream, 1, tag, withIdentifier(tag, id, bytes)) + ended(stream) +
               wholeReply(stream, id) + shutdown();
    };
}

Scene resultOf(const std::string& tag, const std::string& bytes) {
    return [=](auto stream, const auto& id) {
        return started(stream) + ended(stream) + tagged(false, stream, 1, tag, withIdentifier(tag, id, bytes)) +
               tagged(true, stream, 2, "krutil:IIPReply", reply(id, 1)) + shutdown();
    };
}

// Hands out the first request.
class FirstRequest : public session::SessionHandler {
  public:
    struct Request {
        std::uint32_t stream;
        exchange::IDType id;
    };
    std::future<Request> future() { return promise_.get_future(); }

    void onMessage(framing::StreamID stream, const boost::shared_ptr<const exchange::Message>& message) override {
        promise_.set_value({stream, dynamic_cast<const cmddistributor::IIPEnqueueMessage&>(*message).getID()});
    }
    void onEnd(const session::SessionEnd&) override {}

  private:
    std::promise<Request> promise_;
};

int play(const std::string& name, const Scene& scene) {
    const int raw = ::fcntl(STDOUT_FILENO, F_DUPFD_CLOEXEC, 3);
    session::SessionConfig config = apps::krutilSession(session::Role::Engine);
    config.build = "fake engine";
    FirstRequest handler;
    auto request = handler.future();
    const auto opened = session::Session::open(::dup(STDIN_FILENO), ::dup(STDOUT_FILENO), std::move(config));
    opened->start(handler);
    const auto first = request.get();
    const std::string bytes = scene(first.stream, first.id);
    writeAll(raw, bytes.data(), bytes.size());
    if (name == "ignores-goodbye") {
        for (;;) {
            ::pause();
        }
    }
    if (name == "leaves-its-stream") {
        if (::fork() != 0) {
            ::_exit(4);
        }
    } else {
        ::shutdown(raw, SHUT_WR);
    }
    // The other direction stays open until the client has had its say.
    char sink = 0;
    for (;;) {
        pollfd watched{raw, POLLIN, 0};
        ::poll(&watched, 1, -1);
        const auto got = ::recv(raw, &sink, 1, MSG_PEEK | MSG_DONTWAIT);
        if (got == 0 || (watched.revents & (POLLHUP | POLLERR)) != 0) {
            break;
        }
    }
    return 0;
}

int offerAnotherVersion() {
    using session::FeatureHandling;
    session::ProtocolRegistry::getRegistry()->registerProtocolInitializer(
        "krutil", [](const auto&, const auto& version, const auto&) { return version; },
        [] {
            return std::vector<session::FeatureRequest>{{"ZEROCOPY", "sometimes", FeatureHandling::Required}};
        });
    session::SessionConfig config;
    config.role = session::Role::Engine;
    config.protocol = "krutil";
    config.version = {2, 7};
    config.build = "fake engine";
    try {
        session::Session::open(::dup(STDIN_FILENO), ::dup(STDOUT_FILENO), std::move(config));
    } catch (const session::HandshakeRefused&) {
        return 5;
    }
    return 0;
}

int relay(const std::string& howMuch, char** command) {
    std::string countFile;
    std::uint64_t left = ~std::uint64_t{0};
    if (howMuch == "count") {
        countFile = *command++;
    } else {
        left = std::stoull(howMuch);
    }
    int ends[2];
    if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) != 0) {
        return 1;
    }
    const pid_t engine = ::fork();
    if (engine == 0) {
        ::dup2(ends[1], STDIN_FILENO);
        ::dup2(ends[1], STDOUT_FILENO);
        ::execv(command[0], command);
        ::_exit(127);
    }
    ::close(ends[1]);
    std::uint64_t relayed = 0;
    std::array<pollfd, 2> watched{pollfd{STDIN_FILENO, POLLIN, 0}, pollfd{ends[0], POLLIN, 0}};
    std::array<char, 1U << 16> piece;
    while (left > 0 && ::poll(watched.data(), watched.size(), -1) > 0) {
        if (watched[0].revents != 0) {
            const auto got = ::read(STDIN_FILENO, piece.data(), piece.size());
            if (got <= 0) {
                break;
            }
            writeAll(ends[0], piece.data(), static_cast<std::size_t>(got));
        }
        if (watched[1].revents != 0) {
            const auto got = ::read(ends[0], piece.data(), std::min<std::uint64_t>(piece.size(), left));
            if (got <= 0) {
                break;
            }
            relayed += static_cast<std::uint64_t>(got);
            left -= static_cast<std::uint64_t>(got);
            writeAll(STDOUT_FILENO, piece.data(), static_cast<std::size_t>(got));
        }
    }
    ::kill(engine, SIGKILL);
    ::waitpid(engine, nullptr, 0);
    if (!countFile.empty()) {
        std::ofstream(countFile) << relayed;
    }
    return 9;
}

}  // namespace

#if defined(KRUTIL_SANITIZED)
// Scenes end in the middle of things, and one leaves a fork behind: what a check at exit would find is no leak.
extern "C" const char* __lsan_default_options() {
    return "leak_check_at_exit=0";
}
#endif

int main(int argc, char** argv) {
    std::signal(SIGPIPE, SIG_IGN);
    const std::string name = argc > 1 ? argv[1] : "";
    if (name == "other-version") {
        return offerAnotherVersion();
    }
    if (name == "cut" && argc > 3) {
        return relay(argv[2], argv + 3);
    }
    if ((name == "event" || name == "result") && argc > 2) {
        const std::string bytes = bytesOf(argc > 3 ? argv[3] : "");
        return play(name, name == "event" ? eventOf(argv[2], bytes) : resultOf(argv[2], bytes));
    }
    const auto scene = scenes.find(name);
    if (scene == scenes.end()) {
        std::fprintf(stderr, "session_fake_engine: no scene is called '%s'\n", name.c_str());
        return 2;
    }
    return play(name, scene->second);
}
