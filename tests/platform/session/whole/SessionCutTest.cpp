// A whole session, cut at each of its bytes.

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

}  // namespace
}  // namespace testing_sessions
