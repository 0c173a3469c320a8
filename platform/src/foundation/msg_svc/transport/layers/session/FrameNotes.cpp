#include "foundation/msg_svc/transport/layers/session/FrameNotes.hpp"

#include <boost/numeric/conversion/cast.hpp>
#include <new>
#include <stdexcept>
#include <typeinfo>

#include "foundation/msg_svc/transport/layers/message/LastAsked.hpp"
#include "foundation/msg_svc/transport/layers/session/FrameKinds.hpp"
#include "foundation/msg_svc/transport/layers/session/PrintableText.hpp"

namespace foundation::msg_svc::transport::layers::session {
namespace {

// Notes that are kept for the messages to come; what a large message needs besides is let go.
constexpr std::size_t keptNotes = 64;

std::string typeNumber(framing::FrameType type) {
    return std::to_string(static_cast<unsigned>(type));
}

bool isKnown(const serialization::Registry& registry, const std::string& tag) {
    try {
        registry.find(tag);
        return true;
    } catch (const std::out_of_range&) {
        return false;
    }
}

// Errors of the language and its libraries, whose texts presuppose that one knows them.
bool isOfTheLanguage(const std::exception& error) {
    return dynamic_cast<const std::bad_cast*>(&error) != nullptr ||
           dynamic_cast<const std::out_of_range*>(&error) != nullptr ||
           dynamic_cast<const std::length_error*>(&error) != nullptr;
}

}  // namespace

void FrameNotes::take(const std::vector<std::unique_ptr<framing::Frame>>& frames) {
    if (notes_.size() > keptNotes) {
        notes_.resize(keptNotes);
        notes_.shrink_to_fit();
    }
    count_ = frames.size();
    if (notes_.size() < count_) {
        notes_.resize(count_);
    }
    for (std::size_t i = 0; i < count_; ++i) {
        const auto* const tagged = asTagged(*frames[i]);
        notes_[i].tagged = tagged != nullptr;
        notes_[i].type = frames[i]->type();
        notes_[i].size = frames[i]->size();
        if (tagged != nullptr) {
            notes_[i].tag = tagged->tag();
        }
    }
    message::lastAsked() = {};
}

const FrameNotes::Note* FrameNotes::at(unsigned long index) const noexcept {
    return index != 0 && index <= count_ ? &notes_[index - 1] : nullptr;
}

std::string FrameNotes::explain(const std::exception& error, const serialization::Registry& registry,
                                const std::string& arrayTag) const {
    const message::LastAsked& asked = message::lastAsked();
    const Note* const note = at(asked.index);
    if (typeid(error) == typeid(std::bad_cast)) {
        return explainBadCast(arrayTag);
    }
    const std::string frame =
        frameName(asked.index) + (note != nullptr && note->tagged ? " with tag " + quoted(note->tag) : "");
    if (dynamic_cast<const boost::numeric::positive_overflow*>(&error) != nullptr && note != nullptr) {
        return frame + ": expected a content of at most 2147483647 bytes, got " + std::to_string(note->size);
    }
    if (dynamic_cast<const std::bad_alloc*>(&error) != nullptr) {
        return frame + ": there is no memory for its object";
    }
    if (typeid(error) == typeid(std::out_of_range) && note != nullptr && note->tagged &&
        !isKnown(registry, note->tag)) {
        return frameName(asked.index) + ": no serializer is registered for its tag " + quoted(note->tag);
    }
    return isOfTheLanguage(error) ? frame + ": its content makes no object (" + error.what() + ")" : error.what();
}

std::string FrameNotes::explainBadCast(const std::string& arrayTag) const {
    const message::LastAsked& asked = message::lastAsked();
    const std::string frame = frameName(asked.index) + ": ";
    const Note* const note = at(asked.index);
    if (note == nullptr) {
        return frame + "expected a frame, got none: the message has " + std::to_string(count_);
    }
    if (!asked.found) {
        return frame + "expected a frame, got none: it was read already";
    }
    if (!note->tagged) {
        return frame + "expected a tagged frame, got a data frame of type " + typeNumber(note->type);
    }
    const std::string tag = quoted(note->tag);
    if (asked.released == asked.index) {
        return frame + "expected the frame type of " + tag + ", got " + typeNumber(note->type);
    }
    // Who asked is the object whose frame was taken out last; an array goes on to ask after its first data frame.
    const Note* const reader = at(asked.released);
    if (reader != nullptr && (!reader->tagged || reader->tag == arrayTag)) {
        return frame + "expected a data frame, got a tagged frame with tag " + tag;
    }
    return frame + "expected an object that " +
           (reader != nullptr ? quoted(reader->tag) + " can refer to" : std::string("can be the root")) +
           ", got one with tag " + tag;
}

}  // namespace foundation::msg_svc::transport::layers::session
