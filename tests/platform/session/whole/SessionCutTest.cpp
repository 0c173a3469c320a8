// A whole session, cut at each of its bytes.

#include <pty.h>
#include <termios.h>

#include <thread>

#include "platform/session/support/TestSessions.hpp"
#include "platform/session/support/WireBytes.hpp"

namespace testing_sessions {
namespace {

class SessionCutTest : public testing::Test {
  protected:
    // Feeds the first `cut` bytes of what a peer says to a real end, then ends the stream; returns what the handler
    // saw.
    static std::vector<std::string> cutAt(Role role, const std::string& bytes, std::size_t cut) {
        SessionWithBytes end(configOf(role));
        if (role == Role::Client) {
            end.session->send(1, question("q"));
        }
        end.peer->write(bytes.substr(0, cut));
        end.peer->closeWriting();
        if (role == Role::Engine && cut == bytes.size()) {
            end.saw.waitForLines(4);
            return end.saw.lines();
        }
        end.saw.waitForEnd();
        return end.saw.lines();
    }

    // Every cut gives a beginning of what the whole gives, and an end that says that the stream was lost.
    static void cutEverywhere(Role role, const std::string& bytes) {
        const std::vector<std::string> whole = cutAt(role, bytes, bytes.size());
        for (std::size_t cut = 0; cut < bytes.size(); ++cut) {
            std::vector<std::string> lines = cutAt(role, bytes, cut);
            ASSERT_FALSE(lines.empty());
            const std::string end = lines.back();
            lines.pop_back();
            ASSERT_TRUE(end.starts_with("end: lost: the stream ended ")) << cut << ": " << end;
            ASSERT_LE(lines.size(), whole.size());
            ASSERT_TRUE(std::equal(lines.begin(), lines.end(), whole.begin())) << cut;
        }
    }

    Registered protocol_{"test"};
};

TEST_F(SessionCutTest, WhatAnEngineSays) {
    const std::string bytes = wire::tagged(0, 1, true, noticeTag, "background") +
                              wire::tagged(1, 1, true, noticeTag, "working") +
                              wire::tagged(1, 1, true, answerTag, "done") + wire::tagged(0, 1, true, shutdownTag, "");
    EXPECT_EQ(cutAt(Role::Client, bytes, bytes.size()),
              (std::vector<std::string>{"event 0 background", "event 1 working", "answer 1 done", "event 0 shutdown",
                                        "end: finished"}));
    cutEverywhere(Role::Client, bytes);
}

TEST_F(SessionCutTest, WhatAClientSays) {
    const std::string bytes = wire::data(1, 1, false, "bulk bytes") + wire::data(1, 2, false, "") +
                              wire::tagged(1, 3, true, questionTag, "first") +
                              wire::tagged(0, 1, true, capabilitiesTag, "") +
                              wire::tagged(2, 1, true, questionTag, "second") + wire::goodbye();
    EXPECT_EQ(cutAt(Role::Engine, bytes, bytes.size()),
              (std::vector<std::string>{"question 1 first", "event 0 capabilities", "question 2 second", "goodbye"}));
    cutEverywhere(Role::Engine, bytes);
}

// A terminal that was hung up fails to be read, unlike a socket.
TEST_F(SessionCutTest, ReadThatFailsEndsTheSessionWithTheReason) {
    int hangsUp = -1;
    int fails = -1;
    ASSERT_EQ(::openpty(&fails, &hangsUp, nullptr, nullptr, nullptr), 0);
    termios settings{};
    ::tcgetattr(hangsUp, &settings);
    ::cfmakeraw(&settings);
    ::tcsetattr(hangsUp, TCSANOW, &settings);
    SessionWithBytes end(configOf(Role::Engine), {fails, fails, hangsUp, hangsUp});
    end.peer->write(wire::tagged(1, 1, true, questionTag, "first"));
    end.saw.waitForLines(1);
    end.peer->close();
    EXPECT_THAT(end.saw.waitForEnd(), isEnd(Reason::Lost, "cannot read from the stream: Input/output error"));
}

// A read that gets as much as it asked for is followed by one that finds nothing and leaves an error number behind.
TEST_F(SessionCutTest, StreamThatEndsLongAfterAReadThatFoundNothing) {
    constexpr std::size_t askedFor = 4096;
    SessionWithBytes end(configOf(Role::Engine));
    const std::string whole = wire::tagged(1, 1, true, questionTag, "");
    end.peer->write(wire::tagged(1, 1, true, questionTag, std::string(askedFor - whole.size(), 'q')));
    end.saw.waitForLines(1);
    end.peer->closeWriting();
    EXPECT_THAT(end.saw.waitForEnd(),
                isEnd(Reason::Lost, "the stream ended between two messages, without the client's goodbye"));
}

}  // namespace
}  // namespace testing_sessions
