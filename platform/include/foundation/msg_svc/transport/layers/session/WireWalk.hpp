// Whether the content of a tagged frame is one whole message, found out without building it.
#pragma once

#include <cstdint>
#include <limits>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "foundation/vantor/carrier/framing/TaggedFrame.hpp"

namespace google::protobuf {
class Descriptor;
class FieldDescriptor;
}  // namespace google::protobuf

namespace foundation::msg_svc::transport::layers::session {

namespace framing = ::foundation::vantor::carrier::framing;

/// Goes through the fields of a content once, from its first byte to its last. It accepts exactly what Protocol Buffers
/// reads whole (`MergePartialFromCodedStream()` returns true and `ConsumedEntireMessage()` holds), with three
/// exceptions:
///
/// - it does not look at UTF-8: the parser stops at text of proto3 that is none, and this does not;
/// - it refuses numbers that a NumberRule does not allow;
/// - it refuses more parts than it is told.
///
/// Parts are what a parser makes objects and values of: each field counts, whether it is known or not, and those of
/// messages within messages too. Packed elements do not count, they are numbers side by side.
///
/// It allocates nothing but the text of an error, and its stack has a fixed size. Immutable; any thread. The encoding
/// is described at https://protobuf.dev/programming-guides/encoding/.
class WireWalk {
  public:
    /// What the content of a frame is, by its tag. Frames with other tags are not looked at.
    using Messages = std::map<std::string, const google::protobuf::Descriptor*, std::less<>>;

    /// A field of an enumeration, wherever its message occurs, that holds no number outside of `first` to `last`. Each
    /// occurrence is looked at, though the last one would win. `name` is what an error calls the number ("a status").
    struct NumberRule {
        const google::protobuf::FieldDescriptor* field;  ///< must outlive the walk
        std::string name;                                ///< of the number, with its article
        std::int32_t first;                              ///< smallest number that is allowed
        std::int32_t last;                               ///< largest number that is allowed
    };

    static constexpr std::uint64_t anyParts = std::numeric_limits<std::uint64_t>::max();  ///< no limit

    /// The descriptors must outlive the object.
    explicit WireWalk(const Messages& messages, const std::vector<NumberRule>& rules = {});
    ~WireWalk();  ///< Destroys the walk.
    WireWalk(const WireWalk&) = delete;
    WireWalk& operator=(const WireWalk&) = delete;

    /// Throws ProtocolViolation for a content that is not accepted. The text names the frame, the byte at which the
    /// field begins, the path of the field, what was expected and what was there.
    void check(const framing::TaggedFrame& frame, std::uint64_t mostParts = anyParts) const;

    /// Parts of the content; those in front of the fault when it is not accepted, 0 for a tag that is not known.
    std::uint64_t parts(const framing::TaggedFrame& frame) const;

  private:
    struct Fields;
    class Content;

    const Fields* fieldsOf(const google::protobuf::Descriptor& message, const std::vector<NumberRule>& rules);

    std::map<const google::protobuf::Descriptor*, std::unique_ptr<Fields>> messages_;
    std::map<std::string, const Fields*, std::less<>> byTag_;
};

}  // namespace foundation::msg_svc::transport::layers::session
