// Who may say what, and when: every cell of the table.
#include "foundation/msg_svc/transport/layers/session/Exchanges.hpp"

#include <gtest/gtest.h>

#include <array>
#include <string>
#include <vector>

#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"

namespace foundation::msg_svc::transport::layers::session {
namespace {

constexpr std::array phases{Phase::Talking, Phase::ClientDone, Phase::EngineDone, Phase::BothDone};
constexpr std::array sayings{Saying::Message,     Saying::Reply,    Saying::Event,
                             Saying::SharedEvent, Saying::Shutdown, Saying::Goodbye};
constexpr std::array roles{Role::Client, Role::Engine};
constexpr framing::StreamID openStream = 7;
constexpr framing::StreamID freeStream = 9;

Role other(Role role) {
    return role == Role::Client ? Role::Engine : Role::Client;
}

std::string nameOf(Phase phase) {
    constexpr std::array names{"Talking", "ClientDone", "EngineDone", "BothDone"};
    return names.at(static_cast<std::size_t>(phase));
}

std::string nameOf(Saying saying) {
    constexpr std::array names{"Message", "Reply", "Event", "SharedEvent", "Shutdown", "Goodbye"};
    return names.at(static_cast<std::size_t>(saying));
}

std::string nameOf(Role role) {
    return role == Role::Client ? "client" : "engine";
}

// `speaker` says something in the book of the end that is `own`.
std::optional<Refusal> say(Exchanges& exchanges, Role own, Role speaker, Saying saying, framing::StreamID stream) {
    return speaker == own ? exchanges.send(saying, stream) : exchanges.receive(saying, stream);
}

// The book of an end in this phase, with one exchange open.
Exchanges bookIn(Phase phase, Role own) {
    Exchanges exchanges(own);
    EXPECT_EQ(say(exchanges, own, Role::Client, Saying::Message, openStream), std::nullopt);
    if (phase == Phase::EngineDone || phase == Phase::BothDone) {
        EXPECT_EQ(say(exchanges, own, Role::Engine, Saying::Shutdown, 0), std::nullopt);
    }
    if (phase == Phase::ClientDone || phase == Phase::BothDone) {
        EXPECT_EQ(say(exchanges, own, Role::Client, Saying::Goodbye, 0), std::nullopt);
    }
    EXPECT_EQ(exchanges.phase(), phase);
    return exchanges;
}

// What the table is meant to say, written the other way round.
bool everSays(Role speaker, Saying saying) {
    switch (saying) {
        case Saying::Message:
        case Saying::Goodbye:
            return speaker == Role::Client;
        case Saying::Reply:
        case Saying::Event:
        case Saying::Shutdown:
            return speaker == Role::Engine;
        case Saying::SharedEvent:
            break;
    }
    return true;
}

bool isDone(Role speaker, Phase phase) {
    return phase == Phase::BothDone || phase == (speaker == Role::Client ? Phase::ClientDone : Phase::EngineDone);
}

Phase after(Saying saying, Phase phase) {
    if (saying == Saying::Goodbye) {
        return phase == Phase::Talking ? Phase::ClientDone : Phase::BothDone;
    }
    if (saying == Saying::Shutdown) {
        return phase == Phase::Talking ? Phase::EngineDone : Phase::BothDone;
    }
    return phase;
}

std::optional<Refusal> streamRefusal(Role own, Role speaker, Saying saying, framing::StreamID stream) {
    const bool open = stream == openStream;
    switch (saying) {
        case Saying::Message:
            return stream == 0 || open ? std::optional(Refusal::StreamNotNew) : std::nullopt;
        case Saying::Reply:
            return open ? std::nullopt : std::optional(Refusal::StreamNotOpen);
        case Saying::Goodbye:
            return std::nullopt;
        case Saying::SharedEvent:
            if (speaker == Role::Client && own == Role::Client && stream != 0) {
                return Refusal::StreamNotZero;
            }
            break;
        case Saying::Event:
        case Saying::Shutdown:
            break;
    }
    return stream == 0 || open ? std::nullopt : std::optional(Refusal::StreamNotZeroOrOpen);
}

TEST(ExchangesTest, EveryCellOfTheTable) {
    for (const Phase phase : phases) {
        for (const Role own : roles) {
            for (const Role speaker : roles) {
                for (const Saying saying : sayings) {
                    for (const framing::StreamID stream : {framing::StreamID{0}, openStream, freeStream}) {
                        Exchanges exchanges = bookIn(phase, own);
                        std::optional<Refusal> expected;
                        if (!everSays(speaker, saying)) {
                            expected = Refusal::WrongSpeaker;
                        } else if (isDone(speaker, phase)) {
                            expected = speaker == Role::Client ? Refusal::AfterGoodbye : Refusal::AfterShutdown;
                        } else {
                            expected = streamRefusal(own, speaker, saying, stream);
                        }
                        const std::string cell = nameOf(phase) + ": at the " + nameOf(own) + ", the " +
                                                 nameOf(speaker) + " says " + nameOf(saying) + " on stream " +
                                                 std::to_string(stream);
                        EXPECT_EQ(say(exchanges, own, speaker, saying, stream), expected) << cell;
                        EXPECT_EQ(exchanges.phase(), expected ? phase : after(saying, phase)) << cell;
                    }
                }
            }
        }
    }
}

TEST(ExchangesTest, LastWordsAreKnownByRole) {
    for (const Phase phase : phases) {
        for (const Role own : roles) {
            const Exchanges exchanges = bookIn(phase, own);
            for (const Role role : roles) {
                EXPECT_EQ(exchanges.isDone(role), isDone(role, phase)) << nameOf(phase) << " " << nameOf(role);
            }
            const Role peer = other(own);
            const auto expected = peer == Role::Client ? Refusal::AfterGoodbye : Refusal::AfterShutdown;
            EXPECT_EQ(exchanges.receiveAnything(), isDone(peer, phase) ? std::optional(expected) : std::nullopt);
        }
    }
}

TEST(ExchangesTest, WhatAnEndMaySendItsPeerMayReceive) {
    // Two books, as the ends of one session have them: whatever one end is allowed, the other must not refuse.
    for (const Role speaker : roles) {
        for (const Saying saying : sayings) {
            for (const framing::StreamID stream : {framing::StreamID{0}, openStream, freeStream}) {
                for (const Phase phase : phases) {
                    Exchanges sender = bookIn(phase, speaker);
                    Exchanges receiver = bookIn(phase, other(speaker));
                    if (!sender.send(saying, stream)) {
                        EXPECT_EQ(receiver.receive(saying, stream), std::nullopt) << nameOf(phase) << nameOf(saying);
                        EXPECT_EQ(receiver.phase(), sender.phase());
                    }
                }
            }
        }
    }
}

TEST(ExchangesTest, ReplyFreesItsStream) {
    for (const Role own : roles) {
        Exchanges exchanges = bookIn(Phase::Talking, own);
        EXPECT_EQ(say(exchanges, own, Role::Engine, Saying::Reply, openStream), std::nullopt);
        EXPECT_EQ(say(exchanges, own, Role::Engine, Saying::Reply, openStream), Refusal::StreamNotOpen);
        EXPECT_EQ(say(exchanges, own, Role::Engine, Saying::Event, openStream), Refusal::StreamNotZeroOrOpen);
        EXPECT_EQ(say(exchanges, own, Role::Client, Saying::Message, openStream), std::nullopt);
    }
}

TEST(ExchangesTest, RefusedMessageOpensNothing) {
    Exchanges exchanges = bookIn(Phase::ClientDone, Role::Client);
    EXPECT_EQ(exchanges.send(Saying::Message, freeStream), Refusal::AfterGoodbye);
    EXPECT_EQ(exchanges.receive(Saying::Reply, freeStream), Refusal::StreamNotOpen);
}

TEST(ExchangesTest, NewStreamIDsAreNeitherZeroNorOpen) {
    Exchanges exchanges(Role::Client);
    EXPECT_EQ(exchanges.send(Saying::Message, 2), std::nullopt);
    EXPECT_EQ(exchanges.newStreamID(), 1U);
    EXPECT_EQ(exchanges.newStreamID(), 3U);
}

class OrdinaryEvent : public eventmgr::BaseEvent {};
class LastEvent : public eventmgr::BaseEvent {};
class NewsOfEither : public eventmgr::BaseEvent {};

TEST(ExchangesTest, ConfigurationTellsWhatAnEventIs) {
    SessionConfig config;
    EXPECT_EQ(sayingOfEvent(typeid(LastEvent), config), Saying::Event);
    config.shutdownEvent = typeid(LastEvent);
    config.clientEvents = {typeid(NewsOfEither)};
    EXPECT_EQ(sayingOfEvent(typeid(LastEvent), config), Saying::Shutdown);
    EXPECT_EQ(sayingOfEvent(typeid(NewsOfEither), config), Saying::SharedEvent);
    EXPECT_EQ(sayingOfEvent(typeid(OrdinaryEvent), config), Saying::Event);
}

}  // namespace
}  // namespace foundation::msg_svc::transport::layers::session
