// Handshakes of two ends in one process, or of one end with bytes that a test makes up.
#pragma once

#include <gtest/gtest.h>

#include <cstdint>
#include <future>
#include <memory>
#include <string>

#include "platform/session/support/TestSessions.hpp"
#include "platform/session/support/WireBytes.hpp"

namespace testing_sessions {

inline session::FeatureRequest required(const std::string& name, const std::string& value) {
    return {name, value, session::FeatureHandling::Required};
}

inline session::FeatureRequest optional(const std::string& name, const std::string& value) {
    return {name, value, session::FeatureHandling::Optional};
}

// What becomes of a client and an engine that open a session with each other.
struct Outcome {
    std::unique_ptr<Session> client;
    std::unique_ptr<Session> engine;
    std::string clientText;
    std::string engineText;
};

inline Outcome openBoth(const SessionConfig& clientConfig, const SessionConfig& engineConfig) {
    const Ends ends = socketPair();
    const auto open = [](int descriptor, const SessionConfig& config, std::unique_ptr<Session>& opened) -> std::string {
        try {
            opened = Session::open(descriptor, descriptor, config);
            return {};
        } catch (const session::HandshakeRefused& refused) {
            return refused.what();
        }
    };
    Outcome outcome;
    auto client = std::async(std::launch::async, [&] { return open(ends.in, clientConfig, outcome.client); });
    outcome.engineText = open(ends.otherIn, engineConfig, outcome.engine);
    outcome.clientText = client.get();
    return outcome;
}

class HandshakeTest : public testing::Test {
  protected:
    // The client opens; the test plays the engine with these bytes. Returns what open() throws.
    template <class Error>
    std::string openAgainst(const std::string& bytes, bool closed = true) {
        const Ends ends = socketPair();
        wire::ByteEnd peer(ends.otherIn, ends.otherOut);
        peer.write(bytes);
        if (closed) {
            peer.closeWriting();
        }
        return textOf<Error>([&] { Session::open(ends.in, ends.out, configOf(Role::Client)); });
    }

    // Refusal of a client that meets an engine with this hello; both ends' verdicts are read.
    std::string refusalOf(const msg_svc::protobuf::SessionHello& engineHello, std::uint32_t layout = 1) {
        const Ends ends = socketPair();
        wire::ByteEnd peer(ends.otherIn, ends.otherOut);
        auto opening = std::async(std::launch::async, [&] {
            return textOf<session::HandshakeRefused>([&] { Session::open(ends.in, ends.out, configOf(Role::Client)); });
        });
        peer.readHello();
        peer.write(wire::helloBytes(engineHello, layout));
        const msg_svc::protobuf::SessionVerdict verdict = peer.readVerdict();
        EXPECT_FALSE(verdict.accepted());
        peer.write(wire::verdictBytes(verdict));
        const std::string text = opening.get();
        EXPECT_EQ(text, "the session is refused: " + verdict.refusal());
        return verdict.refusal();
    }

    Registered protocol_{"test"};
};

}  // namespace testing_sessions
