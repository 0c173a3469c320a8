#include "krutil/terminal/QueueCommand.hpp"

#include <charconv>
#include <iomanip>
#include <sstream>
#include <string_view>

namespace krutil_client {
namespace {

std::string_view stateName(SentRequest::State state) {
    switch (state) {
        case SentRequest::State::Waiting:
            return "waiting";
        case SentRequest::State::Requeued:
            return "requeued";
        case SentRequest::State::Running:
            return "running";
        case SentRequest::State::HeldUp:
            return "held up";
        case SentRequest::State::Discarded:
            break;
    }
    return "discarded";
}

std::string capabilityNames(const capabilities::CapabilityList& list) {
    std::string text;
    for (const auto capability : list.getEnabledCapabilitySequence()) {
        text += (text.empty() ? "" : ", ") + std::string(capabilities::toString(capability));
    }
    return text.empty() ? "nothing" : text;
}

std::string queueText(const Client& client) {
    constexpr int numberWidth = 4;
    constexpr int stateWidth = 10;
    std::ostringstream text;
    for (const auto& request : client.requests().unanswered()) {
        text << std::right << std::setw(numberWidth) << request->number << "  " << std::left << std::setw(stateWidth)
             << stateName(request->state) << request->name << '\n';
    }
    if (client.requests().unanswered().empty()) {
        text << "Nothing runs, and nothing waits.\n";
    }
    text << "The engine states " << capabilityNames(client.engineCapabilities()) << "; this client states "
         << capabilityNames(client.capabilities()) << ".\n";
    return text.str();
}

}  // namespace

bool obeyQueueCommand(Client& client, const std::string& command, Output& out) {
    constexpr std::string_view cancel = ":queue cancel ";
    if (command == ":queue") {
        out.write(queueText(client));
        return true;
    }
    if (!command.starts_with(cancel)) {
        return false;
    }
    const std::string_view text = std::string_view(command).substr(cancel.size());
    unsigned number = 0;
    const auto parsed = std::from_chars(text.data(), text.data() + text.size(), number);
    const bool whole = parsed.ec == std::errc() && parsed.ptr == text.data() + text.size();
    if (const auto request = whole ? client.requests().find(number) : nullptr) {
        client.cancel(request);
    } else {
        out.write("There is no request '" + std::string(text) + "'; :queue lists those that there are.\n");
    }
    return true;
}

}  // namespace krutil_client
