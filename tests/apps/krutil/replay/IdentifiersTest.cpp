// Which identifier of a client stands for which one of a recording.
#include "krutil/replay/Identifiers.hpp"

#include <gtest/gtest.h>

#include <cstdint>
#include <string>
#include <utility>
#include <vector>

#include "krutil.protobuf.IIPCancelMessage.pb.h"
#include "krutil.protobuf.IIPEnqueueMessage.pb.h"
#include "krutil.protobuf.IssuedWarningEvent.pb.h"

namespace krutil_client {
namespace {

using Halves = std::pair<std::uint64_t, std::uint64_t>;

template <class Message>
Said saidRoot(const std::string& tag, const Message& message) {
    return {Said::Kind::Message, 1, {{true, 29, tag, message.SerializePartialAsString()}}, 0, 0};
}

Said requestWith(Halves identifier) {
    krutil::protobuf::IIPEnqueueMessage message;
    message.set_name("request");
    message.mutable_iipid()->set_hi(identifier.first);
    message.mutable_iipid()->set_lo(identifier.second);
    return saidRoot("krutil:IIPEnqueueMessage", message);
}

Said cancelOf(Halves identifier) {
    krutil::protobuf::IIPCancelMessage message;
    message.mutable_iipid()->set_hi(identifier.first);
    message.mutable_iipid()->set_lo(identifier.second);
    return saidRoot("krutil:IIPCancelMessage", message);
}

Halves identifierIn(const Said& said) {
    krutil::protobuf::IIPCancelMessage message;
    EXPECT_TRUE(message.ParsePartialFromString(said.frames.back().content));
    return {message.iipid().hi(), message.iipid().lo()};
}

// What identifiers become on their way to the client, and back.
Halves forClient(const Identifiers& identifiers, Halves recorded) {
    return identifierIn(identifiers.forClient(cancelOf(recorded)));
}

Halves asRecorded(const Identifiers& identifiers, Halves said) {
    return identifierIn(identifiers.asRecorded(cancelOf(said)));
}

TEST(IdentifiersTest, SamePlacesStandForEachOther) {
    Identifiers identifiers;
    identifiers.match(requestWith({1, 2}), requestWith({3, 4}));
    EXPECT_EQ(forClient(identifiers, {1, 2}), Halves(3, 4));
    EXPECT_EQ(asRecorded(identifiers, {3, 4}), Halves(1, 2));
    // Others stay as they are: half of an identifier is none, and each way has its own.
    for (const Halves& other : {Halves(1, 4), Halves(3, 2), Halves(3, 4), Halves(0, 0)}) {
        EXPECT_EQ(forClient(identifiers, other), other);
    }
    for (const Halves& other : {Halves(1, 4), Halves(3, 2), Halves(1, 2), Halves(0, 0)}) {
        EXPECT_EQ(asRecorded(identifiers, other), other);
    }
}

TEST(IdentifiersTest, FirstPartnerStays) {
    Identifiers identifiers;
    identifiers.match(requestWith({0, 1}), requestWith({0, 10}));
    // Either of the two has a partner.
    identifiers.match(requestWith({0, 1}), requestWith({0, 20}));
    identifiers.match(requestWith({0, 2}), requestWith({0, 10}));
    EXPECT_EQ(forClient(identifiers, {0, 1}), Halves(0, 10));
    EXPECT_EQ(forClient(identifiers, {0, 2}), Halves(0, 2));
    EXPECT_EQ(asRecorded(identifiers, {0, 10}), Halves(0, 1));
    EXPECT_EQ(asRecorded(identifiers, {0, 20}), Halves(0, 20));
    // Those that are left have none yet.
    identifiers.match(requestWith({0, 2}), requestWith({0, 20}));
    EXPECT_EQ(forClient(identifiers, {0, 2}), Halves(0, 20));
}

TEST(IdentifiersTest, NoIdentifierStandsForNone) {
    Identifiers identifiers;
    identifiers.match(requestWith({0, 0}), requestWith({0, 10}));
    identifiers.match(requestWith({0, 1}), requestWith({0, 0}));
    EXPECT_EQ(forClient(identifiers, {0, 0}), Halves(0, 0));
    EXPECT_EQ(forClient(identifiers, {0, 1}), Halves(0, 1));
    EXPECT_EQ(asRecorded(identifiers, {0, 10}), Halves(0, 10));
    // They still may find a partner.
    identifiers.match(requestWith({0, 1}), requestWith({0, 10}));
    EXPECT_EQ(forClient(identifiers, {0, 1}), Halves(0, 10));
}

TEST(IdentifiersTest, PlacesAreCountedFromTheRoot) {
    const auto behind = [](Said first, const Said& root) {
        first.frames.push_back(root.frames.back());
        return first;
    };
    const SaidFrame data{false, 11, {}, "elements"};
    Said recorded = behind(requestWith({0, 1}), requestWith({0, 2}));
    recorded.frames.insert(recorded.frames.begin(), data);
    recorded.frames.insert(recorded.frames.begin(), requestWith({0, 3}).frames.back());
    Identifiers identifiers;
    identifiers.match(recorded, behind(requestWith({0, 10}), requestWith({0, 20})));
    EXPECT_EQ(forClient(identifiers, {0, 1}), Halves(0, 10));
    EXPECT_EQ(forClient(identifiers, {0, 2}), Halves(0, 20));
    EXPECT_EQ(forClient(identifiers, {0, 3}), Halves(0, 3));
    // All frames are translated, and nothing else in them.
    const Said translated = identifiers.forClient(recorded);
    ASSERT_EQ(translated.frames.size(), 4U);
    EXPECT_EQ(translated.frames[0].content, recorded.frames[0].content);
    EXPECT_EQ(translated.frames[1].content, "elements");
    EXPECT_EQ(translated.frames[2].content, requestWith({0, 10}).frames.back().content);
    EXPECT_EQ(translated.frames[3].content, requestWith({0, 20}).frames.back().content);
}

TEST(IdentifiersTest, WhatCannotBeReadStaysAsItIs) {
    Said unreadable = requestWith({0, 1});
    unreadable.frames.back().content += '\x07';
    Said unknown = requestWith({0, 1});
    unknown.frames.back().tag = "other:Message";
    Said data = requestWith({0, 1});
    data.frames.back().tagged = false;
    Identifiers identifiers;
    identifiers.match(unreadable, requestWith({0, 10}));
    identifiers.match(unknown, requestWith({0, 10}));
    EXPECT_EQ(forClient(identifiers, {0, 1}), Halves(0, 1));
    identifiers.match(requestWith({0, 1}), requestWith({0, 10}));
    for (const Said& said : {unreadable, unknown, data}) {
        EXPECT_EQ(identifiers.forClient(said).frames.back().content, said.frames.back().content);
    }
}

TEST(IdentifiersTest, FieldsThatAreMissingDoNotMatter) {
    // A required field of the event is not there.
    krutil::protobuf::IssuedWarningEvent event;
    event.mutable_id()->set_lo(1);
    event.mutable_warning()->set_identifier("w");
    const Said recorded = saidRoot("korvel:lang:diagnostic:IssuedWarningEvent", event);
    event.mutable_id()->set_lo(10);
    const Said said = saidRoot("korvel:lang:diagnostic:IssuedWarningEvent", event);
    Identifiers identifiers;
    identifiers.match(recorded, said);
    EXPECT_EQ(identifiers.forClient(recorded).frames.back().content, said.frames.back().content);
    EXPECT_EQ(identifiers.asRecorded(said).frames.back().content, recorded.frames.back().content);
}

}  // namespace
}  // namespace krutil_client
