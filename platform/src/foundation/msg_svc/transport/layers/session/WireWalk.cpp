#include "foundation/msg_svc/transport/layers/session/WireWalk.hpp"

#include <google/protobuf/descriptor.h>

#include <algorithm>
#include <array>
#include <cstddef>
#include <utility>

#include "foundation/msg_svc/transport/layers/session/PrintableText.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionError.hpp"

namespace foundation::msg_svc::transport::layers::session {
namespace {

using google::protobuf::Descriptor;
using google::protobuf::FieldDescriptor;

enum class WireType : std::uint32_t { Varint, Fixed64, Bytes, BeginGroup, EndGroup, Fixed32 };

constexpr std::size_t longestTag = 5;
constexpr std::size_t longestNumber = 10;
// Messages and groups inside the outermost message: the parser's default.
constexpr std::size_t deepest = 100;
// The parser keeps its distance from 2^31, so that its own positions do not overflow.
constexpr std::uint64_t largestLength = (1ULL << 31U) - 1 - 16;

WireType wireTypeOf(const FieldDescriptor& field) {
    switch (field.type()) {
        case FieldDescriptor::TYPE_DOUBLE:
        case FieldDescriptor::TYPE_FIXED64:
        case FieldDescriptor::TYPE_SFIXED64:
            return WireType::Fixed64;
        case FieldDescriptor::TYPE_FLOAT:
        case FieldDescriptor::TYPE_FIXED32:
        case FieldDescriptor::TYPE_SFIXED32:
            return WireType::Fixed32;
        case FieldDescriptor::TYPE_STRING:
        case FieldDescriptor::TYPE_BYTES:
        case FieldDescriptor::TYPE_MESSAGE:
            return WireType::Bytes;
        case FieldDescriptor::TYPE_GROUP:
            return WireType::BeginGroup;
        default:
            return WireType::Varint;
    }
}

}  // namespace

// What a walk needs to know of a message.
struct WireWalk::Fields {
    struct Field {
        std::uint32_t number;
        WireType wireType;
        bool repeated;
        const Fields* message = nullptr;  // of a message or a group
        const NumberRule* rule = nullptr;
        std::string name;
    };

    const Field* find(std::uint32_t number) const noexcept {
        // Most messages number their fields from 1 on without a gap.
        if (number <= fields.size() && fields[number - 1].number == number) {
            return &fields[number - 1];
        }
        const auto found = std::lower_bound(fields.begin(), fields.end(), number,
                                            [](const Field& field, std::uint32_t n) { return field.number < n; });
        return found != fields.end() && found->number == number ? &*found : nullptr;
    }

    std::vector<Field> fields;  // by number
    std::vector<std::unique_ptr<const NumberRule>> rules;
};

// One walk through one content.
class WireWalk::Content {
  public:
    Content(const framing::TaggedFrame& frame, const Fields& fields, std::uint64_t mostParts)
        : frame_(frame),
          begin_(reinterpret_cast<const unsigned char*>(frame.data())),
          at_(begin_),
          field_(begin_),
          mostParts_(mostParts) {
        levels_[0] = {&fields, begin_ + frame.size(), 0, false};
    }

    void walk() {
        if (frame_.size() > largestLength + 16) {
            fail("expected at most 2147483647 bytes", std::to_string(frame_.size()));
        }
        for (;;) {
            const Level& level = levels_[depth_];
            if (at_ != level.end) {
                takeField();
            } else if (level.group) {
                field_ = at_;
                number_ = 0;
                fail("expected the end of group " + std::to_string(level.number), "the end of what it is in");
            } else if (depth_ == 0) {
                return;
            } else {
                --depth_;
            }
        }
    }

    std::uint64_t parts() const noexcept { return parts_; }

  private:
    // A message or a group that the walk is inside of.
    struct Level {
        const Fields* fields;
        const unsigned char* end;  // a group's end is not known, this is that of what it is in
        std::uint32_t number;      // of the field that it is
        bool group;
    };

    void takeField() {
        field_ = at_;
        number_ = 0;
        // A parser keeps 32 bits of a tag.
        const auto tag = static_cast<std::uint32_t>(varint(longestTag, "tag"));
        const auto wireType = static_cast<WireType>(tag & 7U);
        number_ = tag >> 3U;
        if (number_ == 0) {
            fail("expected a field number from 1 on", "0");
        }
        if (wireType == WireType::EndGroup) {
            endGroup();
            return;
        }
        if (++parts_ > mostParts_) {
            fail("expected at most " + std::to_string(mostParts_) + " fields (limit \"parts\")", "more");
        }
        const Fields::Field* const field = levels_[depth_].fields->find(number_);
        switch (wireType) {
            case WireType::Varint:
                takeNumber(field);
                break;
            case WireType::Fixed64:
                skip(8);
                break;
            case WireType::Fixed32:
                skip(4);
                break;
            case WireType::Bytes:
                takeBytes(field);
                break;
            case WireType::BeginGroup:
                enter(field != nullptr && field->wireType == WireType::BeginGroup ? field->message : &unknown(), true,
                      levels_[depth_].end);
                break;
            default:
                fail("expected a wire type from 0 to 5", std::to_string(tag & 7U));
        }
    }

    void takeNumber(const Fields::Field* field) {
        const std::uint64_t value = varint(longestNumber, "number");
        if (field == nullptr || field->rule == nullptr) {
            return;
        }
        // A parser keeps 32 bits of an enumeration's number.
        const auto number = static_cast<std::int32_t>(static_cast<std::uint32_t>(value));
        const NumberRule& rule = *field->rule;
        if (number < rule.first || number > rule.last) {
            fail("expected " + rule.name + " from " + std::to_string(rule.first) + " to " + std::to_string(rule.last),
                 std::to_string(number));
        }
    }

    void takeBytes(const Fields::Field* field) {
        const std::uint64_t size = varint(longestTag, "length");
        need(size);
        if (size > largestLength) {
            fail("expected a length of at most " + std::to_string(largestLength), std::to_string(size));
        }
        const unsigned char* const end = at_ + size;
        if (field != nullptr && field->message != nullptr && field->wireType == WireType::Bytes) {
            enter(field->message, false, end);
        } else if (field != nullptr && field->repeated && field->wireType != WireType::Bytes &&
                   field->wireType != WireType::BeginGroup) {
            takePacked(*field, end);
        } else {
            at_ = end;
        }
    }

    void takePacked(const Fields::Field& field, const unsigned char* end) {
        const auto size = static_cast<std::size_t>(end - at_);
        const std::size_t element = field.wireType == WireType::Fixed64   ? 8
                                    : field.wireType == WireType::Fixed32 ? 4
                                                                          : 0;
        if (element != 0) {
            if (size % element != 0) {
                fail("expected whole elements of " + std::to_string(element) + " bytes",
                     std::to_string(size) + " bytes");
            }
            at_ = end;
            return;
        }
        std::size_t length = 0;
        for (; at_ != end; ++at_) {
            if (++length > longestNumber) {
                fail("expected a number of at most 10 bytes", "more");
            }
            if (*at_ < 0x80U) {
                length = 0;
            }
        }
        if (length != 0) {
            fail("expected whole elements", "a cut one");
        }
    }

    void enter(const Fields* fields, bool group, const unsigned char* end) {
        if (depth_ == deepest) {
            fail("expected at most " + std::to_string(deepest) + " messages inside one another", "more");
        }
        levels_[++depth_] = {fields, end, number_, group};
    }

    void endGroup() {
        const Level& level = levels_[depth_];
        if (!level.group || level.number != number_) {
            fail(level.group ? "expected the end of group " + std::to_string(level.number)
                             : std::string("expected no end of a group outside of one"),
                 "that of group " + std::to_string(number_));
        }
        --depth_;
    }

    std::uint64_t varint(std::size_t longest, const char* what) {
        std::uint64_t value = 0;
        for (std::size_t i = 0; i < longest; ++i) {
            need(1);
            const unsigned char byte = *at_++;
            value |= static_cast<std::uint64_t>(byte & 0x7FU) << (7 * i);
            if (byte < 0x80U) {
                return value;
            }
        }
        fail(std::string("expected a ") + what + " of at most " + std::to_string(longest) + " bytes", "more");
    }

    void skip(std::size_t size) {
        need(size);
        at_ += size;
    }

    void need(std::uint64_t size) {
        const auto left = static_cast<std::uint64_t>(levels_[depth_].end - at_);
        if (size > left) {
            fail("expected " + std::to_string(size) + (size == 1 ? " more byte" : " more bytes"),
                 left == 0 ? "none" : std::to_string(left));
        }
    }

    [[noreturn]] void fail(const std::string& expected, const std::string& got) const {
        throw ProtocolViolation("frame " + quoted(frame_.tag()) + ", byte " + std::to_string(field_ - begin_) + path() +
                                ": " + expected + ", got " + got);
    }

    // Of the present field, as ", field exception.causes (30 times).status". A message may contain itself many times.
    std::string path() const {
        std::vector<std::pair<std::string, std::size_t>> names;
        const auto add = [&names](const Fields& fields, std::uint32_t number) {
            const Fields::Field* const field = fields.find(number);
            const std::string name = field != nullptr ? field->name : std::to_string(number);
            if (!names.empty() && names.back().first == name) {
                ++names.back().second;
            } else {
                names.emplace_back(name, 1);
            }
        };
        for (std::size_t i = 1; i <= depth_; ++i) {
            add(*levels_[i - 1].fields, levels_[i].number);
        }
        if (number_ != 0) {
            add(*levels_[depth_].fields, number_);
        }
        std::string text;
        for (const auto& [name, times] : names) {
            text += (text.empty() ? ", field " : ".") + name;
            text += times > 1 ? " (" + std::to_string(times) + " times)" : "";
        }
        return text;
    }

    // Inside a group that is not known nothing is.
    static const Fields& unknown() noexcept {
        static const Fields none;
        return none;
    }

    const framing::TaggedFrame& frame_;
    const unsigned char* const begin_;
    const unsigned char* at_;
    const unsigned char* field_;  // where the present field begins
    std::uint32_t number_ = 0;    // of the present field; 0 while it is not known
    std::uint64_t parts_ = 0;
    const std::uint64_t mostParts_;
    std::size_t depth_ = 0;
    std::array<Level, deepest + 1> levels_;
};

WireWalk::WireWalk(const Messages& messages, const std::vector<NumberRule>& rules) {
    for (const auto& [tag, message] : messages) {
        byTag_.emplace(tag, fieldsOf(*message, rules));
    }
}

WireWalk::~WireWalk() = default;

// A message may contain itself, so the entry is made before what it contains is looked at.
const WireWalk::Fields* WireWalk::fieldsOf(const Descriptor& message, const std::vector<NumberRule>& rules) {
    const auto [place, isNew] = messages_.try_emplace(&message);
    if (!isNew) {
        return place->second.get();
    }
    place->second = std::make_unique<Fields>();
    Fields& known = *place->second;
    for (int i = 0; i < message.field_count(); ++i) {
        const FieldDescriptor& field = *message.field(i);
        Fields::Field& entry = known.fields.emplace_back();
        entry.number = static_cast<std::uint32_t>(field.number());
        entry.wireType = wireTypeOf(field);
        entry.repeated = field.is_repeated();
        entry.name = field.name();
        if (field.message_type() != nullptr) {
            entry.message = fieldsOf(*field.message_type(), rules);
        }
        for (const NumberRule& rule : rules) {
            if (rule.field == &field) {
                entry.rule = known.rules.emplace_back(std::make_unique<const NumberRule>(rule)).get();
            }
        }
    }
    std::sort(known.fields.begin(), known.fields.end(),
              [](const Fields::Field& a, const Fields::Field& b) { return a.number < b.number; });
    return &known;
}

void WireWalk::check(const framing::TaggedFrame& frame, std::uint64_t mostParts) const {
    if (const auto found = byTag_.find(frame.tag()); found != byTag_.end()) {
        Content(frame, *found->second, mostParts).walk();
    }
}

std::uint64_t WireWalk::parts(const framing::TaggedFrame& frame) const {
    const auto found = byTag_.find(frame.tag());
    if (found == byTag_.end()) {
        return 0;
    }
    Content content(frame, *found->second, anyParts);
    try {
        content.walk();
    } catch (const ProtocolViolation&) {
        // What a serializer has written wrong is for the receiver to refuse.
    }
    return content.parts();
}

}  // namespace foundation::msg_svc::transport::layers::session
