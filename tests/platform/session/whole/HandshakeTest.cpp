// What two ends make of each other: what they settle on, and why they refuse.
#include <mutex>
#include <unordered_map>

#include "platform/session/support/HandshakeFixture.hpp"

namespace testing_sessions {
namespace {

using capabilities::Capability;
using msg_svc::protobuf::SessionHello;
using msg_svc::protobuf::SessionVerdict;
using session::FeatureHandling;
using session::FeatureRequest;
using session::HandshakeRefused;
using session::StreamLost;
using testing::Pair;
using testing::UnorderedElementsAre;

TEST_F(HandshakeTest, BothEndsLearnAboutEachOther) {
    SessionConfig clientConfig = configOf(Role::Client);
    clientConfig.limits.taggedFrame = 1111;
    clientConfig.capabilities = {Capability::Debugging, Capability::InteractiveCommandLine};
    SessionConfig engineConfig = configOf(Role::Engine);
    engineConfig.limits = {1, 2, 3, 4, 5};
    const Outcome outcome = openBoth(clientConfig, engineConfig);
    ASSERT_TRUE(outcome.client && outcome.engine);
    EXPECT_EQ(outcome.client->peer().build, "test engine 1");
    EXPECT_EQ(outcome.client->peer().limits, engineConfig.limits);
    EXPECT_TRUE(outcome.client->peer().capabilities.empty());
    EXPECT_EQ(outcome.engine->peer().build, "test client 1");
    EXPECT_EQ(outcome.engine->peer().limits, clientConfig.limits);
    EXPECT_EQ(outcome.engine->peer().capabilities, clientConfig.capabilities);
    EXPECT_EQ(outcome.client->registry()->serializers().size(), 7U);
    EXPECT_NE(outcome.client->registry(), outcome.engine->registry());
    EXPECT_TRUE(outcome.client->features().empty());
}

TEST_F(HandshakeTest, HelloIsTheFrozenFirstMessage) {
    const Ends ends = socketPair();
    wire::ByteEnd peer(ends.otherIn, ends.otherOut);
    auto opening = std::async(std::launch::async, [&] {
        textOf<StreamLost>([&] { Session::open(ends.in, ends.out, configOf(Role::Client)); });
    });
    SessionHello expected = wire::hello(SessionHello::CLIENT);
    expected.set_build("test client 1");
    const std::string bytes = wire::helloBytes(expected);
    EXPECT_EQ(peer.read(bytes.size()), bytes);
    EXPECT_EQ(bytes.substr(0, 12), std::string("\x89KRUTIL\n\x01\x00\x00\x00", 12));
    peer.close();
    opening.get();
}

TEST_F(HandshakeTest, BuildTextThatIsNotUtf8IsRepairedAndCut) {
    SessionConfig clientConfig = configOf(Role::Client);
    clientConfig.build = "bad \xFF\x1B[2J" + std::string(5000, 'x');
    const Outcome outcome = openBoth(clientConfig, configOf(Role::Engine));
    ASSERT_TRUE(outcome.engine);
    EXPECT_TRUE(outcome.engine->peer().build.starts_with("bad \xEF\xBF\xBD\xEF\xBF\xBD[2Jxxx"));
    EXPECT_LT(outcome.engine->peer().build.size(), 1100U);
}

// Features.

class FeatureTest : public testing::Test {
  protected:
    // The protocol's configuration function is asked by each end in turn, and answers by the role that asks next.
    Outcome settle(const std::vector<FeatureRequest>& client, const std::vector<FeatureRequest>& engine) {
        static thread_local bool engineThread = false;
        engineThread = true;
        session::ProtocolRegistry::getRegistry()->registerProtocolInitializer(
            "features",
            [](const auto& registry, const auto& version, const auto& features) {
                return initialize(registry, version, features);
            },
            [client, engine] { return engineThread ? engine : client; });
        SessionConfig clientConfig = configOf(Role::Client);
        SessionConfig engineConfig = configOf(Role::Engine);
        clientConfig.protocol = engineConfig.protocol = "features";
        Outcome outcome = openBoth(clientConfig, engineConfig);
        session::ProtocolRegistry::getRegistry()->unregister("features");
        if (outcome.client && outcome.engine) {
            EXPECT_EQ(outcome.client->features(), outcome.engine->features());
        }
        return outcome;
    }
};

TEST_F(FeatureTest, FirstValueInTheClientsOrderThatTheEngineListsIsSettled) {
    const Outcome outcome =
        settle({required("X", "a"), required("X", "b"), required("X", "c")}, {required("X", "c"), required("X", "b")});
    ASSERT_TRUE(outcome.client);
    EXPECT_THAT(outcome.client->features(), UnorderedElementsAre(Pair("X", "b")));
}

TEST_F(FeatureTest, OptionalFeatureWithoutACommonValueIsLeftOut) {
    const Outcome outcome = settle({optional("X", "a"), optional("Y", "1")}, {optional("X", "b"), optional("Y", "1")});
    ASSERT_TRUE(outcome.client);
    EXPECT_THAT(outcome.client->features(), UnorderedElementsAre(Pair("Y", "1")));
}

TEST_F(FeatureTest, IgnoredFeatureIsNeverSettled) {
    const FeatureRequest ignored("X", "a", FeatureHandling::Ignore);
    const Outcome outcome = settle({ignored}, {ignored});
    ASSERT_TRUE(outcome.client);
    EXPECT_TRUE(outcome.client->features().empty());
}

TEST_F(FeatureTest, RequiredFeatureWithoutACommonValueIsRefusedByBoth) {
    const Outcome outcome = settle({required("X", "a")}, {required("X", "b"), required("X", "c")});
    EXPECT_EQ(outcome.clientText,
              "the session is refused: feature \"X\": the client accepts \"a\", the engine \"b\", \"c\"");
    EXPECT_EQ(outcome.engineText, outcome.clientText);
}

TEST_F(FeatureTest, FeatureThatOneEndRequiresAndTheOtherDoesNotKnowIsRefused) {
    EXPECT_EQ(settle({required("X", "a")}, {}).clientText,
              "the session is refused: feature \"X\": the client accepts \"a\", the engine no value");
    EXPECT_EQ(settle({}, {required("X", "a")}).clientText,
              "the session is refused: feature \"X\": the client accepts no value, the engine \"a\"");
    EXPECT_EQ(settle({optional("X", "b")}, {required("X", "a")}).engineText,
              "the session is refused: feature \"X\": the client accepts \"b\", the engine \"a\"");
}

TEST_F(FeatureTest, EveryMismatchIsListed) {
    const Outcome outcome = settle({required("X", "a"), required("Y", "1"), required("Z", "z")},
                                   {required("X", "b"), required("Y", "2"), required("Z", "z")});
    EXPECT_EQ(outcome.clientText,
              "the session is refused: feature \"X\": the client accepts \"a\", the engine \"b\"; feature \"Y\": the "
              "client accepts \"1\", the engine \"2\"");
}

// What the process cannot do of what its protocol lists.

class UnusableFeatureTest : public HandshakeTest {
  protected:
    // Both ends list "on" and "off", in this order; each may be unable to work with some of it.
    static Outcome settle(const std::vector<session::UnusableFeature>& client,
                          const std::vector<session::UnusableFeature>& engine) {
        const Registered protocol("switch", {required("X", "on"), required("X", "off"), optional("Y", "on")});
        SessionConfig clientConfig = configOf(Role::Client);
        SessionConfig engineConfig = configOf(Role::Engine);
        clientConfig.protocol = engineConfig.protocol = "switch";
        clientConfig.unusableFeatures = client;
        engineConfig.unusableFeatures = engine;
        return openBoth(clientConfig, engineConfig);
    }
};

TEST_F(UnusableFeatureTest, ValueThatIsNotOfferedIsNotSettled) {
    const Outcome outcome = settle({{"X", "on", false, "X_OFF is set"}}, {});
    EXPECT_EQ(outcome.client->features().at("X"), "off");
    EXPECT_EQ(outcome.engine->features().at("X"), "off");
    EXPECT_EQ(outcome.engine->features().at("Y"), "on") << "another feature with that value";
}

TEST_F(UnusableFeatureTest, ValueThatIsOfferedAllTheSameDoesNoHarmUntilItIsSettled) {
    const Outcome outcome = settle({{"X", "off", true, "has it on"}}, {{"X", "off", true, "has it on"}});
    EXPECT_EQ(outcome.client->features().at("X"), "on");
    EXPECT_EQ(outcome.engine->features().at("X"), "on");
}

TEST_F(UnusableFeatureTest, SettledValueThatAnEndCannotWorkWithIsRefusedByThatEnd) {
    const Outcome outcome = settle({{"X", "on", false, "X_OFF is set"}}, {{"X", "off", true, "has it on"}});
    EXPECT_EQ(outcome.engineText,
              "the session is refused: feature \"X\": \"off\" is all that both ends accept, but the engine has it on");
    EXPECT_EQ(outcome.clientText,
              "the session is refused by the engine: feature \"X\": \"off\" is all that both ends accept, but the "
              "engine has it on");
}

TEST_F(UnusableFeatureTest, RefusalOfAFeatureTellsWhatWasNotOfferedAndWhy) {
    const Outcome outcome = settle({{"X", "on", false, "X_OFF is set"}}, {{"X", "off", false, "X_ON is set"}});
    EXPECT_EQ(outcome.clientText,
              "the session is refused: feature \"X\": the client accepts \"off\", the engine \"on\"; X_OFF is set for "
              "the client, so it does not accept \"on\" for \"X\"; the engine says: feature \"X\": the client accepts "
              "\"off\", the engine \"on\"; X_ON is set for the engine, so it does not accept \"off\" for \"X\"");
}

TEST_F(UnusableFeatureTest, ValuesThatTheProtocolDoesNotListAreNotMentioned) {
    const Outcome outcome = settle({{"X", "on", false, "X_OFF is set"}, {"X", "none", false, "X_NONE is set"}},
                                   {{"X", "off", false, "no"}});
    EXPECT_EQ(outcome.clientText.find("X_NONE"), std::string::npos) << outcome.clientText;
}

TEST_F(FeatureTest, InitializerGetsTheSettledValues) {
    std::mutex mutex;
    std::vector<std::unordered_map<std::string, std::string>> seen;
    const Registered protocol("seen", {required("X", "a"), optional("Y", "1")},
                              [&](const auto& registry, const auto& version, const auto& features) {
                                  const std::lock_guard lock(mutex);
                                  seen.push_back(features);
                                  return initialize(registry, version, features);
                              });
    SessionConfig clientConfig = configOf(Role::Client);
    SessionConfig engineConfig = configOf(Role::Engine);
    clientConfig.protocol = engineConfig.protocol = "seen";
    openBoth(clientConfig, engineConfig);
    const auto settled = UnorderedElementsAre(Pair("X", "a"), Pair("Y", "1"));
    EXPECT_THAT(seen, testing::ElementsAre(settled, settled));
}

// Refusals.

TEST_F(HandshakeTest, OtherVersionIsRefusedByBoth) {
    SessionConfig clientConfig = configOf(Role::Client);
    clientConfig.version = {1, 1};
    const Outcome outcome = openBoth(clientConfig, configOf(Role::Engine));
    EXPECT_EQ(outcome.clientText, "the session is refused: protocol version: the client has (1, 1), the engine (1, 0)");
    EXPECT_EQ(outcome.engineText, outcome.clientText);
}

TEST_F(HandshakeTest, TwoClientsAreRefused) {
    const Outcome outcome = openBoth(configOf(Role::Client), configOf(Role::Client));
    EXPECT_EQ(outcome.clientText,
              "the session is refused: role: a session needs a client and an engine, this end is a client, the other "
              "end is a client");
    EXPECT_EQ(outcome.engineText, outcome.clientText);
}

TEST_F(HandshakeTest, RefusalListsEveryMismatch) {
    SessionHello hello = wire::hello(SessionHello::ENGINE);
    hello.set_protocol("evil\x1B[2J");
    hello.set_versionmajor(2);
    hello.set_versionminor(7);
    msg_svc::protobuf::SessionFeature& feature = *hello.add_features();
    feature.set_name("NEEDED");
    feature.set_value("yes");
    feature.set_handling(3);
    EXPECT_EQ(refusalOf(hello, 9),
              "layout version: the client has 1, the engine 9; protocol: the client has \"test\", the engine "
              "\"evil\\x1b[2J\"; protocol version: the client has (1, 0), the engine (2, 7); feature \"NEEDED\": the "
              "client accepts no value, the engine \"yes\"");
}

TEST_F(HandshakeTest, UnknownRoleIsRefused) {
    SessionHello hello = wire::hello(SessionHello::ENGINE);
    hello.set_role(static_cast<SessionHello::Role>(7));
    EXPECT_EQ(refusalOf(hello),
              "role: a session needs a client and an engine, this end is a client, the other end is unknown (7)");
}

TEST_F(HandshakeTest, RefusalOfThePeerAloneNamesThePeer) {
    const Ends ends = socketPair();
    wire::ByteEnd peer(ends.otherIn, ends.otherOut);
    SessionVerdict verdict;
    verdict.set_refusal("the moon is wrong\x07");
    peer.write(wire::helloBytes(wire::hello(SessionHello::ENGINE)) + wire::verdictBytes(verdict));
    EXPECT_EQ(textOf<HandshakeRefused>([&] { Session::open(ends.in, ends.out, configOf(Role::Client)); }),
              "the session is refused by the engine: the moon is wrong\xEF\xBF\xBD");
}

TEST_F(HandshakeTest, WhatOnlyThePeerKnowsIsAddedToTheOwnRefusal) {
    const Ends ends = socketPair();
    wire::ByteEnd peer(ends.otherIn, ends.otherOut);
    SessionHello hello = wire::hello(SessionHello::ENGINE);
    hello.set_versionminor(3);
    SessionVerdict verdict;
    verdict.set_refusal("too old");
    peer.write(wire::helloBytes(hello) + wire::verdictBytes(verdict));
    EXPECT_EQ(textOf<HandshakeRefused>([&] { Session::open(ends.in, ends.out, configOf(Role::Client)); }),
              "the session is refused: protocol version: the client has (1, 0), the engine (1, 3); the engine says: "
              "too old");
}

TEST_F(HandshakeTest, PeerThatSettledOnOtherValuesIsRefused) {
    const Ends ends = socketPair();
    wire::ByteEnd peer(ends.otherIn, ends.otherOut);
    SessionVerdict verdict = wire::acceptance();
    verdict.add_features()->set_name("X");
    peer.write(wire::helloBytes(wire::hello(SessionHello::ENGINE)) + wire::verdictBytes(verdict));
    EXPECT_EQ(textOf<HandshakeRefused>([&] { Session::open(ends.in, ends.out, configOf(Role::Client)); }),
              "the session is refused: the engine settled on other feature values than the client");
}

TEST_F(HandshakeTest, InitializerThatRefusesTheVersionRefusesTheSession) {
    const Registered protocol("fussy", {},
                              [](const auto&, const auto&, const auto&) { return std::pair(0xFFFFU, 0xFFFFU); });
    SessionConfig clientConfig = configOf(Role::Client);
    SessionConfig engineConfig = configOf(Role::Engine);
    clientConfig.protocol = engineConfig.protocol = "fussy";
    const Outcome outcome = openBoth(clientConfig, engineConfig);
    EXPECT_EQ(outcome.clientText,
              "the session is refused: protocol version: the client cannot set up version (1, 0) of \"fussy\"; the "
              "engine says: protocol version: the engine cannot set up version (1, 0) of \"fussy\"");
}

TEST_F(HandshakeTest, InitializerThatThrowsRefusesTheSession) {
    const Registered protocol("broken", {}, [](const auto&, const auto&, const auto&) -> session::ProtocolVersion {
        throw std::runtime_error("no room");
    });
    SessionConfig config = configOf(Role::Client);
    config.protocol = "broken";
    const Ends ends = socketPair();
    wire::ByteEnd peer(ends.otherIn, ends.otherOut);
    SessionHello hello = wire::hello(SessionHello::ENGINE);
    hello.set_protocol("broken");
    peer.write(wire::helloBytes(hello) + wire::verdictBytes(wire::acceptance()));
    EXPECT_EQ(textOf<HandshakeRefused>([&] { Session::open(ends.in, ends.out, config); }),
              "the session is refused: protocol \"broken\": the client cannot set it up: no room");
}

}  // namespace
}  // namespace testing_sessions
