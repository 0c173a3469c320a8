#include "peers/RoundTripPeers.hpp"

#include <unistd.h>

#include <memory>
#include <stdexcept>

#include "krutil/session/EngineProcess.hpp"
#include "support/TemporaryDirectory.hpp"

namespace bench {
namespace {

constexpr const char* serverArgument = "--peer-server";

std::vector<RoundTripPeer> peers() {
    return {zeroMq(), capnProto(), grpc()};
}

// The server says on its descriptor 1 that it is ready.
class Server {
  public:
    explicit Server(const std::string& name)
        : process_(krutil_client::EngineProcess::start({"/proc/self/exe", serverArgument, name, path()})) {
        char ready = 0;
        if (::read(process_.stream(), &ready, 1) != 1) {
            throw std::runtime_error("the server of " + name + " did not start");
        }
    }

    std::string path() const { return directory_.file("socket"); }

  private:
    test_support::TemporaryDirectory directory_;
    krutil_client::EngineProcess process_;
};

}  // namespace

std::vector<Contender> peerRoundTrips(std::size_t there, std::size_t back) {
    std::vector<Contender> contenders;
    for (const RoundTripPeer& peer : peers()) {
        const auto server = std::make_shared<Server>(peer.name);
        Contender contender = peer.connect(server->path(), there, back);
        contender.name = peer.name;
        // The client goes before its server.
        contender.run = [server, run = std::move(contender.run)](std::size_t count) { run(count); };
        contenders.push_back(std::move(contender));
    }
    return contenders;
}

bool servedPeer(int argc, char** argv) {
    if (argc != 4 || argv[1] != std::string(serverArgument)) {
        return false;
    }
    for (const RoundTripPeer& peer : peers()) {
        if (peer.name == argv[2]) {
            peer.serve(argv[3], [] { [[maybe_unused]] const auto written = ::write(STDOUT_FILENO, "r", 1); });
        }
    }
    return true;
}

}  // namespace bench
