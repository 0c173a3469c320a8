// What the parser of Protocol Buffers makes of bytes, for what has to agree with it.
#pragma once

#include <google/protobuf/descriptor.h>
#include <google/protobuf/descriptor.pb.h>
#include <google/protobuf/dynamic_message.h>
#include <google/protobuf/io/coded_stream.h>
#include <google/protobuf/io/zero_copy_stream_impl_lite.h>
#include <google/protobuf/text_format.h>

#include <limits>
#include <memory>
#include <stdexcept>
#include <string>
#include <string_view>

namespace test_support {

namespace pb = google::protobuf;

/// Messages that are read by their descriptors, with text as plain bytes: the parser stops at text of proto3 that is
/// not UTF-8, and who compares with it may not be meant to look at that.
class ParserOracle {
  public:
    ParserOracle() : factory_(&pool_) {}

    /// The same message as a generated one, but for the type of its texts.
    const pb::Descriptor& withoutText(const pb::Descriptor& message) {
        add(*message.file());
        return *pool_.FindMessageTypeByName(message.full_name());
    }

    /// A message that has a field of every kind, itself among them.
    const pb::Descriptor& everyKind() {
        if (const pb::Descriptor* const known = pool_.FindMessageTypeByName("test.EveryKind")) {
            return *known;
        }
        pb::FileDescriptorProto file;
        if (!pb::TextFormat::ParseFromString(schema, &file) || pool_.BuildFile(file) == nullptr) {
            throw std::logic_error("the schema of test.EveryKind does not build");
        }
        return *pool_.FindMessageTypeByName("test.EveryKind");
    }

    /// Whether the parser takes all bytes, and they end where a message may end.
    bool readsWhole(const pb::Descriptor& message, std::string_view bytes) {
        const std::unique_ptr<pb::Message> read(factory_.GetPrototype(&message)->New());
        return readsWhole(*read, bytes);
    }

    static bool readsWhole(pb::MessageLite& message, std::string_view bytes) {
        pb::io::ArrayInputStream array(bytes.data(), static_cast<int>(bytes.size()));
        pb::io::CodedInputStream coded(&array);
        coded.SetTotalBytesLimit(std::numeric_limits<int>::max());
        return message.MergePartialFromCodedStream(&coded) && coded.ConsumedEntireMessage();
    }

  private:
    static constexpr const char* schema = R"(
        name: "every_kind.proto" package: "test" syntax: "proto2"
        message_type {
            name: "EveryKind"
            field { name: "one" number: 1 type: TYPE_INT32 label: LABEL_OPTIONAL }
            field { name: "enumeration" number: 2 type: TYPE_ENUM type_name: ".test.Kind" label: LABEL_OPTIONAL }
            field { name: "self" number: 3 type: TYPE_MESSAGE type_name: ".test.EveryKind" label: LABEL_OPTIONAL }
            field { name: "bytes" number: 4 type: TYPE_BYTES label: LABEL_OPTIONAL }
            field { name: "group" number: 5 type: TYPE_GROUP type_name: ".test.EveryKind" label: LABEL_OPTIONAL }
            field { name: "packed" number: 6 type: TYPE_UINT64 label: LABEL_REPEATED options { packed: true } }
            field { name: "fixed64s" number: 7 type: TYPE_FIXED64 label: LABEL_REPEATED options { packed: true } }
            field { name: "floats" number: 8 type: TYPE_FLOAT label: LABEL_REPEATED }
            field { name: "truth" number: 9 type: TYPE_BOOL label: LABEL_OPTIONAL }
            field { name: "selves" number: 10 type: TYPE_MESSAGE type_name: ".test.EveryKind" label: LABEL_REPEATED }
            field { name: "enumerations" number: 11 type: TYPE_ENUM type_name: ".test.Kind" label: LABEL_REPEATED }
            field { name: "zigzag" number: 12 type: TYPE_SINT64 label: LABEL_OPTIONAL }
            field { name: "real" number: 13 type: TYPE_DOUBLE label: LABEL_OPTIONAL }
            field { name: "small" number: 14 type: TYPE_SFIXED32 label: LABEL_OPTIONAL }
            field { name: "truths" number: 15 type: TYPE_BOOL label: LABEL_REPEATED options { packed: true } }
            field { name: "far" number: 1000 type: TYPE_BYTES label: LABEL_REPEATED }
            field { name: "farthest" number: 536870911 type: TYPE_INT64 label: LABEL_OPTIONAL }
        }
        enum_type { name: "Kind" value { name: "NONE" number: 0 } value { name: "SOME" number: 5 } })";

    void add(const pb::FileDescriptor& file) {
        if (pool_.FindFileByName(file.name()) != nullptr) {
            return;
        }
        for (int i = 0; i < file.dependency_count(); ++i) {
            add(*file.dependency(i));
        }
        pb::FileDescriptorProto copy;
        file.CopyTo(&copy);
        for (pb::DescriptorProto& message : *copy.mutable_message_type()) {
            for (pb::FieldDescriptorProto& field : *message.mutable_field()) {
                if (field.type() == pb::FieldDescriptorProto::TYPE_STRING) {
                    field.set_type(pb::FieldDescriptorProto::TYPE_BYTES);
                }
            }
        }
        pool_.BuildFile(copy);
    }

    pb::DescriptorPool pool_;
    pb::DynamicMessageFactory factory_;
};

}  // namespace test_support
