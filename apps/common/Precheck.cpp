#include "common/Precheck.hpp"

#include <google/protobuf/descriptor.h>

#include <stdexcept>
#include <string>
#include <vector>

#include "common/MessageNames.hpp"

namespace apps {
namespace {

using foundation::msg_svc::transport::layers::session::WireWalk;
using google::protobuf::Descriptor;
using google::protobuf::DescriptorPool;

const Descriptor& messageNamed(const std::string& name) {
    const Descriptor* const message = DescriptorPool::generated_pool()->FindMessageTypeByName(name);
    if (message == nullptr) {
        throw std::logic_error("precheck: expected a message " + name + " in the schema, got none");
    }
    return *message;
}

WireWalk::NumberRule rule(const char* message, const char* field, const char* name, int last) {
    return {messageNamed(message).FindFieldByName(field), name, 0, last};
}

std::shared_ptr<const WireWalk> walk(bool numbers) {
    WireWalk::Messages messages;
    for (const MessageName& row : messageNames()) {
        messages.emplace(row.tag, &messageNamed(std::string(row.message)));
    }
    std::vector<WireWalk::NumberRule> rules;
    if (numbers) {
        rules = {rule("krutil.protobuf.TextBaseEvent", "stream", "a stream", 2),
                 rule("krutil.protobuf.SinkTextEvent", "stream", "a stream", 2),
                 rule("krutil.protobuf.RuntimeException", "status", "a status", 5)};
    }
    return std::make_shared<const WireWalk>(messages, rules);
}

}  // namespace

std::shared_ptr<const WireWalk> precheck(bool numbers) {
    static const std::shared_ptr<const WireWalk> all = walk(true);
    if (numbers) {
        return all;
    }
    static const std::shared_ptr<const WireWalk> structure = walk(false);
    return structure;
}

}  // namespace apps
