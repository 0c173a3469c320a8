#include "krutil/display/PersonPrinter.hpp"

#include <array>
#include <cstdio>

#include "korvel/lang/diagnostic/IssuedEnabledWarningEvent.hpp"
#include "krutil/arrays/ArrayText.hpp"
#include "krutil/base/Text.hpp"
#include "krutil/display/ErrorText.hpp"
#include "krutil/display/WarningText.hpp"
#include "krutil/io/PrintableErrorEvent.hpp"
#include "krutil/io/SinkTextEvent.hpp"
#include "krutil/io/TextBaseEvent.hpp"
#include "msg_svc/protobuf/ustring.hpp"

namespace krutil_client {
namespace {

constexpr const char* red = "\x1b[31m";
constexpr const char* yellow = "\x1b[33m";
constexpr const char* plain = "\x1b[0m";

std::string milliseconds(Timing::Duration duration) {
    std::array<char, 32> text{};
    std::snprintf(text.data(), text.size(), "%.2f ms", std::chrono::duration<double, std::milli>(duration).count());
    return text.data();
}

}  // namespace

void PersonPrinter::subscribe(foundation::msg_svc::eventmgr::EventMgr& events) {
    events.subscribe<krutil::io::TextBaseEvent>([this](const krutil::io::TextBaseEvent& event) { show(event); });
    events.subscribe<krutil::io::SinkTextEvent>([this](const krutil::io::SinkTextEvent& event) {
        // Of a page the person has the value's text.
        if (!pictureLine(event.getText()) || announcesImage(event.getText())) {
            show(event);
        }
    });
    // The other event of a warning comes for hidden ones too.
    events.subscribe<korvel::lang::diagnostic::IssuedEnabledWarningEvent>(
        [this](const korvel::lang::diagnostic::IssuedEnabledWarningEvent& event) {
            complain(yellow, warningText(event.getWarning(), style_.warningStack));
        });
    events.subscribe<krutil::io::PrintableErrorEvent>([this](const krutil::io::PrintableErrorEvent& event) {
        complain(red, msg_svc::protobuf::ustring_to_utf8(event.getText()));
    });
}

// Of the engine's text.
std::string PersonPrinter::shown(const std::string& text) const {
    return style_.safeText ? safeText(text) : text;
}

void PersonPrinter::show(const krutil::io::TextBase& text) {
    const std::string utf8 = msg_svc::protobuf::ustring_to_utf8(text.getText());
    if (text.getStreamType() == krutil::io::StreamTypeEnum::ERROR_STREAM) {
        complain(red, utf8);
    } else {
        out_.write(shown(utf8));
    }
}

void PersonPrinter::complain(const char* color, const std::string& text) {
    err_.write(style_.color ? color + shown(text) + plain : shown(text));
}

void PersonPrinter::connected(const foundation::msg_svc::transport::layers::session::Peer&,
                              const std::unordered_map<std::string, std::string>&) {}

void PersonPrinter::returned(const Returned& output) {
    const std::string name =
        output.count == 1 ? std::string()
                          : "output " + std::to_string(output.number) + " of " + std::to_string(output.count) + ": ";
    out_.write(name + (output.file.empty() ? shown(arrayText(output.array))
                                           : arrayHeading(output.array) + " -> " + output.file + "\n"));
}

void PersonPrinter::pictured(const Pictured& picture) {
    err_.write("krutil: picture " + std::to_string(picture.picture.number) + " is in " + picture.file + '\n');
}

void PersonPrinter::replied(const Replied& reply) {
    if (reply.error == nullptr || reply.told) {
        return;
    }
    switch (reply.error->getExecutionStatus()) {
        case krutil::cmddistributor::inEXECUTION_CTRLC:
            err_.write("krutil: cancelled\n");
            break;
        case krutil::cmddistributor::inEXECUTION_DBQUIT:
            err_.write("krutil: the debugger was left with quit\n");
            break;
        default:
            complain(red, errorText(*reply.error));
    }
}

void PersonPrinter::failed(int, const std::string&) {}

void PersonPrinter::timed(const Timing& timing) {
    std::string text;
    const auto add = [&text](std::string_view what, const std::optional<Timing::Duration>& duration) {
        if (duration) {
            text += text.empty() ? "krutil: " : ", ";
            text += what;
            text += " after " + milliseconds(*duration);
        }
    };
    add("engine ready", timing.ready);
    add("first output", timing.firstOutput);
    add("answered", timing.answered);
    if (!text.empty()) {
        err_.write(text + '\n');
    }
}

}  // namespace krutil_client
