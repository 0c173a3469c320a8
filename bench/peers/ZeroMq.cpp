// ZeroMQ: a request socket and a reply socket.

#include <zmq.h>

#include <cerrno>
#include <cstdint>
#include <cstring>
#include <memory>
#include <stdexcept>
#include <string>

#include "peers/RoundTripPeers.hpp"

namespace bench {
namespace {

void require(bool done, const std::string& what) {
    if (!done) {
        throw std::runtime_error("ZeroMQ: " + what + ": " + zmq_strerror(errno));
    }
}

class Socket {
  public:
    explicit Socket(int type) : context_(zmq_ctx_new()), socket_(zmq_socket(context_, type)) {
        require(socket_ != nullptr, "socket");
        const int none = 0;
        zmq_setsockopt(socket_, ZMQ_LINGER, &none, sizeof none);
    }
    ~Socket() {
        zmq_close(socket_);
        zmq_ctx_term(context_);
    }
    Socket(const Socket&) = delete;
    Socket& operator=(const Socket&) = delete;

    void* get() const noexcept { return socket_; }

    void send(const char* data, std::size_t size) const { require(zmq_send(socket_, data, size, 0) >= 0, "send"); }

    // Calls `use` with the bytes of the next message.
    template <class Use>
    void receive(const Use& use) const {
        zmq_msg_t message;
        zmq_msg_init(&message);
        require(zmq_msg_recv(&message, socket_, 0) >= 0, "receive");
        use(static_cast<const char*>(zmq_msg_data(&message)), zmq_msg_size(&message));
        zmq_msg_close(&message);
    }

  private:
    void* context_;
    void* socket_;
};

void serve(const std::string& path, const std::function<void()>& ready) {
    const Socket socket(ZMQ_REP);
    require(zmq_bind(socket.get(), ("ipc://" + path).c_str()) == 0, "bind");
    ready();
    std::string answer;
    while (true) {
        socket.receive([&](const char* data, std::size_t /*size*/) {
            std::uint64_t back = 0;
            std::memcpy(&back, data, sizeof back);
            answer.resize(back);
        });
        socket.send(answer.data(), answer.size());
    }
}

Contender connect(const std::string& path, std::size_t there, std::size_t back) {
    auto socket = std::make_shared<Socket>(ZMQ_REQ);
    require(zmq_connect(socket->get(), ("ipc://" + path).c_str()) == 0, "connect");
    std::string request(there, 'x');
    const std::uint64_t wanted = back;
    std::memcpy(request.data(), &wanted, sizeof wanted);
    return {"", [socket, request, back](std::size_t count) {
                for (std::size_t i = 0; i < count; ++i) {
                    socket->send(request.data(), request.size());
                    socket->receive([back](const char* /*data*/, std::size_t size) {
                        require(size == back, "expected another size of the answer");
                    });
                }
            }};
}

}  // namespace

RoundTripPeer zeroMq() {
    return {"ZeroMQ", serve, connect};
}

}  // namespace bench
