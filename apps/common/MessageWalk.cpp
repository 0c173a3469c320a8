#include "common/MessageWalk.hpp"

#include <google/protobuf/descriptor.h>

#include <limits>
#include <utility>
#include <vector>

#include "common/MessageNames.hpp"

namespace apps {
namespace {

using google::protobuf::FieldDescriptor;
using google::protobuf::Message;

// All fields that are there; of a repeated one each element, of another one the position -1.
void forEachField(const Message& message, const std::function<void(const FieldDescriptor*, int)>& see) {
    const auto& reflection = *message.GetReflection();
    std::vector<const FieldDescriptor*> fields;
    reflection.ListFields(message, &fields);
    for (const FieldDescriptor* field : fields) {
        if (!field->is_repeated()) {
            see(field, -1);
            continue;
        }
        for (int i = 0; i < reflection.FieldSize(message, field); ++i) {
            see(field, i);
        }
    }
}

}  // namespace

std::unique_ptr<Message> parsedMessage(std::string_view tag, std::string_view content) {
    const auto* const type =
        google::protobuf::DescriptorPool::generated_pool()->FindMessageTypeByName(messageNameOfTag(tag));
    if (type == nullptr || content.size() > std::numeric_limits<int>::max()) {
        return nullptr;
    }
    std::unique_ptr<Message> message(google::protobuf::MessageFactory::generated_factory()->GetPrototype(type)->New());
    if (!message->ParsePartialFromArray(content.data(), static_cast<int>(content.size()))) {
        return nullptr;
    }
    return message;
}

void forEachMessage(Message& message, const std::function<void(Message&)>& see) {
    see(message);
    const auto& reflection = *message.GetReflection();
    forEachField(message, [&](const FieldDescriptor* field, int at) {
        if (field->cpp_type() == FieldDescriptor::CPPTYPE_MESSAGE) {
            forEachMessage(at < 0 ? *reflection.MutableMessage(&message, field)
                                  : *reflection.MutableRepeatedMessage(&message, field, at),
                           see);
        }
    });
}

void forEachText(Message& message, const std::function<void(std::string&)>& see) {
    forEachMessage(message, [&see](Message& each) {
        const auto& reflection = *each.GetReflection();
        forEachField(each, [&](const FieldDescriptor* field, int at) {
            if (field->cpp_type() != FieldDescriptor::CPPTYPE_STRING) {
                return;
            }
            std::string text =
                at < 0 ? reflection.GetString(each, field) : reflection.GetRepeatedString(each, field, at);
            see(text);
            if (at < 0) {
                reflection.SetString(&each, field, std::move(text));
            } else {
                reflection.SetRepeatedString(&each, field, at, std::move(text));
            }
        });
    });
}

}  // namespace apps
