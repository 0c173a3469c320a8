// Sets of capabilities, and the event that tells that they changed.

#include <gtest/gtest.h>

#include <stdexcept>

#include "CapabilitiesChangedSerializer.hpp"
#include "CapabilityConversions.hpp"
#include "krutil_protobuf/support/TestTransport.hpp"

namespace {

using capabilities::Capability;
using capabilities::CapabilityList;
using google::protobuf::RepeatedField;
using krutil::protobuf_serializer::CapabilitiesChangedSerializer;
using krutil::protobuf_serializer::fromProtobuf;
using krutil::protobuf_serializer::toProtobuf;
using transport::errorText;

std::vector<int> numbers(const RepeatedField<int>& field) {
    return {field.begin(), field.end()};
}

RepeatedField<int> field(const std::vector<int>& values) {
    return {values.begin(), values.end()};
}

TEST(CapabilityConversionsTest, WireNumbersAreTheHostsPlusOneInTheSetsOrder) {
    RepeatedField<int> written;
    toProtobuf(CapabilityList{Capability::Debugging, Capability::InteractiveCommandLine}, &written);
    EXPECT_EQ(numbers(written), (std::vector{1, 7}));
    for (unsigned int number = 0; number <= 6; ++number) {
        RepeatedField<int> one;
        toProtobuf(CapabilityList{static_cast<Capability>(number)}, &one);
        EXPECT_EQ(numbers(one), std::vector{static_cast<int>(number) + 1});
        EXPECT_EQ(fromProtobuf(one), CapabilityList{static_cast<Capability>(number)});
    }
}

TEST(CapabilityConversionsTest, UnknownWireNumbersAreSkippedAndDuplicatesCountOnce) {
    EXPECT_EQ(fromProtobuf(field({0, 3, 9, -1, 3})), CapabilityList{Capability::ComplexSwing});
    EXPECT_EQ(fromProtobuf(field({8, -2147483647 - 1, 2147483647})), CapabilityList());
}

TEST(CapabilityConversionsTest, UnknownHostNumbersAreSkipped) {
    RepeatedField<int> written;
    toProtobuf(CapabilityList{static_cast<Capability>(7), Capability::Swing, static_cast<Capability>(63)}, &written);
    EXPECT_EQ(numbers(written), std::vector{2});
}

TEST(CapabilityConversionsTest, TheFieldIsAppendedTo) {
    RepeatedField<int> written = field({5});
    toProtobuf(CapabilityList{Capability::InteractiveCommandLine, Capability::Debugging}, &written);
    EXPECT_EQ(numbers(written), (std::vector{5, 1, 7}));
}

TEST(CapabilityConversionsTest, AnEmptySetIsAnEmptyFieldAndAnAbsentFieldAnEmptySet) {
    RepeatedField<int> written;
    toProtobuf(CapabilityList(), &written);
    EXPECT_TRUE(written.empty());
    EXPECT_EQ(fromProtobuf(krutil::protobuf::CapabilitiesChanged().qvmcapabilities()), CapabilityList());
}

TEST(CapabilityConversionsTest, ANullFieldIsAnInvalidArgument) {
    EXPECT_EQ(errorText<std::invalid_argument>([] { toProtobuf(CapabilityList{Capability::Swing}, nullptr); }),
              "repeatedField must not be nulptr");
    EXPECT_EQ(errorText<std::invalid_argument>([] { toProtobuf(CapabilityList(), nullptr); }),
              "repeatedField must not be nulptr");
}

TEST(CapabilitiesChangedTest, EachListTravelsInItsOwnField) {
    const krutil::capabilities_api::CapabilitiesChanged event(
        CapabilityList{Capability::InteractiveCommandLine}, CapabilityList{Capability::Swing},
        CapabilityList{Capability::ComplexSwing}, CapabilityList{Capability::LocalClient});
    const auto proto = CapabilitiesChangedSerializer::toProtobuf(event);
    EXPECT_EQ(numbers(proto.previouscapabilities()), std::vector{1});
    EXPECT_EQ(numbers(proto.qvmcapabilities()), std::vector{2});
    EXPECT_EQ(numbers(proto.clientcapabilities()), std::vector{3});
    EXPECT_EQ(numbers(proto.requestcapabilities()), std::vector{4});
    // Packed, in the order of the fields.
    EXPECT_EQ(proto.SerializeAsString(), "\x0A\x01\x01\x12\x01\x02\x1A\x01\x03\x22\x01\x04");

    const auto back = CapabilitiesChangedSerializer::fromProtobuf(proto);
    const auto& typed = dynamic_cast<const krutil::capabilities_api::CapabilitiesChanged&>(*back);
    EXPECT_EQ(typed.getPreviousCapabilities(), event.getPreviousCapabilities());
    EXPECT_EQ(typed.getQvmCapabilities(), event.getQvmCapabilities());
    EXPECT_EQ(typed.getClientCapabilities(), event.getClientCapabilities());
    EXPECT_EQ(typed.getRequestCapabilities(), event.getRequestCapabilities());
}

TEST(CapabilitiesChangedTest, FieldsThatAreNotPackedAreReadToo) {
    krutil::protobuf::CapabilitiesChanged proto;
    ASSERT_TRUE(proto.ParseFromString("\x08\x03\x08\x07"));
    EXPECT_EQ(numbers(proto.previouscapabilities()), (std::vector{3, 7}));
}

}  // namespace
