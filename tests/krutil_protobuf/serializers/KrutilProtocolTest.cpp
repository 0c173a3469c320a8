// The initializer and the configuration, called directly. Registration needs fresh processes; its tests are with the
// shared library's.

#include "KrutilProtocol.hpp"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <set>
#include <stdexcept>
#include <type_traits>

#include "CapabilitiesChangedSerializer.hpp"
#include "Families.hpp"
#include "IIPEnqueueMessageSerializer.hpp"
#include "QDASerializer.hpp"
#include "QVMShutdownEventSerializer.hpp"
#include "TextBaseEventSerializer.hpp"
#include "krutil_protobuf/serializers/AllocationRecorder.hpp"
#include "krutil_protobuf/support/TestTransport.hpp"

namespace {

int zeroCopyReads = 0;

}  // namespace

// Counts how often the program asks for the variable that switches zero copy off.
extern "C" char* getenv(const char* name) noexcept {
    if (std::strcmp(name, "QX_DISABLE_ZEROCOPY") == 0) {
        ++zeroCopyReads;
    }
    const std::size_t length = std::strlen(name);
    for (char** entry = environ; entry != nullptr && *entry != nullptr; ++entry) {
        if (std::strncmp(*entry, name, length) == 0 && (*entry)[length] == '=') {
            return *entry + length + 1;
        }
    }
    return nullptr;
}

namespace {

using foundation::msg_svc::transport::layers::session::FeatureHandling;
using foundation::msg_svc::transport::layers::session::FeatureRequest;
using krutil::protobuf::KrutilProtocol;
using krutil::protobuf_serializer::EventFamily;
using krutil::protobuf_serializer::QDASerializer;
using transport::Registry;
using transport::SerializerBase;
using Version = std::pair<unsigned int, unsigned int>;

const std::unordered_map<std::string, std::string> features{{"ZEROCOPY", "enable"}};
constexpr Version current{1, 0};
constexpr Version refused{0xFFFF, 0xFFFF};

std::vector<std::string> names(const Registry& registry) {
    std::vector<std::string> result;
    for (const auto& serializer : registry.serializers()) {
        result.push_back(serializer->name());
    }
    return result;
}

// Occupies a name, and a type that is its own.
struct Occupant {};

class OccupyingSerializer : public SerializerBase {
  public:
    explicit OccupyingSerializer(const std::string& name) : SerializerBase(name, typeid(Occupant), {1U, 0U}) {}
};

TEST(KrutilProtocolTest, NameAndVersion) {
    EXPECT_EQ(KrutilProtocol::protocolName, "krutil");
    EXPECT_EQ(KrutilProtocol::protocolVersion, current);
}

TEST(KrutilProtocolTest, TheConfigurationOffersZeroCopyEnabledThenDisabledWhateverTheVariableHolds) {
    const std::vector<FeatureRequest> expected{{"ZEROCOPY", "enable", static_cast<FeatureHandling>(3)},
                                               {"ZEROCOPY", "disable", static_cast<FeatureHandling>(3)}};
    EXPECT_EQ(KrutilProtocol::supportedFeatures, expected);
    for (const char* value : {"", "0", "1", "enable"}) {
        ::setenv("QX_DISABLE_ZEROCOPY", value, 1);
        EXPECT_EQ(KrutilProtocol::getConfiguration(), expected) << value;
    }
    ::unsetenv("QX_DISABLE_ZEROCOPY");
    EXPECT_EQ(KrutilProtocol::getConfiguration(), expected);
}

TEST(KrutilProtocolTest, TheConfigurationIsACopy) {
    KrutilProtocol::getConfiguration().clear();
    EXPECT_EQ(KrutilProtocol::getConfiguration().size(), 2U);
}

TEST(KrutilProtocolTest, OtherVersionsAreRefusedAndInsertNothing) {
    for (const Version& version : {Version(1, 1), Version(2, 0), Version(0, 0), Version(0, 1), Version(0xFFFF, 0xFFFF),
                                   Version(0x10001, 0), Version(1, 0x10000)}) {
        const auto registry = std::make_shared<Registry>();
        ASSERT_EQ(KrutilProtocol::protocolInitializer(registry, version, features), refused);
        ASSERT_TRUE(registry->serializers().empty());
        EXPECT_EQ(KrutilProtocol::protocolInitializer(nullptr, version, features), refused);
    }
}

// Exit code 0, or the number of the check that failed. Runs in a process that has made no serializer yet.
int checkReadsOfTheVariable() {
    const auto registry = std::make_shared<Registry>();
    const int before = zeroCopyReads;
    for (const Version& version : {Version(1, 1), Version(2, 0), Version(0, 0)}) {
        KrutilProtocol::protocolInitializer(registry, version, features);
    }
    if (zeroCopyReads != before) {
        return 1;
    }
    KrutilProtocol::protocolInitializer(registry, current, features);
    if (zeroCopyReads != before + 1) {
        return 2;
    }
    KrutilProtocol::protocolInitializer(std::make_shared<Registry>(), current, features);
    return zeroCopyReads == before + 1 ? 0 : 3;
}

TEST(KrutilProtocolDeathTest, TheZeroCopyVariableIsReadOnceAndNotForOtherVersions) {
    testing::FLAGS_gtest_death_test_style = "threadsafe";
    EXPECT_EXIT(std::_Exit(checkReadsOfTheVariable()), testing::ExitedWithCode(0), "");
}

// The array serializer reads the variable when it is made.
int checkSerializersAreMadeOneAtATime() {
    const int before = zeroCopyReads;
    const auto refusedAt = [](const char* name) {
        const auto registry = std::make_shared<Registry>();
        registry->insert(std::make_shared<OccupyingSerializer>(name));
        try {
            KrutilProtocol::protocolInitializer(registry, current, features);
        } catch (const std::invalid_argument&) {
            return true;
        }
        return false;
    };
    // Those before it in the table: it is not made.
    if (!refusedAt("krutil:QVMShutdownEvent") || !refusedAt("krutil:FEvalResult") || zeroCopyReads != before) {
        return 1;
    }
    return refusedAt("krutil:QDA") && zeroCopyReads == before + 1 ? 0 : 2;
}

TEST(KrutilProtocolDeathTest, ASerializerIsMadeWhenThoseBeforeItAreInserted) {
    testing::FLAGS_gtest_death_test_style = "threadsafe";
    EXPECT_EXIT(std::_Exit(checkSerializersAreMadeOneAtATime()), testing::ExitedWithCode(0), "");
}

TEST(KrutilProtocolTest, TheVersionIsReturned) {
    const auto registry = std::make_shared<Registry>();
    EXPECT_EQ(KrutilProtocol::protocolInitializer(registry, current, features), current);
    EXPECT_FALSE(registry->serializers().empty());
}

TEST(KrutilProtocolTest, TheArraySerializerGetsACopyOfTheSettledFeatures) {
    const auto registry = std::make_shared<Registry>();
    std::unordered_map<std::string, std::string> settled{{"ZEROCOPY", "disable"}, {"OTHER", "x"}};
    const auto expected = settled;
    KrutilProtocol::protocolInitializer(registry, current, settled);
    settled.clear();
    EXPECT_EQ(dynamic_cast<const QDASerializer&>(*registry->find("krutil:QDA")).features(), expected);
}

// A registered name is an object of the library, so making a serializer copies it, and makes no other string.
TEST(KrutilProtocolTest, NamesOfSerializersExistBeforeTheSerializers) {
    const auto allocations = []<class Serializer>(std::type_identity<Serializer>) {
        const AllocationRecorder recorder;
        const Serializer serializer;
        return recorder.allocations();
    };
    using namespace krutil::protobuf_serializer;
    EXPECT_EQ(allocations(std::type_identity<QVMShutdownEventSerializer>()), 1U);
    EXPECT_EQ(allocations(std::type_identity<IIPEnqueueMessageSerializer>()), 1U);
    EXPECT_EQ(allocations(std::type_identity<TextBaseEventSerializer>()), 1U);
    EXPECT_EQ(allocations(std::type_identity<CapabilitiesChangedSerializer>()), 1U);
}

TEST(KrutilProtocolTest, EachRegistryGetsSerializersOfItsOwn) {
    const auto one = transport::sessionRegistry();
    const auto other = transport::sessionRegistry();
    EXPECT_EQ(names(*one), names(*other));
    std::set<const SerializerBase*> objects;
    for (const auto& registry : {one, other}) {
        for (const auto& serializer : registry->serializers()) {
            objects.insert(serializer.get());
        }
    }
    EXPECT_EQ(objects.size(), 2 * one->serializers().size());
}

TEST(KrutilProtocolTest, TheRegistryOwnsItsSerializers) {
    auto registry = transport::sessionRegistry();
    const std::weak_ptr<const SerializerBase> first = registry->serializers().front();
    EXPECT_FALSE(first.expired());
    registry.reset();
    EXPECT_TRUE(first.expired());
}

TEST(KrutilProtocolTest, ARegistryThatRefusesOneKeepsThoseBeforeIt) {
    const std::vector<std::string> all = names(*transport::sessionRegistry());
    for (std::size_t k = 0; k < all.size(); ++k) {
        const auto registry = std::make_shared<Registry>();
        registry->insert(std::make_shared<OccupyingSerializer>(all[k]));
        EXPECT_THROW(KrutilProtocol::protocolInitializer(registry, current, features), std::invalid_argument);
        std::vector<std::string> expected{all[k]};
        expected.insert(expected.end(), all.begin(), all.begin() + static_cast<std::ptrdiff_t>(k));
        EXPECT_EQ(names(*registry), expected);
    }
}

TEST(KrutilProtocolTest, ARegistryRefusesADuplicateNameAndADuplicateType) {
    const auto registry = transport::sessionRegistry();
    const std::size_t count = registry->serializers().size();
    EXPECT_THROW(registry->insert(std::make_shared<OccupyingSerializer>("krutil:EvalIIP")), std::invalid_argument);
    registry->insert(std::make_shared<OccupyingSerializer>("test:One"));
    EXPECT_THROW(registry->insert(std::make_shared<OccupyingSerializer>("test:Two")), std::invalid_argument);
    EXPECT_THROW(registry->find("test:Two"), std::out_of_range);
    EXPECT_THROW(KrutilProtocol::protocolInitializer(registry, current, features), std::invalid_argument);
    EXPECT_EQ(registry->serializers().size(), count + 1);
}

TEST(KrutilProtocolTest, LookUpsAreExact) {
    const auto registry = transport::sessionRegistry();
    EXPECT_THROW(registry->find("krutil:IIP"), std::out_of_range);
    EXPECT_THROW(registry->find("krutil:LastIIPEvent"), std::out_of_range);
    EXPECT_THROW(registry->find(""), std::out_of_range);
    EXPECT_THROW(registry->find(std::string("krutil:EvalIIP\0", 15)), std::out_of_range);
    EXPECT_THROW(registry->find(std::type_index(typeid(cmddistributor::IIP))), std::out_of_range);
    EXPECT_THROW(registry->find(std::type_index(typeid(foundation::msg_svc::eventmgr::BaseEvent))), std::out_of_range);
}

}  // namespace
