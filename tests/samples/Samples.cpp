#include "samples/Samples.hpp"

#include <bit>
#include <boost/make_shared.hpp>
#include <cmath>
#include <complex>
#include <cstdint>
#include <iomanip>
#include <limits>
#include <sstream>
#include <stdexcept>
#include <type_traits>
#include <typeinfo>
#include <utility>

#include "cmddistributor/DebugLoopEvent.hpp"
#include "cmddistributor/EvalIIP.hpp"
#include "cmddistributor/FEvalIIP.hpp"
#include "cmddistributor/FEvalResult.hpp"
#include "cmddistributor/IIPCancelMessage.hpp"
#include "cmddistributor/IIPCancelReply.hpp"
#include "cmddistributor/IIPEnqueueMessage.hpp"
#include "cmddistributor/IIPStateEvent.hpp"
#include "foundation/korveldata/ArrayFactory.hpp"
#include "korvel/lang/diagnostic/IssuedEnabledWarningEvent.hpp"
#include "korvel/lang/diagnostic/IssuedWarningEvent.hpp"
#include "krutil/capabilities_api/CapabilitiesChanged.hpp"
#include "krutil/cmddistributor/IIPReply.hpp"
#include "krutil/eventmgr/QVMShutdownEvent.hpp"
#include "krutil/io/PrintableErrorEvent.hpp"
#include "krutil/io/SinkTextEvent.hpp"
#include "krutil/io/TextBaseEvent.hpp"

namespace samples {
namespace {

using capabilities::Capability;
using capabilities::CapabilityList;
using cmddistributor::CodeType;
using cmddistributor::DebugLoopEvent;
using cmddistributor::EvalIIP;
using cmddistributor::FEvalIIP;
using cmddistributor::FEvalResult;
using cmddistributor::IIP;
using cmddistributor::IIPCancelMessage;
using cmddistributor::IIPCancelReply;
using cmddistributor::IIPEnqueueMessage;
using cmddistributor::IIPResult;
using cmddistributor::IqmStreamID;
using cmddistributor::RuntimeException;
using cmddistributor::StackFrame;
using foundation::korveldata::Array;
using foundation::korveldata::ArrayFactory;
using foundation::korveldata::MemoryOrder;
using foundation::msg_svc::eventmgr::BaseEvent;
using foundation::msg_svc::exchange::IDType;
using foundation::msg_svc::exchange::Message;
using foundation::msg_svc::exchange::Reply;
using korvel::lang::PrintfArgument;
using korvel::lang::diagnostic::IssuedEnabledWarningEvent;
using korvel::lang::diagnostic::IssuedWarningEvent;
using korvel::lang::diagnostic::Warning;
using krutil::capabilities_api::CapabilitiesChanged;
using krutil::cmddistributor::EDIDataWrapper;
using krutil::cmddistributor::IIPReply;
using krutil::eventmgr::QVMShutdownEvent;
using krutil::io::PrintableErrorEvent;
using krutil::io::SinkTextEvent;
using krutil::io::SinkTraits;
using krutil::io::StreamTypeEnum;
using krutil::io::TextBaseEvent;

// ---- Description ----------------------------------------------------------------------------------------------------

std::string hex(std::uint64_t value, int digits) {
    std::ostringstream out;
    out << std::hex << std::setfill('0') << std::setw(digits) << value;
    return out.str();
}

// One "name: value" line for each value; names of nested objects are prefixed with the path that leads to them.
class Description {
  public:
    explicit Description(View view) : view_(view) {}

    bool afterTrip() const { return view_ == View::AfterTrip; }
    std::string text() const { return out_.str(); }

    void add(const std::string& name, const std::string& value) { line(name, quoted(value)); }
    void add(const std::string& name, const char* value) { line(name, value); }
    void add(const std::string& name, const std::u16string& value) { line(name, quoted(value)); }
    void add(const std::string& name, const IDType& value) { line(name, toString(value)); }
    void add(const std::string& name, const CapabilityList& value) { line(name, toString(value)); }
    void add(const std::string& name, bool value) { line(name, value ? "true" : "false"); }

    // By its bits too: a NaN is a value like any other, and so is a negative zero.
    void add(const std::string& name, double value) {
        line(name, std::to_string(value) + " 0x" + hex(std::bit_cast<std::uint64_t>(value), 16));
    }

    template <class Number>
    requires std::is_integral_v<Number> || std::is_enum_v<Number>
    void add(const std::string& name, Number value) {
        if constexpr (std::is_enum_v<Number>) {
            line(name, std::to_string(static_cast<std::underlying_type_t<Number>>(value)));
        } else {
            line(name, std::to_string(value));
        }
    }

    // What stays in the process: as it is, or gone.
    void addLocal(const std::string& name, bool present) { add(name, present && !afterTrip()); }

    template <class Nested>
    void nest(const std::string& name, const Nested& nested) {
        const std::string outer = std::exchange(prefix_, prefix_ + name + ".");
        addContent(*this, nested);
        prefix_ = outer;
    }

  private:
    void line(const std::string& name, const std::string& value) { out_ << prefix_ << name << ": " << value << '\n'; }

    View view_;
    std::string prefix_;
    std::ostringstream out_;
};

void addContent(Description& out, const SinkTraits& traits) {
    out.addLocal("untransmitted", traits.getUntransmitted());
    out.add("supportsHotlinks", traits.getSupportsHotlinks());
    out.add("needsFormattingForDisplay", traits.getNeedsFormattingForDisplay());
    out.add("useDiary", traits.getUseDiary());
    out.add("useEcho", traits.getUseEcho());
    out.add("useLogging", traits.getUseLogging());
}

void addContent(Description& out, const StackFrame& frame) {
    out.add("file", frame.file);
    out.add("func", frame.func);
    out.add("line", frame.line);
}

void addContent(Description& out, const RuntimeException& exception) {
    out.add("status", exception.getExecutionStatus());
    out.add("msgID", exception.GetID());
    out.add("msgText", exception.GetUnicodeMessageTxt());
    out.add("functionName", exception.getFunctionName());
    out.addLocal("shown", exception.getShown());
    for (std::size_t i = 0; i < exception.getStackFrames().size(); ++i) {
        out.nest("frame" + std::to_string(i), exception.getStackFrames()[i]);
    }
    for (std::size_t i = 0; i < exception.getCauses().size(); ++i) {
        out.nest("cause" + std::to_string(i), exception.getCauses()[i]);
    }
}

void addContent(Description& out, const EvalIIP& request) {
    out.add("pluginType", request.getPluginType());
    out.add("streamID", request.getStreamID());
    out.nest("outTraits", request.getOutTraits());
    out.nest("errTraits", request.getErrTraits());
    out.add("cmd", request.getCommand());
    out.add("codeType", request.getCodeType());
    out.addLocal("workspace", request.getWorkspace() != nullptr);
}

// The elements in hexadecimal, so that the memory order shows; only their number when there are many of them.
void addContent(Description& out, const Array& array) {
    std::string dimensions;
    for (const std::uint64_t extent : array.dimensions()) {
        dimensions += (dimensions.empty() ? "" : " x ") + std::to_string(extent);
    }
    out.add("type", array.elementType());
    out.add("dimensions", dimensions);
    out.add("order", array.order());
    out.add("bytes", array.sizeInBytes());
    std::uint64_t sum = 0;
    std::string elements;
    for (std::uint64_t i = 0; i < array.sizeInBytes(); ++i) {
        const auto byte = static_cast<unsigned char>(array.data()[i]);
        sum = sum * 31 + byte;
        if (i < 64) {
            elements += hex(byte, 2);
        }
    }
    out.add("elements", elements);
    out.add("sum", sum);
}

void addContent(Description& out, const FEvalIIP& request) {
    out.add("pluginType", request.getPluginType());
    out.add("streamID", request.getStreamID());
    out.nest("outTraits", request.getOutTraits());
    out.nest("errTraits", request.getErrTraits());
    out.add("function", request.getFunctionName());
    out.add("nlhs", request.getNlhs());
    out.add("clientQvmID", request.getClientQvmID());
    out.add("serverQvmID", request.getQvmID());
    out.addLocal("local", request.isLocal());
    const auto& arrays = boost::get<EDIDataWrapper>(request.getInputArguments()).arrays();
    for (std::size_t i = 0; i < arrays.size(); ++i) {
        out.nest("argument" + std::to_string(i), arrays[i]);
    }
}

void addContent(Description& out, const FEvalResult& result) {
    out.add("id", result.id);
    out.addLocal("exception", result.getException().has_value());
    const auto& arrays = boost::get<std::vector<Array>>(result.getResults());
    for (std::size_t i = 0; i < arrays.size(); ++i) {
        out.nest("output" + std::to_string(i), arrays[i]);
    }
}

// Requests and results that another object holds, by dynamic type.
void addContent(Description& out, const IIP& request) {
    if (const auto* eval = dynamic_cast<const EvalIIP*>(&request)) {
        out.add("class", "EvalIIP");
        addContent(out, *eval);
    } else if (const auto* call = dynamic_cast<const FEvalIIP*>(&request)) {
        out.add("class", "FEvalIIP");
        addContent(out, *call);
    } else {
        out.add("class", typeid(request).name());
    }
}

void addContent(Description& out, const IIPResult& result) {
    if (const auto* call = dynamic_cast<const FEvalResult*>(&result)) {
        out.add("class", "FEvalResult");
        addContent(out, *call);
        return;
    }
    out.add("class", typeid(result) == typeid(IIPResult) ? "IIPResult" : typeid(result).name());
    out.add("id", result.id);
    if (result.getException()) {
        out.nest("exception", *result.getException());
    }
}

void addContent(Description& out, const IIPEnqueueMessage& message) {
    out.nest("iip", *message.getIIP());
    out.add("id", message.getID());
    out.add("qcrID", message.getQcrID());
    if (message.getQvmID() && !(out.afterTrip() && *message.getQvmID() == 0)) {
        out.add("qvmID", *message.getQvmID());
    }
    out.addLocal("eventMgr", message.getEventMgr() != nullptr);
    out.add("dequeueMode", message.getDequeueMode());
    out.add("name", message.getDynamicName());
    out.add("capabilities", message.getCapabilities());
    out.addLocal("impersonable", message.getImpersonable() != nullptr);
    out.add("okToFlushSparingly", message.getOkToFlushSparingly());
}

void addContent(Description& out, const IIPReply& reply) {
    out.add("id", reply.getID());
    if (reply.getResult()) {
        out.nest("result", *reply.getResult());
    }
}

void addContent(Description& /*out*/, const QVMShutdownEvent& /*event*/) {}

void addContent(Description& out, const cmddistributor::IIPStateEvent& event) {
    out.add("id", event.getRequestId());
    out.add("type", event.getType());
}

template <class TextEvent>
requires std::is_base_of_v<krutil::io::TextBase, TextEvent>
void addContent(Description& out, const TextEvent& event) {
    out.add("id", event.getRequestId());
    out.add("stream", event.getStreamType());
    out.add("text", event.getText());
}

void addContent(Description& out, const IIPCancelMessage& message) {
    out.add("id", message.getID());
    out.add("evenIfRunning", message.getEvenIfRunning());
}

void addContent(Description& out, const IIPCancelReply& reply) {
    out.add("status", reply.getStatus());
}

void addContent(Description& out, const DebugLoopEvent& event) {
    out.add("id", event.getRequestId());
    out.add("state", event.getLoopState());
    out.add("whichLoop", event.getWhichDebugLoop());
}

void addContent(Description& out, const PrintfArgument& argument) {
    out.add("alternative", argument.getValue().which());
    boost::apply_visitor([&out](const auto& value) { out.add("value", value); }, argument.getValue());
}

void addContent(Description& out, const korvel::lang::StackFrame& frame) {
    out.add("file", frame.file);
    out.add("name", frame.name);
    out.add("line", frame.line);
}

template <class WarningEvent>
requires std::is_same_v<WarningEvent, IssuedWarningEvent> || std::is_same_v<WarningEvent, IssuedEnabledWarningEvent>
void addContent(Description& out, const WarningEvent& event) {
    const Warning& warning = event.getWarning();
    out.add("id", event.getRequestId());
    out.add("identifier", warning.getIdentifier());
    out.add("format", warning.getFormat());
    for (std::size_t i = 0; i < warning.getArguments().size(); ++i) {
        out.nest("argument" + std::to_string(i), warning.getArguments()[i]);
    }
    out.add("message", warning.getMessage());
    for (std::size_t i = 0; i < warning.getStack().size(); ++i) {
        out.nest("frame" + std::to_string(i), warning.getStack()[i]);
    }
    out.add("wasDisabled", warning.getWasDisabled());
    out.add("time", warning.getTime());
}

void addContent(Description& out, const PrintableErrorEvent& event) {
    out.add("id", event.getRequestId());
    out.nest("exception", event.getException());
    out.add("text", event.getText());
}

void addContent(Description& out, const CapabilitiesChanged& event) {
    out.add("previous", event.getPreviousCapabilities());
    out.add("qvm", event.getQvmCapabilities());
    out.add("client", event.getClientCapabilities());
    out.add("request", event.getRequestCapabilities());
}

// ---- Families -------------------------------------------------------------------------------------------------------

// The class that names the family: what a pointer points to, or the value itself.
template <class Handle>
struct PointeeOf {
    using Type = Handle;
};
template <class Handle>
requires requires {
    typename Handle::element_type;
}
struct PointeeOf<Handle> {
    using Type = std::remove_const_t<typename Handle::element_type>;
};
template <class Handle>
using Pointee = typename PointeeOf<Handle>::Type;

template <class Ptr>
using Family = layers::serialization::SerializerAPI<Pointee<Ptr>, Ptr, Ptr>;

template <class T>
std::string describeAs(const Object& object, View view) {
    return std::visit(
        [view](const auto& pointer) -> std::string {
            using Base = Pointee<std::remove_cvref_t<decltype(pointer)>>;
            if constexpr (std::is_same_v<Base, T> && !requires { pointer.get(); }) {
                Description out(view);
                addContent(out, pointer);
                return out.text();
            } else if constexpr (std::is_base_of_v<Base, T>) {
                const Base* raw = pointer.get();
                if (raw == nullptr) {
                    return "no object\n";
                }
                if (typeid(*raw) != typeid(T)) {
                    return std::string("an object of class ") + typeid(*raw).name() + "\n";
                }
                Description out(view);
                addContent(out, dynamic_cast<const T&>(*raw));
                return out.text();
            } else {
                return "an object of another family\n";
            }
        },
        object);
}

template <class T, class... Args>
Sample sample(std::string name, Args&&... args) {
    if constexpr (std::is_same_v<T, Array>) {
        return {std::move(name), T(std::forward<Args>(args)...)};
    } else if constexpr (std::is_base_of_v<IIPResult, T>) {
        return {std::move(name), std::unique_ptr<IIPResult>(new T(std::forward<Args>(args)...))};
    } else {
        auto object = boost::make_shared<T>(std::forward<Args>(args)...);
        if constexpr (std::is_base_of_v<BaseEvent, T>) {
            return {std::move(name), boost::shared_ptr<const BaseEvent>(std::move(object))};
        } else if constexpr (std::is_base_of_v<IIP, T>) {
            return {std::move(name), boost::shared_ptr<const IIP>(std::move(object))};
        } else if constexpr (std::is_base_of_v<Message, T>) {
            return {std::move(name), boost::shared_ptr<const Message>(std::move(object))};
        } else {
            return {std::move(name), boost::shared_ptr<const Reply>(std::move(object))};
        }
    }
}

template <class T, class... Samples>
SampleSet set(std::string serializer, std::string message, Samples&&... given) {
    SampleSet result{std::move(serializer), std::move(message), {}, &describeAs<T>};
    (result.samples.push_back(std::forward<Samples>(given)), ...);
    return result;
}

// ---- Values ---------------------------------------------------------------------------------------------------------

constexpr std::uint64_t largest64 = std::numeric_limits<std::uint64_t>::max();

constexpr IDType requestID{0x0123456789ABCDEFULL, 0xFEDCBA9876543210ULL};
constexpr IDType replyID{0x1111111122222222ULL, 0x3333333344444444ULL};
constexpr IDType noID{};
constexpr IDType largestID{largest64, largest64 - 1};

// Two, three and four bytes of UTF-8, the last code point of all, and a NUL in the middle.
const std::u16string extremeText{u"\u03B1\u03B2\u03B3 \u00FF \u20AC \0 \U0001F600 \U0010FFFF\n", 16};
const std::string extremeBytes{"\xCE\xB1 \0 \xF0\x9F\x98\x80", 9};

// Over both traits of the typical and of the extreme request, each of the five booleans has a column of its own.
//                            untransmitted, hotlinks, formatting, diary, echo, logging
const SinkTraits typicalOut{false, true, false, true, false, true};
const SinkTraits typicalErr{false, false, true, true, false, false};
const SinkTraits extremeOut{true, false, false, false, true, true};
const SinkTraits extremeErr{true, true, true, true, true, true};

boost::shared_ptr<const IIP> typicalRequest() {
    return boost::make_shared<EvalIIP>("console", IqmStreamID::ekIqmAllStreams, nullptr, typicalOut, typicalErr,
                                       u"x = 6 * 7", CodeType::ScriptType);
}

// The least that a peer accepts: its plug-in type must not be empty.
boost::shared_ptr<const IIP> leastRequest() {
    return boost::make_shared<EvalIIP>("x", IqmStreamID::ekIqmCmdWinStream, nullptr, SinkTraits(), SinkTraits(), u"",
                                       CodeType::CodeBlockType);
}

RuntimeException typicalException() {
    return {krutil::cmddistributor::inRUNTIME_ERROR,
            u"division by zero",
            "ZeroDivisionError",
            "ratio",
            {{u"<input>", "ratio", 12}, {u"library.py", "<module>", 3}},
            {},
            false};
}

// Three levels of causes, two side by side, with the statuses and the doubles that ordinary errors do not have.
RuntimeException extremeException() {
    using namespace krutil::cmddistributor;
    constexpr double infinity = std::numeric_limits<double>::infinity();
    const RuntimeException deepest{inCOMM_ERROR, u"deepest", "id3", "f3", {{u"", "", -0.0}}, {}, false};
    const RuntimeException left{inEXECUTION_DBQUIT, u"left", "id2", "f2", {{u"a", "b", -infinity}}, {deepest}, false};
    const RuntimeException right{inCOMPILE_ERROR, u"right", "id1", "f1", {}, {}, false};
    return {inEXECUTION_CTRLC,
            extremeText,
            extremeBytes,
            std::string("f\0g", 3),
            {{extremeText, extremeBytes, 12.5},
             {u"nan", "payload", std::bit_cast<double>(std::uint64_t{0x7FF8000000C0FFEEULL})},
             {u"inf", "", infinity},
             {u"huge", "", std::numeric_limits<double>::max()},
             {u"tiny", "", std::numeric_limits<double>::denorm_min()}},
            {left, right},
            true};
}

// Rows of 3, counting up.
template <class T>
Array counting(std::uint64_t rows, MemoryOrder order = MemoryOrder::RowMajor) {
    std::vector<T> values(rows * 3);
    for (std::size_t i = 0; i < values.size(); ++i) {
        values[i] = static_cast<T>(i + 1);
    }
    return ArrayFactory().createArray(foundation::korveldata::ElementTypeOf<T>::value, {rows, 3}, order, values.data());
}

std::vector<Array> typicalArrays() {
    return {ArrayFactory().createScalar(6.5), ArrayFactory().createText(u"text"), counting<std::int32_t>(2)};
}

// Both orders, no elements, the largest numbers, and one that is large enough to travel in a frame of its own.
std::vector<Array> extremeArrays() {
    return {counting<double>(2, MemoryOrder::ColumnMajor),
            Array(),
            ArrayFactory().createText(extremeText),
            ArrayFactory().createScalar(largest64),
            ArrayFactory().createScalar(std::complex<double>(-0.0, std::numeric_limits<double>::infinity())),
            ArrayFactory().createScalar(true),
            counting<float>(700)};
}

FEvalIIP call(const std::string& function, unsigned long nlhs, std::vector<Array>&& arguments, IqmStreamID streamID,
              const SinkTraits& out, const SinkTraits& err, krutil::contextmgr::QvmID client,
              krutil::contextmgr::QvmID server) {
    return {"console", function, nlhs, FEvalIIP::Data::makeClientSideData(EDIDataWrapper(std::move(arguments))),
            streamID,  out,      err,  client,
            server,    true};
}

Warning typicalWarning() {
    return {"demo:ratio",
            u"ratio of %d to %d",
            {PrintfArgument(6), PrintfArgument(7U)},
            u"ratio of 6 to 7",
            {{u"<input>", u"ratio", 12}, {u"library.py", u"<module>", 3}},
            true,
            738000.5};
}

// Every type of argument, each with the value that only it can hold.
Warning extremeWarning() {
    return {
        extremeBytes,
        extremeText,
        {PrintfArgument(std::numeric_limits<int>::min()), PrintfArgument(std::numeric_limits<unsigned int>::max()),
         PrintfArgument(std::numeric_limits<long>::min()), PrintfArgument(std::numeric_limits<unsigned long>::max()),
         PrintfArgument(-1L), PrintfArgument(std::bit_cast<double>(std::uint64_t{0x7FF8000000C0FFEEULL})),
         PrintfArgument(extremeText), PrintfArgument()},
        u"message",
        {{extremeText, u"name", std::numeric_limits<unsigned int>::max()}, {u"", u"", 0}},
        false,
        -std::numeric_limits<double>::infinity()};
}

class Workspace : public foundation::korveldata::ICustomWorkspace {};
class Impersonation : public krutil::cmddistributor::Impersonable {};

// ---- The sets -------------------------------------------------------------------------------------------------------

template <class Event>
SampleSet stateEvent(const std::string& serializer) {
    return set<Event>(serializer, "krutil.protobuf.IIPStateEvent", sample<Event>("typical", requestID),
                      sample<Event>("default", noID), sample<Event>("extreme", largestID));
}

template <class Event>
SampleSet textEvent(const std::string& serializer, const std::string& message) {
    return set<Event>(serializer, message,
                      sample<Event>("typical", requestID, StreamTypeEnum::ERROR_STREAM, u"x =\n\n    42\n\n"),
                      sample<Event>("default", noID, StreamTypeEnum::OUTPUT_STREAM, u""),
                      sample<Event>("extreme", largestID, StreamTypeEnum::GENERIC_STREAM, extremeText));
}

template <class Event>
SampleSet warningEvent(const std::string& serializer, const std::string& message) {
    return set<Event>(serializer, message, sample<Event>("typical", requestID, typicalWarning()),
                      sample<Event>("default", noID, Warning("", u"", {}, u"", {}, false, 0)),
                      sample<Event>("extreme", largestID, extremeWarning()));
}

std::vector<SampleSet> makeSampleSets() {
    using namespace cmddistributor;
    using enum Capability;
    using namespace krutil::cmddistributor::WhenToDequeue;
    constexpr auto largest32 = std::numeric_limits<std::int32_t>::max();
    constexpr auto smallest32 = std::numeric_limits<std::int32_t>::min();
    const auto eventMgr = boost::make_shared<foundation::msg_svc::eventmgr::EventMgr>();
    const auto workspace = boost::make_shared<Workspace>();
    const auto extremeRequest = boost::make_shared<EvalIIP>(extremeBytes, IqmStreamID::ekIqmJavaStream, workspace,
                                                            extremeOut, extremeErr, extremeText, CodeType::Undefined);

    std::vector<SampleSet> sets;
    sets.push_back(set<QVMShutdownEvent>("krutil:QVMShutdownEvent", "krutil.protobuf.QVMShutdownEvent",
                                         sample<QVMShutdownEvent>("default")));
    using krutil::prompt::InputRequester;
    sets.push_back(set<DebugLoopEvent>(
        "krutil:DebugLoopEvent", "krutil.protobuf.DebugLoopEvent",
        sample<DebugLoopEvent>("typical", requestID, DebugLoopEvent::ENTER, InputRequester::mnDEBUG_PROMPT),
        sample<DebugLoopEvent>("default", noID, DebugLoopEvent::EXIT, InputRequester::mnBASE_PROMPT),
        sample<DebugLoopEvent>("extreme", largestID, DebugLoopEvent::ENTER, InputRequester::mnTW_EQL_DEBUG_PROMPT),
        sample<DebugLoopEvent>("no_prompt", replyID, DebugLoopEvent::EXIT, InputRequester::mnNO_PROMPT)));
    sets.push_back(stateEvent<IIPStartedEvent>("krutil:IIPStartedEvent"));
    sets.push_back(stateEvent<IIPSuspendedEvent>("krutil:IIPSuspendedEvent"));
    sets.push_back(stateEvent<IIPResumedEvent>("krutil:IIPResumedEvent"));
    sets.push_back(stateEvent<IIPDiscardedEvent>("krutil:IIPDiscardedEvent"));
    sets.push_back(stateEvent<IIPRequeuedEvent>("krutil:IIPRequeuedEvent"));
    sets.push_back(stateEvent<IIPReactivatedEvent>("krutil:IIPReactivatedEvent"));
    sets.push_back(stateEvent<IIPCompletedEvent>("krutil:IIPCompletedEvent"));
    sets.push_back(stateEvent<LastIIPEvent>("krutil:detail::LastIIPEvent"));
    sets.push_back(textEvent<TextBaseEvent>("krutil:TextBaseEvent", "krutil.protobuf.TextBaseEvent"));
    sets.push_back(textEvent<SinkTextEvent>("krutil:SinkTextEvent", "krutil.protobuf.SinkTextEvent"));

    sets.push_back(set<IIPCancelMessage>("krutil:IIPCancelMessage", "krutil.protobuf.IIPCancelMessage",
                                         sample<IIPCancelMessage>("typical", requestID, true),
                                         sample<IIPCancelMessage>("default", noID, false),
                                         sample<IIPCancelMessage>("extreme", largestID, true)));
    sets.push_back(
        set<IIPCancelReply>("krutil:IIPCancelReply", "krutil.protobuf.IIPCancelReply",
                            sample<IIPCancelReply>("typical", IIPCancelReply::SUCCESSFUL_CANCEL),
                            sample<IIPCancelReply>("default", IIPCancelReply::UNABLE_TO_CANCEL_ALREADY_DONE),
                            sample<IIPCancelReply>("extreme", static_cast<IIPCancelReply::CancelStatus>(smallest32)),
                            sample<IIPCancelReply>("running", IIPCancelReply::UNABLE_TO_CANCEL_ALREADY_RUNNING),
                            sample<IIPCancelReply>("pending", IIPCancelReply::PENDING_CANCEL)));

    sets.push_back(set<IIPEnqueueMessage>(
        "krutil:IIPEnqueueMessage", "krutil.protobuf.IIPEnqueueMessage",
        sample<IIPEnqueueMessage>("typical", typicalRequest(), requestID, 17, 23ULL, nullptr, DEQUEUE_AT_PROMPT,
                                  u"a name", CapabilityList{InteractiveCommandLine, Debugging}, nullptr, true),
        sample<IIPEnqueueMessage>("default", leastRequest(), noID, 0, boost::none, nullptr, DEQUEUE_UNKNOWN, u"",
                                  CapabilityList{}, nullptr, false),
        sample<IIPEnqueueMessage>("extreme", extremeRequest, largestID, smallest32, largest64, eventMgr,
                                  DEQUEUE_AT_BOOTSTRAP, extremeText,
                                  CapabilityList{InteractiveCommandLine, Swing, ComplexSwing, LocalClient, WebWindow,
                                                 ModalDialogs, Debugging},
                                  std::make_shared<Impersonation>(), true),
        sample<IIPEnqueueMessage>("engine_zero", leastRequest(), replyID, largest32, 0ULL, nullptr, DEQUEUE_AT_IDLE,
                                  u"z", CapabilityList{WebWindow}, nullptr, false),
        sample<IIPEnqueueMessage>(
            "call",
            boost::make_shared<FEvalIIP>(
                call("f", 2, typicalArrays(), IqmStreamID::ekIqmCmdWinStream, typicalOut, typicalErr, 3, 4)),
            requestID, 5, 6ULL, nullptr, DEQUEUE_AT_PPE, u"c", CapabilityList{}, nullptr, false)));

    sets.push_back(set<EvalIIP>("krutil:EvalIIP", "krutil.protobuf.EvalIIP",
                                sample<EvalIIP>("typical", "console", IqmStreamID::ekIqmAllStreams, nullptr, typicalOut,
                                                typicalErr, u"print(6 * 7)", CodeType::ScriptType),
                                sample<EvalIIP>("default", "x", IqmStreamID::ekIqmCmdWinStream, nullptr, SinkTraits(),
                                                SinkTraits(), u"", CodeType::CodeBlockType),
                                sample<EvalIIP>("extreme", extremeBytes, IqmStreamID::ekIqmJavaStream, workspace,
                                                extremeOut, extremeErr, extremeText, CodeType::Undefined),
                                sample<EvalIIP>("no_streams", "y", IqmStreamID::ekIqmNoStreams, nullptr, typicalErr,
                                                typicalOut, u"z = 1", CodeType::ConventionalType)));

    sets.push_back(set<IIPResult>(
        "krutil:IIPResult", "krutil.protobuf.IIPResult", sample<IIPResult>("success", requestID, boost::none),
        sample<IIPResult>("typical", requestID, typicalException()), sample<IIPResult>("default", noID, boost::none),
        sample<IIPResult>("extreme", largestID, extremeException()),
        sample<IIPResult>("empty_exception", replyID,
                          RuntimeException{krutil::cmddistributor::inEXECUTION_SUCCESS, u"", "", "", {}, {}, false})));

    sets.push_back(
        set<IIPReply>("krutil:IIPReply", "krutil.protobuf.IIPReply",
                      sample<IIPReply>("typical", replyID, std::make_unique<IIPResult>(requestID, boost::none)),
                      sample<IIPReply>("default", noID, nullptr),
                      sample<IIPReply>("extreme", largestID, std::make_unique<IIPResult>(replyID, extremeException())),
                      sample<IIPReply>("call", replyID, std::make_unique<FEvalResult>(requestID, typicalArrays()))));

    sets.push_back(set<FEvalIIP>(
        "krutil:FEvalIIP", "krutil.protobuf.FEvalIIP",
        sample<FEvalIIP>("typical", call("numpy.linalg.svd", 3, typicalArrays(), IqmStreamID::ekIqmAllStreams,
                                         typicalOut, typicalErr, 11, 12)),
        sample<FEvalIIP>("default", call("", 0, {}, IqmStreamID::ekIqmCmdWinStream, SinkTraits(), SinkTraits(), 1, 2)),
        sample<FEvalIIP>("extreme", call(extremeBytes, largest64, extremeArrays(), IqmStreamID::ekIqmJavaStream,
                                         extremeOut, extremeErr, largest64, largest64 - 1))));

    sets.push_back(set<FEvalResult>("krutil:FEvalResult", "krutil.protobuf.FEvalResult",
                                    sample<FEvalResult>("typical", requestID, typicalArrays()),
                                    sample<FEvalResult>("default", noID, std::vector<Array>()),
                                    sample<FEvalResult>("extreme", largestID, extremeArrays())));

    sets.push_back(set<Array>("krutil:QDA", "foundation.korveldata.protobuf.KORVEL_Array",
                              sample<Array>("typical", counting<std::int32_t>(2)), sample<Array>("default"),
                              sample<Array>("extreme", counting<double>(400, MemoryOrder::ColumnMajor)),
                              sample<Array>("text", ArrayFactory().createText(extremeText))));

    sets.push_back(warningEvent<IssuedWarningEvent>("korvel:lang:diagnostic:IssuedWarningEvent",
                                                    "krutil.protobuf.IssuedWarningEvent"));
    sets.push_back(warningEvent<IssuedEnabledWarningEvent>("korvel:lang:diagnostic:IssuedEnabledWarningEvent",
                                                           "krutil.protobuf.IssuedEnabledWarningEvent"));

    const RuntimeException noException{krutil::cmddistributor::inEXECUTION_SUCCESS, u"", "", "", {}, {}, false};
    sets.push_back(set<PrintableErrorEvent>(
        "krutil:PrintableErrorEvent", "krutil.protobuf.PrintableErrorEvent",
        sample<PrintableErrorEvent>("typical", requestID, typicalException(), u"ZeroDivisionError: division by zero"),
        sample<PrintableErrorEvent>("default", noID, noException, u""),
        sample<PrintableErrorEvent>("extreme", largestID, extremeException(), extremeText)));

    sets.push_back(set<CapabilitiesChanged>(
        "krutil:capabilities_api:CapabilitiesChanged", "krutil.protobuf.CapabilitiesChanged",
        sample<CapabilitiesChanged>("typical", CapabilityList{InteractiveCommandLine}, CapabilityList{Debugging},
                                    CapabilityList{LocalClient, WebWindow}, CapabilityList{ModalDialogs}),
        sample<CapabilitiesChanged>("default", CapabilityList{}, CapabilityList{}, CapabilityList{}, CapabilityList{}),
        sample<CapabilitiesChanged>("extreme",
                                    CapabilityList{InteractiveCommandLine, Swing, ComplexSwing, LocalClient, WebWindow,
                                                   ModalDialogs, Debugging},
                                    CapabilityList{Swing, ComplexSwing}, CapabilityList{},
                                    CapabilityList{InteractiveCommandLine, Debugging})));
    return sets;
}

}  // namespace

const std::vector<SampleSet>& sampleSets() {
    static const std::vector<SampleSet> sets = makeSampleSets();
    return sets;
}

const SampleSet& sampleSet(const std::string& serializer) {
    for (const SampleSet& set : sampleSets()) {
        if (set.serializer == serializer) {
            return set;
        }
    }
    throw std::out_of_range("no samples of " + serializer + ": add a list of them to makeSampleSets()");
}

framing::FrameIndex write(const layers::serialization::SerializerBase& serializer, const Object& object,
                          framing::StreamID streamID, framing::FrameIndex frameIndex,
                          const std::shared_ptr<layers::message::MessageStream>& stream,
                          const std::shared_ptr<const layers::serialization::Registry>& registry,
                          const layers::serialization::SerializationContext& context) {
    return std::visit(
        [&](const auto& typed) {
            using FamilyOfObject = Family<std::remove_cvref_t<decltype(typed)>>;
            return dynamic_cast<const FamilyOfObject&>(serializer)
                .serialize(typed, streamID, frameIndex, stream, registry, context);
        },
        object);
}

namespace {

template <class... Ptrs>
Object readAny(const std::variant<Ptrs...>* /*types*/, const layers::serialization::SerializerBase& serializer,
               framing::FrameIndex frameIndex, const std::unique_ptr<layers::message::Message>& message,
               const std::shared_ptr<const layers::serialization::Registry>& registry,
               const layers::serialization::SerializationContext& context) {
    Object object;
    const auto readAs = [&]<class Ptr>(const Ptr* /*type*/) {
        const auto* family = dynamic_cast<const Family<Ptr>*>(&serializer);
        if (family == nullptr) {
            return false;
        }
        object = family->deserialize(frameIndex, message, registry, context);
        return true;
    };
    if (!(readAs(static_cast<const Ptrs*>(nullptr)) || ...)) {
        throw std::bad_cast();
    }
    return object;
}

}  // namespace

Object read(const layers::serialization::SerializerBase& serializer, framing::FrameIndex frameIndex,
            const std::unique_ptr<layers::message::Message>& message,
            const std::shared_ptr<const layers::serialization::Registry>& registry,
            const layers::serialization::SerializationContext& context) {
    return readAny(static_cast<const Object*>(nullptr), serializer, frameIndex, message, registry, context);
}

std::string quoted(const std::string& text) {
    std::string out = "\"";
    for (const char c : text) {
        const auto byte = static_cast<unsigned char>(c);
        if (byte < 0x20 || byte > 0x7E || c == '"' || c == '\\') {
            out += "\\x" + hex(byte, 2);
        } else {
            out += c;
        }
    }
    return out + "\"";
}

std::string quoted(const std::u16string& text) {
    std::string out = "u\"";
    for (const char16_t unit : text) {
        if (unit < 0x20 || unit > 0x7E || unit == u'"' || unit == u'\\') {
            out += "\\u{" + hex(unit, 4) + "}";
        } else {
            out += static_cast<char>(unit);
        }
    }
    return out + "\"";
}

}  // namespace samples
