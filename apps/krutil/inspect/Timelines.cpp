#include "krutil/inspect/Timelines.hpp"

#include <algorithm>
#include <utility>
#include <vector>

#include "krutil/inspect/MessageText.hpp"
#include "krutil/inspect/Summary.hpp"

namespace krutil_client {

void Timelines::endLine(Timeline& timeline) {
    if (timeline.messages == 0) {
        return;
    }
    timeline.text += timeline.line;
    if (timeline.messages > 1) {
        timeline.text += " (" + std::to_string(timeline.messages) + " messages)";
    }
    timeline.text += ", " + std::to_string(timeline.bytes) + " bytes\n";
    timeline.messages = 0;
    timeline.bytes = 0;
}

std::string Timelines::take(const InspectedMessage& message) {
    if (message.request.empty()) {
        return {};
    }
    const std::string key = std::to_string(message.first().session) + " " + message.request;
    const auto [found, fresh] = open_.try_emplace(key);
    Timeline& timeline = found->second;
    const std::string type = message.type();
    if (fresh) {
        timeline.begin = message.first().nanoseconds;
        timeline.text = "request " + message.request + ": " + summaryOf(message) + "\n";
    }
    if (type != timeline.type || timeline.messages == 0) {
        endLine(timeline);
        const std::string summary = fresh ? std::string() : summaryOf(message);
        timeline.type = type;
        timeline.line = "   +" + secondsText(message.first().nanoseconds, timeline.begin) +
                        (message.first().sender == apps::RecordedUnit::Role::Client ? " --> " : " <-- ") +
                        printableName(type) + (summary.empty() ? "" : ": " + summary);
    }
    ++timeline.messages;
    timeline.bytes += message.size();
    if (type != "IIPReply") {
        return {};
    }
    endLine(timeline);
    std::string text = std::move(timeline.text);
    open_.erase(found);
    return text;
}

std::string Timelines::rest() {
    std::vector<Timeline> inOrder;
    for (auto& [request, timeline] : open_) {
        inOrder.push_back(std::move(timeline));
    }
    open_.clear();
    std::sort(inOrder.begin(), inOrder.end(),
              [](const Timeline& left, const Timeline& right) { return left.begin < right.begin; });
    std::string text;
    for (Timeline& timeline : inOrder) {
        endLine(timeline);
        text += timeline.text + "   no reply\n";
    }
    return text;
}

}  // namespace krutil_client
