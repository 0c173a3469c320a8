#include "Casts.hpp"

#include <gtest/gtest.h>

#include "Families.hpp"
#include "QDASerializer.hpp"
#include "krutil_protobuf/support/TestTransport.hpp"

namespace krutil::protobuf_serializer {
namespace {

struct Base {
    virtual ~Base() = default;
};
struct Other {
    virtual ~Other() = default;
};
struct Exact : Base {};
struct Derived : Other, Exact {};
struct Virtual : virtual Base {};

TEST(DowncastTest, FindsTheClassAndWhatDerivesFromIt) {
    const Exact exact;
    const Derived derived;
    const Virtual ofVirtualBase;
    EXPECT_EQ(downcast<Exact>(static_cast<const Base*>(&exact)), &exact);
    EXPECT_EQ(downcast<Exact>(static_cast<const Base*>(&derived)), &derived);
    EXPECT_EQ(downcast<Virtual>(static_cast<const Base*>(&ofVirtualBase)), &ofVirtualBase);
    EXPECT_EQ(downcast<Derived>(static_cast<const Other*>(&derived)), &derived);
}

TEST(DowncastTest, AnythingElseIsNull) {
    const Base base;
    const Exact exact;
    EXPECT_EQ(downcast<Exact>(&base), nullptr);
    EXPECT_EQ(downcast<Derived>(static_cast<const Base*>(&exact)), nullptr);
    EXPECT_EQ(downcast<Exact>(static_cast<const Base*>(nullptr)), nullptr);
}

// What a platform that does not know families has.
struct Plain {
    virtual ~Plain() = default;
};
template <class T>
struct FamilyOf : Plain {};

TEST(FamilyCastTest, APlatformThatDoesNotKnowFamiliesIsAskedByDynamicCast) {
    const FamilyOf<int> ints;
    const Plain& plain = ints;
    EXPECT_EQ(familyCast<FamilyOf<int>>(plain), &ints);
    EXPECT_EQ(familyCast<FamilyOf<long>>(plain), nullptr);
}

template <class Family>
class FamilyCastOfTest : public testing::Test {};

using Families = testing::Types<EventFamily, IIPFamily, MessageFamily, ReplyFamily, ResultFamily, ArrayFamily>;
TYPED_TEST_SUITE(FamilyCastOfTest, Families);

TYPED_TEST(FamilyCastOfTest, AgreesWithADynamicCastForEverySerializer) {
    const auto registry = transport::sessionRegistry();
    int members = 0;
    for (const auto& serializer : registry->serializers()) {
        const auto* const expected = dynamic_cast<const TypeParam*>(serializer.get());
        EXPECT_EQ(familyCast<TypeParam>(*serializer), expected) << serializer->name();
        members += expected != nullptr ? 1 : 0;
    }
    EXPECT_GT(members, 0);
    EXPECT_LT(members, 25);
    // A serializer that is misplaced is still of its family.
    const transport::MisplacedSerializer<TypeParam> misplaced(typeid(int));
    const SerializerBase& base = misplaced;
    EXPECT_EQ(familyCast<TypeParam>(base), &misplaced);
}

}  // namespace
}  // namespace krutil::protobuf_serializer
