#include "foundation/msg_svc/exchange/IDType.hpp"

#include <gtest/gtest.h>

#include <limits>
#include <set>
#include <sstream>
#include <unordered_set>

#include "msg_svc.protobuf.IDType.pb.h"
#include "msg_svc/protobuf_serializer/IDTypeSerializer.hpp"

namespace foundation::msg_svc::exchange {
namespace {

using ::msg_svc::protobuf_serializer::IDTypeSerializer;

constexpr std::uint64_t most = std::numeric_limits<std::uint64_t>::max();

TEST(IDTypeTest, DefaultIsNoIdentifier) {
    EXPECT_EQ(IDType().hi(), 0U);
    EXPECT_EQ(IDType().lo(), 0U);
    EXPECT_EQ(IDType(), IDType(0, 0));
}

TEST(IDTypeTest, HalvesAreNotInterchangeable) {
    EXPECT_EQ(IDType(1, 2).hi(), 1U);
    EXPECT_EQ(IDType(1, 2).lo(), 2U);
    EXPECT_NE(IDType(1, 2), IDType(2, 1));
    EXPECT_LT(IDType(1, most), IDType(2, 0));
}

TEST(IDTypeTest, PrintsBothHalvesInHexadecimal) {
    EXPECT_EQ(toString(IDType(0x0123456789abcdef, 1)), "0123456789abcdef0000000000000001");
    std::ostringstream out;
    out << IDType(most, 0);
    EXPECT_EQ(out.str(), "ffffffffffffffff0000000000000000");
}

TEST(IDTypeTest, HashTellsHalvesApart) {
    const std::unordered_set<IDType> ids{IDType(1, 2), IDType(2, 1), IDType(1, 2), IDType()};
    EXPECT_EQ(ids.size(), 3U);
    EXPECT_NE(std::hash<IDType>()(IDType(1, 2)), std::hash<IDType>()(IDType(2, 1)));
}

TEST(IDTypeTest, RandomOnesDiffer) {
    std::set<IDType> ids;
    for (int i = 0; i < 1000; ++i) {
        ids.insert(IDType::random());
    }
    EXPECT_EQ(ids.size(), 1000U);
    EXPECT_FALSE(ids.contains(IDType()));
}

TEST(IDTypeTest, RoundTripsThroughItsMessage) {
    for (const IDType& id : {IDType(), IDType(1, 2), IDType(most, most), IDType(0, 7), IDType(7, 0)}) {
        EXPECT_EQ(IDTypeSerializer::fromProtobuf(IDTypeSerializer::toProtobuf(id)), id);
    }
}

TEST(IDTypeTest, WireFieldsAreHiThenLo) {
    EXPECT_EQ(IDTypeSerializer::toProtobuf(IDType(1, 300)).SerializeAsString(), std::string("\x08\x01\x10\xac\x02"));
    EXPECT_EQ(IDTypeSerializer::toProtobuf(IDType()).SerializeAsString(), "");
}

}  // namespace
}  // namespace foundation::msg_svc::exchange
