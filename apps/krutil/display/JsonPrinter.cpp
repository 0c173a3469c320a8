#include "krutil/display/JsonPrinter.hpp"

#include <boost/variant.hpp>
#include <cmath>
#include <cstdint>
#include <cstring>
#include <map>
#include <nlohmann/json.hpp>
#include <utility>

#include "cmddistributor/DebugLoopEvent.hpp"
#include "cmddistributor/IIPStateEvent.hpp"
#include "korvel/lang/diagnostic/IssuedEnabledWarningEvent.hpp"
#include "korvel/lang/diagnostic/IssuedWarningEvent.hpp"
#include "krutil/arrays/ArrayText.hpp"
#include "krutil/base/JsonLine.hpp"
#include "krutil/base/Text.hpp"
#include "krutil/capabilities_api/CapabilitiesChanged.hpp"
#include "krutil/eventmgr/QVMShutdownEvent.hpp"
#include "krutil/io/PrintableErrorEvent.hpp"
#include "krutil/io/SinkTextEvent.hpp"
#include "krutil/io/TextBaseEvent.hpp"
#include "msg_svc/protobuf/ustring.hpp"

namespace krutil_client {
namespace {

using foundation::korveldata::Array;
using foundation::korveldata::ElementType;
using nlohmann::ordered_json;

ordered_json capabilitySequence(const capabilities::CapabilityList& list) {
    ordered_json names = ordered_json::array();
    for (const auto capability : list.getEnabledCapabilitySequence()) {
        names.push_back(capabilities::toString(capability));
    }
    return names;
}

ordered_json errorObject(const cmddistributor::RuntimeException& error) {
    ordered_json frames = ordered_json::array();
    for (const auto& frame : error.getStackFrames()) {
        frames.push_back(
            {{"file", msg_svc::protobuf::ustring_to_utf8(frame.file)}, {"function", frame.func}, {"line", frame.line}});
        // 2^53: whole numbers up to here are exact.
        if (std::trunc(frame.line) == frame.line && std::abs(frame.line) <= 9007199254740992.0) {
            frames.back()["line"] = static_cast<std::int64_t>(frame.line);
        }
    }
    ordered_json causes = ordered_json::array();
    for (const auto& cause : error.getCauses()) {
        causes.push_back(errorObject(cause));
    }
    return {{"status", statusName(error.getExecutionStatus())},
            {"id", error.GetID()},
            {"message", msg_svc::protobuf::ustring_to_utf8(error.GetUnicodeMessageTxt())},
            {"function", error.getFunctionName()},
            {"frames", std::move(frames)},
            {"causes", std::move(causes)}};
}

template <class T>
ordered_json numberAt(const char* bytes) {
    T number;
    std::memcpy(&number, bytes, sizeof number);
    if constexpr (std::is_floating_point_v<T>) {
        if (!std::isfinite(number)) {
            return std::isnan(number) ? "nan" : number > 0 ? "inf" : "-inf";
        }
    }
    return number;
}

template <class T>
ordered_json complexAt(const char* bytes) {
    return ordered_json::array({numberAt<T>(bytes), numberAt<T>(bytes + sizeof(T))});
}

ordered_json elementAt(const Array& array, std::uint64_t index) {
    const char* const bytes = array.data() + index * elementSize(array.elementType());
    switch (array.elementType()) {
        case ElementType::Bool:
            return *bytes != 0;
        case ElementType::Char16: {
            char16_t unit = 0;
            std::memcpy(&unit, bytes, sizeof unit);
            return msg_svc::protobuf::ustring_to_utf8(std::u16string(1, unit));
        }
        case ElementType::Single:
            return numberAt<float>(bytes);
        case ElementType::Double:
            return numberAt<double>(bytes);
        case ElementType::Int8:
            return numberAt<std::int8_t>(bytes);
        case ElementType::UInt8:
            return numberAt<std::uint8_t>(bytes);
        case ElementType::Int16:
            return numberAt<std::int16_t>(bytes);
        case ElementType::UInt16:
            return numberAt<std::uint16_t>(bytes);
        case ElementType::Int32:
            return numberAt<std::int32_t>(bytes);
        case ElementType::UInt32:
            return numberAt<std::uint32_t>(bytes);
        case ElementType::Int64:
            return numberAt<std::int64_t>(bytes);
        case ElementType::UInt64:
            return numberAt<std::uint64_t>(bytes);
        case ElementType::ComplexSingle:
            return complexAt<float>(bytes);
        case ElementType::ComplexDouble:
            return complexAt<double>(bytes);
        case ElementType::ComplexInt8:
            return complexAt<std::int8_t>(bytes);
        case ElementType::ComplexUInt8:
            return complexAt<std::uint8_t>(bytes);
        case ElementType::ComplexInt16:
            return complexAt<std::int16_t>(bytes);
        case ElementType::ComplexUInt16:
            return complexAt<std::uint16_t>(bytes);
        case ElementType::ComplexInt32:
            return complexAt<std::int32_t>(bytes);
        case ElementType::ComplexUInt32:
            return complexAt<std::uint32_t>(bytes);
        case ElementType::ComplexInt64:
            return complexAt<std::int64_t>(bytes);
        case ElementType::ComplexUInt64:
            return complexAt<std::uint64_t>(bytes);
        case ElementType::Container:
            break;
    }
    return nullptr;
}

ordered_json elementsOf(const Array& array, const std::vector<std::uint64_t>& strides, std::size_t dimension,
                        std::uint64_t index) {
    if (dimension == strides.size()) {
        return elementAt(array, index);
    }
    ordered_json list = ordered_json::array();
    for (std::uint64_t i = 0; i < array.dimensions()[dimension]; ++i) {
        list.push_back(elementsOf(array, strides, dimension + 1, index + i * strides[dimension]));
    }
    return list;
}

struct ArgumentObject : boost::static_visitor<ordered_json> {
    ordered_json operator()(const std::u16string& text) const { return msg_svc::protobuf::ustring_to_utf8(text); }
    ordered_json operator()(double number) const { return numberAt<double>(reinterpret_cast<const char*>(&number)); }
    template <class T>
    ordered_json operator()(T number) const {
        return number;
    }
};

template <class EventT>
ordered_json warningObject(bool shown, const EventT& event) {
    const auto& warning = event.getWarning();
    ordered_json arguments = ordered_json::array();
    for (const auto& argument : warning.getArguments()) {
        arguments.push_back(boost::apply_visitor(ArgumentObject(), argument.getValue()));
    }
    ordered_json stack = ordered_json::array();
    for (const auto& frame : warning.getStack()) {
        stack.push_back({{"file", msg_svc::protobuf::ustring_to_utf8(frame.file)},
                         {"function", msg_svc::protobuf::ustring_to_utf8(frame.name)},
                         {"line", frame.line}});
    }
    return {{"event", "warning"},
            {"request", toString(event.getRequestId())},
            {"shown", shown},
            {"id", warning.getIdentifier()},
            {"message", msg_svc::protobuf::ustring_to_utf8(warning.getMessage())},
            {"format", msg_svc::protobuf::ustring_to_utf8(warning.getFormat())},
            {"arguments", std::move(arguments)},
            {"stack", std::move(stack)},
            {"hidden", warning.getWasDisabled()},
            {"time", ArgumentObject()(warning.getTime())}};
}

const char* loopName(krutil::prompt::InputRequester loop) {
    using krutil::prompt::InputRequester;
    switch (loop) {
        case InputRequester::mnNO_PROMPT:
            return "none";
        case InputRequester::mnBASE_PROMPT:
            return "base";
        case InputRequester::mnDEBUG_PROMPT:
            return "debug";
        case InputRequester::mnINPUT_PROMPT:
            return "input";
        case InputRequester::mnKEYBOARD_PROMPT:
            return "keyboard";
        case InputRequester::mnPAUSE_PROMPT:
            return "pause";
        case InputRequester::mnBANG_PROMPT:
            return "bang";
        case InputRequester::mnDRAVELIN_DEBUG_PROMPT:
            return "dravelin debug";
        case InputRequester::mnINCOMPLETE_BLOCK_PROMPT:
            return "incomplete block";
        case InputRequester::mnMORE_PROMPT:
            return "more";
        case InputRequester::mnEMERGENCY_EXIT_PROMPT:
            return "emergency exit";
        case InputRequester::mnTOLVARENS_DEBUG_PROMPT:
            return "tolvarens debug";
        case InputRequester::mnTW_EQL_DEBUG_PROMPT:
            break;
    }
    return "tw eql debug";
}

template <class EventT>
ordered_json textObject(const char* name, const EventT& event) {
    return {{"event", name},
            {"request", toString(event.getRequestId())},
            {"stream", streamName(event.getStreamType())},
            {"text", msg_svc::protobuf::ustring_to_utf8(event.getText())}};
}

}  // namespace

void JsonPrinter::print(const ordered_json& object) {
    out_.write(jsonLine(object));
}

void JsonPrinter::subscribe(foundation::msg_svc::eventmgr::EventMgr& events) {
    const auto state = [this, &events]<class EventT>(std::in_place_type_t<EventT>, const char* name) {
        events.subscribe<EventT>([this, name](const EventT& event) {
            print({{"event", name}, {"request", toString(event.getRequestId())}});
        });
    };
    // By exact type: the last event is a completed event too, and is shown once.
    state(std::in_place_type<cmddistributor::IIPStartedEvent>, "started");
    state(std::in_place_type<cmddistributor::IIPSuspendedEvent>, "suspended");
    state(std::in_place_type<cmddistributor::IIPResumedEvent>, "resumed");
    state(std::in_place_type<cmddistributor::IIPDiscardedEvent>, "discarded");
    state(std::in_place_type<cmddistributor::IIPRequeuedEvent>, "requeued");
    state(std::in_place_type<cmddistributor::IIPReactivatedEvent>, "reactivated");
    state(std::in_place_type<cmddistributor::IIPCompletedEvent>, "completed");
    state(std::in_place_type<cmddistributor::LastIIPEvent>, "last");
    events.subscribe<krutil::io::TextBaseEvent>(
        [this](const krutil::io::TextBaseEvent& event) { print(textObject("text", event)); });
    events.subscribe<krutil::io::SinkTextEvent>(
        [this](const krutil::io::SinkTextEvent& event) { print(textObject("value", event)); });
    events.subscribe<krutil::capabilities_api::CapabilitiesChanged>(
        [this](const krutil::capabilities_api::CapabilitiesChanged& event) {
            print({{"event", "capabilities"},
                   {"previous", capabilitySequence(event.getPreviousCapabilities())},
                   {"engine", capabilitySequence(event.getQvmCapabilities())},
                   {"client", capabilitySequence(event.getClientCapabilities())},
                   {"request", capabilitySequence(event.getRequestCapabilities())}});
        });
    events.subscribe<korvel::lang::diagnostic::IssuedWarningEvent>(
        [this](const korvel::lang::diagnostic::IssuedWarningEvent& event) { print(warningObject(false, event)); });
    events.subscribe<korvel::lang::diagnostic::IssuedEnabledWarningEvent>(
        [this](const korvel::lang::diagnostic::IssuedEnabledWarningEvent& event) {
            print(warningObject(true, event));
        });
    events.subscribe<krutil::io::PrintableErrorEvent>([this](const krutil::io::PrintableErrorEvent& event) {
        print({{"event", "error"},
               {"request", toString(event.getRequestId())},
               {"text", msg_svc::protobuf::ustring_to_utf8(event.getText())},
               {"error", errorObject(event.getException())}});
    });
    events.subscribe<cmddistributor::DebugLoopEvent>([this](const cmddistributor::DebugLoopEvent& event) {
        print({{"event", "loop"},
               {"request", toString(event.getRequestId())},
               {"state", event.getLoopState() == cmddistributor::DebugLoopEvent::ENTER ? "enter" : "exit"},
               {"loop", loopName(event.getWhichDebugLoop())}});
    });
    events.subscribe<krutil::eventmgr::QVMShutdownEvent>([this](const krutil::eventmgr::QVMShutdownEvent&) {
        print({{"event", "shutdown"}});
    });
}

void JsonPrinter::connected(const foundation::msg_svc::transport::layers::session::Peer& peer,
                            const std::unordered_map<std::string, std::string>& features) {
    print({{"event", "connected"},
           {"engine", peer.build},
           {"features", std::map<std::string, std::string>(features.begin(), features.end())},
           {"capabilities", capabilitySequence(peer.capabilities)}});
}

void JsonPrinter::returned(const Returned& output) {
    const Array& array = output.array;
    ordered_json object{
        {"event", "output"},
        {"request", toString(output.request)},
        {"number", output.number},
        {"type", elementTypeName(array.elementType())},
        {"dimensions", array.dimensions()},
        {"order", array.order() == foundation::korveldata::MemoryOrder::ColumnMajor ? "column-major" : "row-major"}};
    if (!output.file.empty()) {
        object["file"] = output.file;
    } else if (isText(array)) {
        object["text"] = msg_svc::protobuf::ustring_to_utf8(array.toText());
    } else if (const auto elements = array.numberOfElements(); elements > 0 && elements <= mostShownElements) {
        object["elements"] = elementsOf(array, stridesOf(array), 0, 0);
    }
    print(object);
}

void JsonPrinter::pictured(const Pictured& picture) {
    ordered_json object{
        {"event", "picture"}, {"number", picture.picture.number}, {"type", typeName(picture.form.type)}};
    if (picture.form.type == PictureForm::Type::Png) {
        const PixelSize size = sizeOfPng(picture.form.content);
        object["width"] = size.width;
        object["height"] = size.height;
    }
    object["file"] = picture.file;
    print(object);
}

void JsonPrinter::replied(const Replied& reply) {
    ordered_json object{{"event", "reply"}, {"request", toString(reply.request)}, {"ok", reply.error == nullptr}};
    if (reply.error != nullptr) {
        object["error"] = errorObject(*reply.error);
    }
    print(object);
}

void JsonPrinter::failed(int exitCode, const std::string& sentence) {
    print({{"event", "failure"}, {"exitCode", exitCode}, {"text", sentence}});
}

void JsonPrinter::timed(const Timing& timing) {
    ordered_json object{{"event", "timing"}};
    const auto add = [&object](const char* name, const std::optional<Timing::Duration>& duration) {
        if (duration) {
            object[name] = std::chrono::duration<double, std::milli>(*duration).count();
        }
    };
    add("readyMs", timing.ready);
    add("firstOutputMs", timing.firstOutput);
    add("answeredMs", timing.answered);
    print(object);
}

}  // namespace krutil_client
