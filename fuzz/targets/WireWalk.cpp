// Any content of any type: the walk accepts what the parser of Protocol Buffers reads whole, and nothing else. The
// first byte of the input chooses the type.

#include <google/protobuf/descriptor.h>

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string_view>
#include <vector>

#include "common/MessageNames.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionError.hpp"
#include "foundation/msg_svc/transport/layers/session/WireWalk.hpp"
#include "support/ParserOracle.hpp"

namespace {

namespace framing = foundation::vantor::carrier::framing;
namespace session = foundation::msg_svc::transport::layers::session;
using session::WireWalk;

// All types of the protocol, and one that has fields of every kind.
struct WalkedTypes {
    WalkedTypes() {
        WireWalk::Messages messages;
        const auto add = [&](std::string_view tag, const google::protobuf::Descriptor& message) {
            tags.emplace_back(tag);
            withoutText.push_back(&message);
            messages.emplace(tag, &message);
        };
        for (const apps::MessageName& name : apps::messageNames()) {
            add(name.tag, oracle.withoutText(*google::protobuf::DescriptorPool::generated_pool()->FindMessageTypeByName(
                              std::string(name.message))));
        }
        add("every kind", oracle.everyKind());
        walk = std::make_unique<WireWalk>(messages);
    }

    test_support::ParserOracle oracle;
    std::vector<std::string> tags;
    std::vector<const google::protobuf::Descriptor*> withoutText;
    std::unique_ptr<WireWalk> walk;
};

bool accepts(const WireWalk& walk, const std::string& tag, std::string_view content) {
    framing::FrameBuffer buffer(
        framing::FrameBuffer::first_type(new char[content.size() + 1], std::default_delete<char[]>()), content.size());
    content.copy(buffer.first.get(), content.size());
    try {
        walk.check({framing::FrameType::Object, 1, tag, std::move(buffer), 1});
        return true;
    } catch (const session::ProtocolViolation&) {
        return false;
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static WalkedTypes types;
    if (size == 0) {
        return 0;
    }
    const std::size_t chosen = data[0] % types.tags.size();
    const std::string_view content(reinterpret_cast<const char*>(data) + 1, size - 1);
    if (accepts(*types.walk, types.tags[chosen], content) !=
        types.oracle.readsWhole(*types.withoutText[chosen], content)) {
        std::abort();
    }
    return 0;
}
