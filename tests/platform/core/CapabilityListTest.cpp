#include "capabilities/CapabilityList.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace capabilities {
namespace {

using testing::ElementsAre;

TEST(CapabilityListTest, DefaultIsEmpty) {
    const CapabilityList list;
    EXPECT_TRUE(list.empty());
    EXPECT_THAT(list.getEnabledCapabilitySequence(), testing::IsEmpty());
    EXPECT_EQ(toString(list), "none");
}

TEST(CapabilityListTest, MembersComeInAscendingOrderOnce) {
    CapabilityList list{Capability::Debugging, Capability::InteractiveCommandLine};
    list |= Capability::LocalClient;
    list |= Capability::LocalClient;
    EXPECT_THAT(list.getEnabledCapabilitySequence(),
                ElementsAre(Capability::InteractiveCommandLine, Capability::LocalClient, Capability::Debugging));
    EXPECT_TRUE(list.contains(Capability::LocalClient));
    EXPECT_FALSE(list.contains(Capability::Swing));
    EXPECT_FALSE(list.empty());
}

TEST(CapabilityListTest, NumberWithoutANameIsKeptUpTo63) {
    CapabilityList list;
    list |= static_cast<Capability>(63);
    list |= static_cast<Capability>(7);
    EXPECT_THAT(list.getEnabledCapabilitySequence(),
                ElementsAre(static_cast<Capability>(7), static_cast<Capability>(63)));
    EXPECT_EQ(toString(list), "7, 63");
}

TEST(CapabilityListTest, NumberAbove63IsOutOfRange) {
    CapabilityList list;
    EXPECT_THAT(
        [&] { list |= static_cast<Capability>(64); },
        testing::ThrowsMessage<std::out_of_range>("CapabilityList: expected a capability from 0 to 63, got 64"));
    EXPECT_THROW(list |= static_cast<Capability>(~0ULL), std::out_of_range);
    EXPECT_FALSE(list.contains(static_cast<Capability>(64)));
    EXPECT_TRUE(list.empty());
}

TEST(CapabilityListTest, WithoutKeepsWhatTheOtherLacks) {
    const CapabilityList wanted{Capability::Swing, Capability::Debugging, Capability::WebWindow};
    const CapabilityList there{Capability::Debugging, Capability::ModalDialogs};
    EXPECT_EQ(wanted.without(there), (CapabilityList{Capability::Swing, Capability::WebWindow}));
    EXPECT_EQ(toString(wanted.without(there)), "Swing, WebWindow");
    EXPECT_TRUE(wanted.without(wanted).empty());
}

TEST(CapabilityListTest, NamesAreThoseOfTheWire) {
    std::string names;
    for (std::uint64_t number = 0; number <= 6; ++number) {
        names += toString(static_cast<Capability>(number)) + " ";
    }
    EXPECT_EQ(names, "InteractiveCommandLine Swing ComplexSwing LocalClient WebWindow ModalDialogs Debugging ");
}

}  // namespace
}  // namespace capabilities
