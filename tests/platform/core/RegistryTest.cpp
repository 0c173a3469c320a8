#include "foundation/msg_svc/transport/layers/serialization/Registry.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "foundation/msg_svc/transport/layers/session/ProtocolRegistry.hpp"

namespace foundation::msg_svc::transport::layers {
namespace {

using serialization::Registry;
using serialization::SerializerBase;
using session::FeatureHandling;
using session::FeatureRequest;
using session::ProtocolRegistry;
using testing::ThrowsMessage;

std::shared_ptr<const SerializerBase> serializer(const std::string& name, const std::type_info& type) {
    return std::make_shared<const SerializerBase>(name, type, std::pair(1U, 0U));
}

TEST(RegistryTest, FindsByNameAndByExactType) {
    Registry registry;
    const auto ints = serializer("ints", typeid(int));
    const auto longs = serializer("longs", typeid(long));
    registry.insert(ints);
    registry.insert(longs);
    EXPECT_EQ(registry.find(std::string("ints")), ints);
    EXPECT_EQ(registry.find(std::type_index(typeid(long))), longs);
    EXPECT_EQ(ints->version(), std::pair(1U, 0U));
    EXPECT_EQ(ints->type(), typeid(int));
}

TEST(RegistryTest, UnknownNameOrTypeIsOutOfRange) {
    Registry registry;
    registry.insert(serializer("ints", typeid(int)));
    EXPECT_THAT(
        [&] { registry.find(std::string("Ints")); },
        ThrowsMessage<std::out_of_range>("Registry::find: no serializer is registered under the name \"Ints\""));
    EXPECT_THROW(registry.find(std::type_index(typeid(unsigned))), std::out_of_range);
}

// Two libraries may each have the description of one type.
struct DescriptionElsewhere : std::type_info {
    explicit DescriptionElsewhere(const char* name) : std::type_info(name) {}
};

TEST(RegistryTest, FindsATypeWhoseDescriptionStandsElsewhere) {
    Registry registry;
    const auto ints = serializer("ints", typeid(int));
    registry.insert(ints);
    const std::string name = typeid(int).name();
    const DescriptionElsewhere elsewhere(name.c_str());
    ASSERT_NE(elsewhere.name(), typeid(int).name());
    EXPECT_EQ(registry.find(std::type_index(elsewhere)), ints);
    EXPECT_THROW(registry.insert(serializer("more ints", elsewhere)), std::invalid_argument);
}

TEST(RegistryTest, NamesOfAllLengthsAreToldApart) {
    Registry registry;
    const std::vector<std::pair<std::string, const std::type_info*>> named{{"", &typeid(bool)},
                                                                           {"a", &typeid(char)},
                                                                           {"vent", &typeid(short)},
                                                                           {"aseEvent", &typeid(int)},
                                                                           {"1:aseEvent", &typeid(long)},
                                                                           {"2:aseEvent", &typeid(float)},
                                                                           {"22:aseEvent", &typeid(double)}};
    for (const auto& [name, type] : named) {
        registry.insert(serializer(name, *type));
    }
    for (const auto& [name, type] : named) {
        EXPECT_EQ(registry.find(name)->type(), *type) << name;
    }
    EXPECT_THROW(registry.find("3:aseEvent"), std::out_of_range);
}

TEST(RegistryTest, OnlyASerializerAPIIsOfAFamily) {
    EXPECT_EQ(serializer("ints", typeid(int))->family(), typeid(SerializerBase));
}

TEST(RegistryTest, KeepsTheOrderOfInsertion) {
    Registry registry;
    const auto first = serializer("z", typeid(int));
    const auto second = serializer("a", typeid(long));
    const auto third = serializer("m", typeid(char));
    for (const auto& one : {first, second, third}) {
        registry.insert(one);
    }
    EXPECT_THAT(registry.serializers(), testing::ElementsAre(first, second, third));
}

TEST(RegistryTest, DuplicateNameIsRefusedAndChangesNothing) {
    Registry registry;
    const auto ints = serializer("ints", typeid(int));
    registry.insert(ints);
    EXPECT_THAT(
        [&] { registry.insert(serializer("ints", typeid(long))); },
        ThrowsMessage<std::invalid_argument>("Registry::insert: a serializer named \"ints\" is registered already"));
    EXPECT_THAT(registry.serializers(), testing::ElementsAre(ints));
    EXPECT_THROW(registry.find(std::type_index(typeid(long))), std::out_of_range);
}

TEST(RegistryTest, DuplicateTypeIsRefusedAndChangesNothing) {
    Registry registry;
    const auto ints = serializer("ints", typeid(int));
    registry.insert(ints);
    EXPECT_THAT([&] { registry.insert(serializer("more ints", typeid(int))); },
                ThrowsMessage<std::invalid_argument>("Registry::insert: \"more ints\" handles the same type as "
                                                     "\"ints\", which is registered already"));
    EXPECT_THAT(registry.serializers(), testing::ElementsAre(ints));
    EXPECT_THROW(registry.find(std::string("more ints")), std::out_of_range);
}

TEST(RegistryTest, NullSerializerIsRefused) {
    Registry registry;
    EXPECT_THAT([&] { registry.insert(nullptr); },
                ThrowsMessage<std::invalid_argument>("Registry::insert: expected a serializer, got a null pointer"));
    EXPECT_TRUE(registry.serializers().empty());
}

class ProtocolRegistryTest : public testing::Test {
  protected:
    static session::ProtocolVersion initialize(const std::shared_ptr<Registry>& registry,
                                               const session::ProtocolVersion& version,
                                               const std::unordered_map<std::string, std::string>&) {
        registry->insert(serializer("ints", typeid(int)));
        return version;
    }
    static std::vector<FeatureRequest> configure() { return {FeatureRequest("a", "b", FeatureHandling::Optional)}; }

    ProtocolRegistry registry_;
};

TEST_F(ProtocolRegistryTest, FindsWhatWasRegistered) {
    registry_.registerProtocolInitializer("p", initialize, configure);
    const auto protocol = registry_.find("p");
    const auto serializers = std::make_shared<Registry>();
    EXPECT_EQ(protocol.initialize(serializers, {3, 4}, {}), session::ProtocolVersion(3, 4));
    EXPECT_EQ(serializers->serializers().size(), 1U);
    EXPECT_EQ(protocol.configuration(), configure());
}

TEST_F(ProtocolRegistryTest, DuplicateNameIsRefused) {
    registry_.registerProtocolInitializer("p", initialize, configure);
    EXPECT_THAT([&] { registry_.registerProtocolInitializer("p", initialize, configure); },
                ThrowsMessage<std::invalid_argument>("ProtocolRegistry: protocol \"p\" is registered already"));
}

TEST_F(ProtocolRegistryTest, UnknownNameIsOutOfRange) {
    EXPECT_THAT(
        [&] { registry_.find("q"); },
        ThrowsMessage<std::out_of_range>("ProtocolRegistry: no protocol named \"q\" is registered in this process"));
}

TEST_F(ProtocolRegistryTest, UnregisterForgetsAName) {
    registry_.registerProtocolInitializer("p", initialize, configure);
    EXPECT_TRUE(registry_.unregister("p"));
    EXPECT_FALSE(registry_.unregister("p"));
    EXPECT_THROW(registry_.find("p"), std::out_of_range);
}

TEST_F(ProtocolRegistryTest, ProcessHasOneRegistry) {
    EXPECT_EQ(ProtocolRegistry::getRegistry(), ProtocolRegistry::getRegistry());
    EXPECT_NE(ProtocolRegistry::getRegistry(), nullptr);
}

TEST(FeatureRequestTest, TellsWhatItWasGiven) {
    const FeatureRequest request("name", "value", FeatureHandling::Required);
    EXPECT_EQ(request.name(), "name");
    EXPECT_EQ(request.value(), "value");
    EXPECT_EQ(static_cast<int>(request.handling()), 3);
}

}  // namespace
}  // namespace foundation::msg_svc::transport::layers
