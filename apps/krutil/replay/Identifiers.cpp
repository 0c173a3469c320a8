#include "krutil/replay/Identifiers.hpp"

#include <algorithm>
#include <vector>

#include "common/MessageWalk.hpp"
#include "msg_svc.protobuf.IDType.pb.h"

namespace krutil_client {
namespace {

using google::protobuf::Message;
using msg_svc::protobuf::IDType;

std::vector<IDType*> identifiersIn(Message& message) {
    std::vector<IDType*> identifiers;
    apps::forEachMessage(message, [&identifiers](Message& each) {
        if (auto* const identifier = google::protobuf::DynamicCastToGenerated<IDType>(&each)) {
            identifiers.push_back(identifier);
        }
    });
    return identifiers;
}

}  // namespace

void Identifiers::match(const Said& recorded, const Said& said) {
    // From the roots on, which are last.
    for (std::size_t i = 1; i <= std::min(recorded.frames.size(), said.frames.size()); ++i) {
        const SaidFrame& theirFrame = recorded.frames[recorded.frames.size() - i];
        const SaidFrame& ourFrame = said.frames[said.frames.size() - i];
        const auto before = apps::parsedMessage(theirFrame.tag, theirFrame.content);
        const auto now = apps::parsedMessage(ourFrame.tag, ourFrame.content);
        if (!before || !now) {
            continue;
        }
        const auto theirs = identifiersIn(*before);
        const auto ours = identifiersIn(*now);
        for (std::size_t each = 0; each < std::min(theirs.size(), ours.size()); ++each) {
            const Number recordedNumber{theirs[each]->hi(), theirs[each]->lo()};
            const Number saidNumber{ours[each]->hi(), ours[each]->lo()};
            if (recordedNumber != Number() && saidNumber != Number() && !toClient_.contains(recordedNumber) &&
                !toRecorded_.contains(saidNumber)) {
                toClient_[recordedNumber] = saidNumber;
                toRecorded_[saidNumber] = recordedNumber;
            }
        }
    }
}

Said Identifiers::translated(Said said, const std::map<Number, Number>& others) {
    for (SaidFrame& frame : said.frames) {
        const auto message = frame.tagged ? apps::parsedMessage(frame.tag, frame.content) : nullptr;
        if (!message) {
            continue;
        }
        bool changed = false;
        for (IDType* const identifier : identifiersIn(*message)) {
            if (const auto other = others.find({identifier->hi(), identifier->lo()}); other != others.end()) {
                identifier->set_hi(other->second.first);
                identifier->set_lo(other->second.second);
                changed = true;
            }
        }
        if (changed) {
            frame.content = message->SerializePartialAsString();
        }
    }
    return said;
}

}  // namespace krutil_client
