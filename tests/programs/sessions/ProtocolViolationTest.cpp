// Engines that break the protocol, and engines of another version.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>

#include "programs/support/Program.hpp"

namespace programs_test {
namespace {

using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::StartsWith;

struct Violation {
    const char* scene;
    const char* said;  ///< part of the sentence
};

void PrintTo(const Violation& violation, std::ostream* out) {
    *out << violation.scene;
}

class ProtocolViolationTest : public ::testing::TestWithParam<Violation> {};

TEST_P(ProtocolViolationTest, IsNamedAndEndsTheProgram) {
    const Ran ran = runClient({"eval", "--engine", "exec " + fakeEngine(GetParam().scene), "1"});
    EXPECT_THAT(ran.err, StartsWith("krutil: "));
    EXPECT_THAT(ran.err, HasSubstr(GetParam().said));
    EXPECT_THAT(ran.err, EndsWith("\n"));
    EXPECT_EQ(std::count(ran.err.begin(), ran.err.end(), '\n'), 1) << ran.err;
    EXPECT_EQ(ran.exitCode, 4);
}

INSTANTIATE_TEST_SUITE_P(Scenes, ProtocolViolationTest,
                         ::testing::Values(Violation{"unknown-tag", "krutil:Nonsense"},                 //
                                           Violation{"result-as-root", "krutil:IIPResult"},             //
                                           Violation{"new-exchange", "krutil:IIPEnqueueMessage"},       //
                                           Violation{"data-last", "data frame"},                        //
                                           Violation{"reply-to-nothing", "1234"},                       //
                                           Violation{"second-reply", "krutil:IIPReply"},                //
                                           Violation{"reply-of-another-request", "another"},            //
                                           Violation{"event-of-nothing", "1234"},                       //
                                           Violation{"wrong-index", "frame index: expected 1, got 2"},  //
                                           Violation{"index-zero", "frame index: expected 1, got 0"},   //
                                           Violation{"wrong-frame-type", "krutil:TextBaseEvent"},       //
                                           Violation{"reply-without-its-result", "krutil:IIPReply"},    //
                                           Violation{"empty-tag", "tag"},                               //
                                           Violation{"long-tag", "\"tag\": expected at most 128"},      //
                                           Violation{"huge-frame", "at most 67108864"},                 //
                                           Violation{"text-after-reply", "krutil:TextBaseEvent"},       //
                                           Violation{"nothing-after-shutdown", "shutdown"}),
                         [](const ::testing::TestParamInfo<Violation>& scene) {
                             std::string name = scene.param.scene;
                             std::replace(name.begin(), name.end(), '-', '_');
                             return name;
                         });

TEST(ProgramsHandshakeTest, EveryMismatchIsListed) {
    const Ran ran = runClient({"eval", "--engine", "exec " + fakeEngine("other-version"), "1"});
    EXPECT_EQ(ran.err,
              "krutil: the session is refused: protocol version: the client has (1, 0), the engine (2, 7); feature "
              "\"ZEROCOPY\": the client accepts \"enable\", \"disable\", the engine \"sometimes\"\n");
    EXPECT_EQ(ran.out, "");
    EXPECT_EQ(ran.exitCode, 5);
}

TEST(ProgramsHandshakeTest, AReplyWithoutAResultIsASuccess) {
    const Ran ran = runClient({"eval", "--engine", "exec " + fakeEngine("reply-without-result"), "1"});
    EXPECT_EQ(ran.out + ran.err, "");
    EXPECT_EQ(ran.exitCode, 0);
}

TEST(ProgramsHandshakeTest, TextThatIsNotUtf8IsShownWithReplacementsAndNoError) {
    const Ran ran = runClient({"eval", "--json", "--engine", "exec " + fakeEngine("bad-text"), "1"});
    EXPECT_THAT(ran.out, HasSubstr("\"text\":\"a\uFFFDbc\""));
    EXPECT_EQ(ran.exitCode, 0);
}

}  // namespace
}  // namespace programs_test
