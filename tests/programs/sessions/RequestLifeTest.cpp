// The state machine of a request's life, the document that it is written from, and what reads traces with it.

#include "programs/support/RequestLife.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <fstream>
#include <sstream>
#include <tuple>

#include "programs/support/TracedSession.hpp"

namespace programs_test {
namespace {

using Rows = std::vector<std::tuple<std::string, std::string, std::string>>;

std::string trimmed(const std::string& text) {
    const auto begin = text.find_first_not_of(' ');
    return begin == std::string::npos ? std::string() : text.substr(begin, text.find_last_not_of(' ') + 1 - begin);
}

// What stands between the bars of a line of a table.
std::vector<std::string> cellsOf(const std::string& line) {
    std::vector<std::string> cells;
    std::istringstream in(line.substr(1));
    for (std::string cell; std::getline(in, cell, '|');) {
        cells.push_back(trimmed(cell));
    }
    return cells;
}

// What stands in backticks.
std::vector<std::string> namesOf(const std::string& cell) {
    std::vector<std::string> names;
    std::istringstream in(cell);
    bool inside = false;
    for (std::string piece; std::getline(in, piece, '`'); inside = !inside) {
        if (inside) {
            names.push_back(piece);
        }
    }
    return names;
}

Rows documentedRows() {
    std::ifstream document(KRUTIL_PROTOCOL_DOCUMENT);
    EXPECT_TRUE(document) << KRUTIL_PROTOCOL_DOCUMENT;
    Rows rows;
    bool chapter = false;
    for (std::string line; std::getline(document, line);) {
        if (line.starts_with("## ")) {
            chapter = line == "## The life of a request";
        } else if (chapter && line.starts_with("| ") && !line.starts_with("| state |")) {
            const auto cells = cellsOf(line);
            for (const std::string& name : namesOf(cells.at(1))) {
                rows.emplace_back(cells.at(0), name, cells.at(2));
            }
        }
    }
    return rows;
}

TEST(RequestLifeTest, TheTableIsThatOfTheDocument) {
    Rows rows;
    for (const auto& [state, happening, next] : RequestLife::table) {
        rows.emplace_back(state, happening, next);
    }
    EXPECT_EQ(documentedRows(), rows);
}

TEST(RequestLifeTest, WholeLivesAreLegal) {
    using Life = std::vector<std::string>;
    for (const Life& life :
         {Life{"IIPStartedEvent", "IIPCompletedEvent", "LastIIPEvent", "IIPReply"},
          Life{"IIPDiscardedEvent", "LastIIPEvent", "IIPReply"},
          Life{"IIPRequeuedEvent", "IIPReactivatedEvent", "IIPStartedEvent", "TextBaseEvent", "IIPSuspendedEvent",
               "DebugLoopEvent", "DebugLoopEvent", "IIPResumedEvent", "SinkTextEvent", "PrintableErrorEvent",
               "IIPCompletedEvent", "LastIIPEvent", "IIPReply"}}) {
        EXPECT_EQ(RequestLife::check(life), "");
    }
}

TEST(RequestLifeTest, WhatIsWrongIsToldWithTheHistory) {
    EXPECT_EQ(RequestLife::check({"IIPCompletedEvent"}),
              "\"IIPCompletedEvent\" must not come when the request is queued (so far: nothing)");
    EXPECT_EQ(RequestLife::check({"IIPStartedEvent", "IIPDiscardedEvent"}),
              "\"IIPDiscardedEvent\" must not come when the request is running (so far: IIPStartedEvent)");
    EXPECT_EQ(RequestLife::check({"IIPStartedEvent", "TextBaseEvent", "TextBaseEvent", "IIPCompletedEvent",
                                  "LastIIPEvent", "LastIIPEvent"}),
              "\"LastIIPEvent\" must not come when the request is closed (so far: IIPStartedEvent, TextBaseEvent x 2, "
              "IIPCompletedEvent, LastIIPEvent)");
    EXPECT_EQ(RequestLife::check({"IIPDiscardedEvent", "IIPReply"}),
              "\"IIPReply\" must not come when the request is ended (so far: IIPDiscardedEvent)");
    EXPECT_EQ(RequestLife::check({"IIPDiscardedEvent", "LastIIPEvent", "IIPReply", "IIPReply"}),
              "\"IIPReply\" must not come when the request is done (so far: IIPDiscardedEvent, LastIIPEvent, "
              "IIPReply)");
    EXPECT_EQ(RequestLife::check({"IIPDiscardedEvent", "LastIIPEvent"}),
              "the life of a request must not end when the request is closed (so far: IIPDiscardedEvent, "
              "LastIIPEvent)");
}

// Lines of a trace in short: "> 1 IIPEnqueueMessage" for one that goes to the engine.
std::string wrongIn(const std::vector<std::string>& lines, TraceEnd end) {
    std::stringstream trace;
    for (const std::string& each : lines) {
        std::istringstream words(each);
        std::string arrow;
        std::string stream;
        std::string name;
        words >> arrow >> stream >> name;
        trace << (arrow == ">" ? "--> " : "<-- ") << "stream " << stream << " frame 1 last type 29 krutil:a::" << name
              << " 17 bytes: text: \" last type 29 krutil:IIPReply \"\n";
    }
    return wrongLives(trace, end);
}

TEST(TracedSessionTest, EachStreamHasALifeOfItsOwn) {
    const std::vector<std::string> lines{
        "> 1 IIPEnqueueMessage", "< 1 IIPStartedEvent",   "> 2 IIPCancelMessage",  "< 1 IIPSuspendedEvent",
        "> 3 IIPEnqueueMessage", "< 3 IIPDiscardedEvent", "< 2 IIPCancelReply",    "< 0 TextBaseEvent",
        "< 3 LastIIPEvent",      "< 3 IIPReply",          "< 1 IIPResumedEvent",   "< 1 IIPCompletedEvent",
        "< 1 LastIIPEvent",      "< 1 IIPReply",          "> 3 IIPEnqueueMessage", "< 3 IIPDiscardedEvent",
        "< 3 LastIIPEvent",      "< 3 IIPReply",          "< 0 QVMShutdownEvent"};
    EXPECT_EQ(wrongIn(lines, TraceEnd::InOrder), "");
}

TEST(TracedSessionTest, WhatIsWrongIsToldForEachStream) {
    const std::vector<std::string> lines{"> 1 IIPEnqueueMessage", "> 2 IIPEnqueueMessage", "> 3 IIPCancelMessage",
                                         "< 2 IIPReply",          "< 3 IIPReply",          "< 4 TextBaseEvent",
                                         "< 1 IIPStartedEvent"};
    const std::string early =
        "stream 2: \"IIPReply\" must not come when the request is queued (so far: nothing)\n"
        "stream 3: \"IIPReply\" is no answer to a cancel\n"
        "stream 4: \"TextBaseEvent\" belongs to no exchange\n";
    EXPECT_EQ(wrongIn(lines, TraceEnd::Early), early);
    EXPECT_EQ(wrongIn(lines, TraceEnd::InOrder),
              early +
                  "stream 1: the life of a request must not end when the request is running (so far: "
                  "IIPStartedEvent)\n"
                  "stream 2: the life of a request must not end when the request is queued (so far: nothing)\n");
}

TEST(TracedSessionTest, TheLastMessageIsTheOneThatAClientRefused) {
    const std::vector<std::string> lines{"> 1 IIPEnqueueMessage", "< 1 IIPStartedEvent", "< 1 IIPStartedEvent",
                                         "> 2 IIPCancelMessage"};
    EXPECT_EQ(wrongIn(lines, TraceEnd::Refused), "");
    EXPECT_EQ(wrongIn(lines, TraceEnd::Early),
              "stream 1: \"IIPStartedEvent\" must not come when the request is running (so far: IIPStartedEvent)\n");
}

TEST(TracedSessionTest, APieceOfALineIsNoFrame) {
    std::istringstream trace(
        "--> stream 1 frame 2 last type 27 krutil:IIPEnqueueMessage 0 bytes\n"
        "<-- stream 1 frame 1 last type 29 krutil:IIPReply");
    EXPECT_EQ(wrongLives(trace, TraceEnd::Early), "");
}

TEST(TracedSessionTest, LinesOfAnotherKindAreNoTrace) {
    std::istringstream lines("1 IIPEnqueueMessage\n1 IIPReply\n");
    EXPECT_EQ(wrongLives(lines, TraceEnd::InOrder), "no line of the trace tells the last frame of a message\n");
    std::istringstream nothing;
    EXPECT_EQ(wrongLives(nothing, TraceEnd::InOrder), "");
}

TEST(TracedSessionTest, OtherCommandsAreLeftAlone) {
    for (const std::vector<std::string>& command :
         {std::vector<std::string>{"/bin/sh", "eval", "1"}, {"eval"}, {"krutil", "eval", "1"}}) {
        std::vector<std::string> now = command;
        const TracedSession session(now);
        EXPECT_EQ(now, command);
        EXPECT_EQ(session.whatIsWrong(0, ""), "");
    }
}

}  // namespace
}  // namespace programs_test
