#include "common/MessageNames.hpp"

#include <google/protobuf/descriptor.h>
#include <gtest/gtest.h>

#include "KrutilProtocol.hpp"

namespace apps {
namespace {

// Arrays are the platform's own kind of message, whose schema may be absent from a host.
TEST(MessageNamesTest, EveryTagOfTheProtocolHasAMessageInThePool) {
    const auto registry = std::make_shared<foundation::msg_svc::transport::layers::serialization::Registry>();
    using krutil::protobuf::KrutilProtocol;
    KrutilProtocol::protocolInitializer(registry, KrutilProtocol::protocolVersion, {{"ZEROCOPY", "enable"}});
    ASSERT_FALSE(registry->serializers().empty());
    for (const auto& serializer : registry->serializers()) {
        const std::string name = messageNameOfTag(serializer->name());
        EXPECT_NE(google::protobuf::DescriptorPool::generated_pool()->FindMessageTypeByName(name), nullptr)
            << serializer->name() << " -> \"" << name
            << "\": a tag that is not \"krutil:\" and the message's name needs a row in MessageNames.cpp";
    }
}

TEST(MessageNamesTest, TagsThatShareAMessageOrNameItDifferently) {
    EXPECT_EQ(messageNameOfTag("krutil:EvalIIP"), "krutil.protobuf.EvalIIP");
    EXPECT_EQ(messageNameOfTag("krutil:IIPSuspendedEvent"), "krutil.protobuf.IIPStateEvent");
    EXPECT_EQ(messageNameOfTag("krutil:detail::LastIIPEvent"), "krutil.protobuf.IIPStateEvent");
    EXPECT_EQ(messageNameOfTag("krutil:QDA"), "foundation.korveldata.protobuf.KORVEL_Array");
    EXPECT_EQ(messageNameOfTag("korvel:lang:diagnostic:IssuedEnabledWarningEvent"),
              "krutil.protobuf.IssuedEnabledWarningEvent");
}

TEST(MessageNamesTest, OtherTagsHaveNone) {
    for (const auto* tag : {"", "krutil", "krutil:", "krutil:a:b", "other:EvalIIP", "EvalIIP"}) {
        EXPECT_EQ(messageNameOfTag(tag), "") << tag;
    }
}

}  // namespace
}  // namespace apps
