// Cap'n Proto: an interface with one method, over its own calls between processes.

#include <capnp/ez-rpc.h>

#include <memory>
#include <stdexcept>
#include <string>

#include "Echo.capnp.h"
#include "peers/RoundTripPeers.hpp"

namespace bench {
namespace {

capnp::ReaderOptions limits() {
    capnp::ReaderOptions options;
    options.traversalLimitInWords = std::uint64_t{1} << 40;
    return options;
}

class EchoServer final : public CapnProtoEcho::Server {
    kj::Promise<void> exchange(ExchangeContext context) override {
        context.getResults().initData(static_cast<unsigned int>(context.getParams().getWanted()));
        return kj::READY_NOW;
    }
};

void serve(const std::string& path, const std::function<void()>& ready) {
    capnp::EzRpcServer server(kj::heap<EchoServer>(), "unix:" + path, 0, limits());
    server.getPort().wait(server.getWaitScope());
    ready();
    kj::NEVER_DONE.wait(server.getWaitScope());
}

Contender connect(const std::string& path, std::size_t there, std::size_t back) {
    auto client = std::make_shared<capnp::EzRpcClient>("unix:" + path, 0, limits());
    auto echo = std::make_shared<CapnProtoEcho::Client>(client->getMain<CapnProtoEcho>());
    return {"", [client, echo, data = std::string(there, 'x'), back](std::size_t count) {
                for (std::size_t i = 0; i < count; ++i) {
                    auto request = echo->exchangeRequest();
                    request.setData({reinterpret_cast<const kj::byte*>(data.data()), data.size()});
                    request.setWanted(back);
                    auto answer = request.send().wait(client->getWaitScope());
                    if (answer.getData().size() != back) {
                        throw std::runtime_error("Cap'n Proto: expected another size of the answer");
                    }
                }
            }};
}

}  // namespace

RoundTripPeer capnProto() {
    return {"Cap'n Proto", serve, connect};
}

}  // namespace bench
