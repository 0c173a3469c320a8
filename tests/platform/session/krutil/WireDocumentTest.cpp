// The example of docs/session-wire.md is what the programs write.

#include <algorithm>
#include <boost/make_shared.hpp>
#include <future>
#include <iomanip>
#include <sstream>

#include "KrutilProtocol.hpp"
#include "cmddistributor/EvalIIP.hpp"
#include "cmddistributor/IIPEnqueueMessage.hpp"
#include "krutil/eventmgr/QVMShutdownEvent.hpp"
#include "platform/session/support/TestSessions.hpp"
#include "support/HexBlocks.hpp"

namespace testing_sessions {
namespace {

using exchange::IDType;
using krutil::io::SinkTraits;

std::string hex(const std::string& bytes) {
    std::ostringstream text;
    text << std::hex << std::setfill('0');
    for (std::size_t i = 0; i < bytes.size(); ++i) {
        text << std::setw(2) << static_cast<int>(static_cast<unsigned char>(bytes[i])) << (i % 16 == 15 ? '\n' : ' ');
    }
    return text.str();
}

TEST(WireDocumentTest, ExampleIsWhatAClientAndAnEngineWrite) {
    krutil::protobuf::KrutilProtocol::init();
    const std::vector<std::string> blocks = test_support::hexBlocksOf(KRUTIL_WIRE_DOCUMENT);
    std::size_t next = 0;
    const auto compare = [&](const std::string& what, const std::string& bytes) {
        const std::string documented = next < blocks.size() ? blocks[next] : "";
        ++next;
        EXPECT_EQ(hex(documented), hex(bytes)) << "block " << next << ", " << what;
    };
    const auto open = [](Role role, Ends& ends) {
        SessionConfig config = configOf(role);
        config.protocol = "krutil";
        config.shutdownEvent = typeid(krutil::eventmgr::QVMShutdownEvent);
        config.build = role == Role::Client ? "krutil 0.1.0" : "krutil-qvm 0.1.0";
        config.capabilities = {capabilities::Capability::LocalClient};
        ends = socketPair();
        return std::async(std::launch::async, [config, ends] { return Session::open(ends.in, ends.out, config); });
    };
    const auto answerHello = [](wire::ByteEnd& peer) {
        const std::string head = peer.read(16);
        const auto length = static_cast<std::size_t>(static_cast<unsigned char>(head.at(12)));
        const std::string hello = head + peer.read(length);
        msg_svc::protobuf::SessionHello mine;
        EXPECT_TRUE(mine.ParseFromString(hello.substr(16)));
        // The example has no signs of life.
        auto& features = *mine.mutable_features();
        features.erase(std::remove_if(features.begin(), features.end(),
                                      [](const auto& feature) { return feature.name() == "KEEPALIVE"; }),
                       features.end());
        mine.set_role(mine.role() == msg_svc::protobuf::SessionHello::CLIENT ? msg_svc::protobuf::SessionHello::ENGINE
                                                                             : msg_svc::protobuf::SessionHello::CLIENT);
        peer.write(wire::helloBytes(mine));
        return hello;
    };

    Ends ends{};
    auto opening = open(Role::Client, ends);
    wire::ByteEnd engine(ends.otherIn, ends.otherOut);
    compare("the client's hello", answerHello(engine));
    const std::string length = engine.read(4);
    const std::string verdict = engine.read(static_cast<std::size_t>(length.at(0)));
    compare("the verdict of either end", length + verdict);
    engine.write(length + verdict);
    const auto client = opening.get();
    Recorder clientSaw;
    client->start(clientSaw);
    const SinkTraits shown(false, false, true, false, false, false);
    client->send(client->newStreamID(),
                 boost::make_shared<const cmddistributor::IIPEnqueueMessage>(
                     boost::make_shared<const cmddistributor::EvalIIP>(
                         "eval", cmddistributor::IqmStreamID::ekIqmCmdWinStream, nullptr, shown, shown, u"1+1",
                         cmddistributor::CodeType::CodeBlockType),
                     IDType(0, 1), 1, boost::none, nullptr, krutil::cmddistributor::WhenToDequeue::DEQUEUE_AT_IDLE, u"",
                     capabilities::CapabilityList(), nullptr, false));
    client->sayGoodbye();
    client->close();
    const std::string said = engine.readAll();
    ASSERT_GT(said.size(), 24U);
    compare("a request", said.substr(0, said.size() - 24));
    compare("the goodbye", said.substr(said.size() - 24));

    opening = open(Role::Engine, ends);
    wire::ByteEnd peer(ends.otherIn, ends.otherOut);
    answerHello(peer);
    peer.write(length + verdict);
    EXPECT_EQ(peer.read(4 + verdict.size()), length + verdict);
    const auto real = opening.get();
    Recorder engineSaw;
    real->start(engineSaw);
    real->send(0, boost::make_shared<const krutil::eventmgr::QVMShutdownEvent>());
    real->close();
    compare("the shutdown event", peer.readAll());
    EXPECT_EQ(next, blocks.size()) << "blocks of the document";
}

}  // namespace
}  // namespace testing_sessions
