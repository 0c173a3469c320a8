// Zero copy as the two ends of a session agree on it. The variable is asked once in the life of a process, so each test
// has processes of its own.
#include <cstdlib>
#include <future>

#include "common/KrutilSession.hpp"
#include "platform/session/support/TestSessions.hpp"
#include "platform/session/support/WireBytes.hpp"

namespace testing_sessions {
namespace {

using msg_svc::protobuf::SessionHello;
using msg_svc::protobuf::SessionVerdict;
using session::FeatureHandling;
using session::HandshakeRefused;

constexpr const char* variable = "QX_DISABLE_ZEROCOPY";

// Runs in a process of its own and ends it; returns what went wrong in the exit text.
[[noreturn]] void report(const std::string& text) {
    std::fprintf(stderr, "%s\n", text.c_str());
    std::_Exit(0);
}

std::string valuesOf(const SessionHello& hello) {
    std::string text;
    for (const auto& feature : hello.features()) {
        text += (text.empty() ? "" : " ") + feature.name() + "=" + feature.value();
    }
    return text;
}

std::string settledOf(const std::unordered_map<std::string, std::string>& features) {
    const auto found = features.find("ZEROCOPY");
    return found == features.end() ? "nothing" : found->second;
}

// What this process offers.
std::string offered() {
    const Ends ends = socketPair();
    wire::ByteEnd peer(ends.otherIn, ends.otherOut);
    auto opening = std::async(std::launch::async, [&] {
        try {
            Session::open(ends.in, ends.out, apps::krutilSession(Role::Client));
        } catch (const session::SessionError&) {
        }
    });
    const std::string text = valuesOf(peer.readHello());
    peer.close();
    return text;
}

// What two ends of this process settle on.
std::string settled() {
    const SessionPair pair(apps::krutilSession(Role::Client), apps::krutilSession(Role::Engine));
    return settledOf(pair.client->features()) + " " + settledOf(pair.engine->features());
}

// How this process, as a client, takes an engine that offers these values and gives this verdict.
std::string against(const std::vector<std::string>& values, const SessionVerdict& verdict) {
    const Ends ends = socketPair();
    wire::ByteEnd peer(ends.otherIn, ends.otherOut);
    auto opening = std::async(std::launch::async, [&]() -> std::string {
        try {
            return "settled on " +
                   settledOf(Session::open(ends.in, ends.out, apps::krutilSession(Role::Client))->features());
        } catch (const HandshakeRefused& refused) {
            return refused.what();
        }
    });
    SessionHello hello = wire::hello(SessionHello::ENGINE);
    hello.set_protocol("krutil");
    for (const std::string& value : values) {
        auto& feature = *hello.add_features();
        feature.set_name("ZEROCOPY");
        feature.set_value(value);
        feature.set_handling(static_cast<int>(FeatureHandling::Required));
    }
    peer.readHello();
    peer.write(wire::helloBytes(hello));
    peer.readVerdict();
    peer.write(wire::verdictBytes(verdict));
    return opening.get();
}

SessionVerdict accepts(const std::string& value) {
    SessionVerdict verdict = wire::acceptance();
    auto& feature = *verdict.add_features();
    feature.set_name("ZEROCOPY");
    feature.set_value(value);
    return verdict;
}

SessionVerdict refuses(const std::string& text) {
    SessionVerdict verdict;
    verdict.set_refusal(text);
    return verdict;
}

class ZeroCopyDeathTest : public testing::Test {
  protected:
    ZeroCopyDeathTest() { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
};

TEST_F(ZeroCopyDeathTest, BothValuesAreOfferedWithoutTheVariable) {
    EXPECT_EXIT(::unsetenv(variable); report(offered() + "|" + settled());
                , testing::ExitedWithCode(0), "ZEROCOPY=enable ZEROCOPY=disable\\|enable enable");
}

TEST_F(ZeroCopyDeathTest, EmptyVariableIsNone) {
    EXPECT_EXIT(::setenv(variable, "", 1); report(offered() + "|" + settled());
                , testing::ExitedWithCode(0), "ZEROCOPY=enable ZEROCOPY=disable\\|enable enable");
}

TEST_F(ZeroCopyDeathTest, AnyOtherValueStrikesEnable) {
    for (const char* value : {"1", "0", "false", " "}) {
        EXPECT_EXIT(::setenv(variable, value, 1); report("(" + offered() + "|" + settled() + ")");
                    , testing::ExitedWithCode(0), "\\(ZEROCOPY=disable\\|disable disable\\)")
            << value;
    }
}

TEST_F(ZeroCopyDeathTest, VariableThatChangesAfterTheFirstHandshakeHasNoEffect) {
    EXPECT_EXIT(::unsetenv(variable); const std::string before = settled(); ::setenv(variable, "1", 1);
                report(before + "|" + offered());
                , testing::ExitedWithCode(0), "enable enable\\|ZEROCOPY=enable ZEROCOPY=disable");
    EXPECT_EXIT(::setenv(variable, "1", 1); const std::string before = settled(); ::unsetenv(variable);
                report(before + "|(" + offered() + ")");
                , testing::ExitedWithCode(0), "disable disable\\|\\(ZEROCOPY=disable\\)");
}

TEST_F(ZeroCopyDeathTest, PeerThatHasItSwitchedOffIsRefusedByOneThatHasNot) {
    EXPECT_EXIT(::unsetenv(variable); report(against({"disable"}, accepts("disable")));
                , testing::ExitedWithCode(0),
                "the session is refused: feature \"ZEROCOPY\": \"disable\" is all that both ends accept, but the "
                "client has zero copy switched on; set QX_DISABLE_ZEROCOPY for both ends or for neither");
}

TEST_F(ZeroCopyDeathTest, EndThatHasItSwitchedOffTellsThePeersReason) {
    EXPECT_EXIT(::setenv(variable, "1", 1); report(against({"enable", "disable"}, refuses("it is on here")));
                , testing::ExitedWithCode(0), "the session is refused by the engine: it is on here");
}

TEST_F(ZeroCopyDeathTest, PeerThatCannotSwitchItOffIsRefusedWithTheReason) {
    EXPECT_EXIT(::setenv(variable, "1", 1); report(against({"enable"}, refuses("no")));
                , testing::ExitedWithCode(0),
                "the session is refused: feature \"ZEROCOPY\": the client accepts \"disable\", the engine \"enable\"; "
                "QX_DISABLE_ZEROCOPY is set for the client, so it does not accept \"enable\" for \"ZEROCOPY\"");
}

TEST_F(ZeroCopyDeathTest, OtherFeaturesKeepTheirValues) {
    EXPECT_EXIT(
        ::setenv(variable, "1", 1); {
            const Registered protocol("other", {{"OTHER", "enable", FeatureHandling::Required}});
            SessionConfig client = apps::krutilSession(Role::Client);
            SessionConfig engine = apps::krutilSession(Role::Engine);
            client.protocol = engine.protocol = "other";
            const SessionPair pair(client, engine);
            report(pair.client->features().at("OTHER"));
        },
                                    testing::ExitedWithCode(0), "enable");
}

}  // namespace
}  // namespace testing_sessions
