#include "codec/CodecSamples.hpp"

#include <boost/make_shared.hpp>
#include <boost/variant.hpp>
#include <memory>
#include <stdexcept>
#include <utility>

#include "capabilities/CapabilityList.hpp"
#include "cmddistributor/EvalIIP.hpp"
#include "cmddistributor/IIPEnqueueMessage.hpp"
#include "cmddistributor/IIPResult.hpp"
#include "korvel/lang/diagnostic/IssuedWarningEvent.hpp"
#include "krutil.protobuf.EvalIIP.pb.h"
#include "krutil.protobuf.IIPEnqueueMessage.pb.h"
#include "krutil.protobuf.IIPReply.pb.h"
#include "krutil.protobuf.IIPResult.pb.h"
#include "krutil.protobuf.IssuedWarningEvent.pb.h"
#include "krutil.protobuf.TextBaseEvent.pb.h"
#include "krutil/cmddistributor/IIPReply.hpp"
#include "krutil/io/TextBaseEvent.hpp"
#include "msg_svc.protobuf.IDType.pb.h"
#include "msg_svc/protobuf/ustring.hpp"

namespace bench {
namespace {

using foundation::msg_svc::eventmgr::BaseEvent;
using foundation::msg_svc::exchange::IDType;
using foundation::msg_svc::exchange::Reply;
using msg_svc::protobuf::ustring_to_utf8;
using msg_svc::protobuf::utf8_to_ustring;
using ExchangeMessage = foundation::msg_svc::exchange::Message;
namespace wire = krutil::protobuf;

const IDType requestID(0x0123456789ABCDEF, 0xFEDCBA9876543210);

// ---- What the bare ways have in common ------------------------------------------------------------------------------

void fill(msg_svc::protobuf::IDType& proto, const IDType& id) {
    proto.set_hi(id.hi());
    proto.set_lo(id.lo());
}

IDType made(const msg_svc::protobuf::IDType& proto) {
    return {proto.hi(), proto.lo()};
}

template <class Proto>
void write(const Proto& proto, const TakeBytes& take) {
    const std::size_t size = proto.ByteSizeLong();
    const std::unique_ptr<char[]> bytes(new char[size]);
    proto.SerializeWithCachedSizesToArray(reinterpret_cast<std::uint8_t*>(bytes.get()));
    take(bytes.get(), size);
}

template <class Proto>
Proto parsed(const transport::Message& message, transport::FrameIndex index) {
    const transport::Frame& frame = *message.frame(index);
    Proto proto;
    proto.ParsePartialFromArray(frame.data(), static_cast<int>(frame.size()));
    return proto;
}

// ---- A line of text -------------------------------------------------------------------------------------------------

using krutil::io::TextBaseEvent;

boost::shared_ptr<const TextBaseEvent> lineOfText() {
    std::u16string text;
    while (text.size() < 80) {
        text += u"0123456789";
    }
    text.back() = u'\n';
    return boost::make_shared<const TextBaseEvent>(requestID, krutil::io::StreamTypeEnum::ERROR_STREAM,
                                                   std::move(text));
}

void writeBare(const TextBaseEvent& event, const TakeBytes& take) {
    wire::TextBaseEvent proto;
    fill(*proto.mutable_id(), event.getRequestId());
    proto.set_stream(static_cast<wire::StreamType>(event.getStreamType()));
    proto.set_text(ustring_to_utf8(event.getText()));
    write(proto, take);
}

boost::shared_ptr<const BaseEvent> readTextBare(const transport::Message& message) {
    const auto proto = parsed<wire::TextBaseEvent>(message, 1);
    return boost::make_shared<const TextBaseEvent>(
        made(proto.id()), static_cast<krutil::io::StreamTypeEnum>(proto.stream()), utf8_to_ustring(proto.text()));
}

// ---- A command ------------------------------------------------------------------------------------------------------

using cmddistributor::EvalIIP;
using cmddistributor::IIPEnqueueMessage;
using krutil::io::SinkTraits;

boost::shared_ptr<const IIPEnqueueMessage> command() {
    std::u16string code;
    while (code.size() < 2048) {
        code += u"total = total + 1\n";
    }
    code.resize(2048, u'#');
    const SinkTraits out(false, true, true, false, true, false);
    const SinkTraits err(false, false, true, true, false, true);
    using namespace cmddistributor;
    const auto request = boost::make_shared<const EvalIIP>("python", IqmStreamID::ekIqmAllStreams, nullptr, out, err,
                                                           code, CodeType::ScriptType);
    const capabilities::CapabilityList needed{capabilities::Capability::InteractiveCommandLine,
                                              capabilities::Capability::ModalDialogs};
    return boost::make_shared<const IIPEnqueueMessage>(request, requestID, 4242, krutil::contextmgr::QvmID(77), nullptr,
                                                       krutil::cmddistributor::WhenToDequeue::DEQUEUE_AT_PROMPT,
                                                       u"krutil eval", needed, nullptr, true);
}

// The wire counts capabilities from here, the host from 0.
constexpr int firstCapability = wire::InteractiveCommandLine;

void fill(wire::SinkTraits& proto, const SinkTraits& traits) {
    proto.set_supportshotlinks(traits.getSupportsHotlinks());
    proto.set_needsformattingfordisplay(traits.getNeedsFormattingForDisplay());
    proto.set_usediary(traits.getUseDiary());
    proto.set_useecho(traits.getUseEcho());
    proto.set_uselogging(traits.getUseLogging());
}

SinkTraits made(const wire::SinkTraits& proto) {
    return {false,           proto.supportshotlinks(), proto.needsformattingfordisplay(), proto.usediary(),
            proto.useecho(), proto.uselogging()};
}

void writeBare(const IIPEnqueueMessage& message, const TakeBytes& take) {
    const auto& request = static_cast<const EvalIIP&>(*message.getIIP());
    wire::EvalIIP proto;
    proto.mutable_iip()->set_streamid(static_cast<wire::IqmStreamID>(request.getStreamID()));
    proto.mutable_iip()->set_plugintype(request.getPluginType());
    fill(*proto.mutable_iip()->mutable_outtraits(), request.getOutTraits());
    fill(*proto.mutable_iip()->mutable_errtraits(), request.getErrTraits());
    proto.set_cmd(ustring_to_utf8(request.getCommand()));
    proto.set_codetype(static_cast<wire::CodeType>(request.getCodeType()));
    write(proto, take);

    wire::IIPEnqueueMessage enqueue;
    enqueue.set_iiphandle(1);
    fill(*enqueue.mutable_iipid(), message.getID());
    enqueue.set_qcrid(message.getQcrID());
    enqueue.set_qvmid(*message.getQvmID());
    enqueue.set_dequeuemode(static_cast<wire::WhenToDequeue>(message.getDequeueMode()));
    enqueue.set_name(ustring_to_utf8(message.getDynamicName()));
    for (const auto capability : message.getCapabilities().getEnabledCapabilitySequence()) {
        enqueue.add_capability(static_cast<wire::Capability>(static_cast<int>(capability) + firstCapability));
    }
    enqueue.set_oktoflushsparingly(message.getOkToFlushSparingly());
    write(enqueue, take);
}

boost::shared_ptr<const ExchangeMessage> readCommandBare(const transport::Message& message) {
    const auto proto = parsed<wire::EvalIIP>(message, 1);
    const wire::IIP& core = proto.iip();
    const auto request = boost::make_shared<const EvalIIP>(
        core.plugintype(), static_cast<cmddistributor::IqmStreamID>(core.streamid()), nullptr, made(core.outtraits()),
        made(core.errtraits()), utf8_to_ustring(proto.cmd()), static_cast<cmddistributor::CodeType>(proto.codetype()));

    const auto enqueue = parsed<wire::IIPEnqueueMessage>(message, 2);
    capabilities::CapabilityList list;
    for (const int capability : enqueue.capability()) {
        list |= static_cast<capabilities::Capability>(capability - firstCapability);
    }
    return boost::make_shared<const IIPEnqueueMessage>(
        request, made(enqueue.iipid()), enqueue.qcrid(), krutil::contextmgr::QvmID(enqueue.qvmid()), nullptr,
        static_cast<krutil::cmddistributor::WhenToDequeue::WhenToDequeue>(enqueue.dequeuemode()),
        utf8_to_ustring(enqueue.name()), list, nullptr, enqueue.oktoflushsparingly());
}

// ---- An error -------------------------------------------------------------------------------------------------------

using cmddistributor::IIPResult;
using cmddistributor::RuntimeException;
using cmddistributor::StackFrame;
using krutil::cmddistributor::IIPReply;

std::u16string fileName(int number) {
    std::u16string name = u"projects/reports/analysis/daily/run_0.py";
    name[name.size() - 4] = static_cast<char16_t>(u'0' + number % 10);
    return name;
}

RuntimeException exceptionWithCauses(int levels) {
    std::vector<StackFrame> frames;
    for (int i = 0; i < 10; ++i) {
        frames.push_back({fileName(i), "evaluate_expression", 10.0 * i + levels});
    }
    std::vector<RuntimeException> causes;
    if (levels > 1) {
        causes.push_back(exceptionWithCauses(levels - 1));
    }
    return {krutil::cmddistributor::inRUNTIME_ERROR,
            u"could not convert string to float: 'abc'",
            "python:ValueError",
            "evaluate_expression",
            std::move(frames),
            std::move(causes),
            false};
}

boost::shared_ptr<const IIPReply> failedReply() {
    return boost::make_shared<const IIPReply>(requestID,
                                              std::make_unique<IIPResult>(requestID, exceptionWithCauses(4)));
}

void fill(wire::RuntimeException& proto, const RuntimeException& exception) {
    proto.set_status(static_cast<wire::ExecutionStatus>(exception.getExecutionStatus()));
    proto.set_msgid(exception.GetID());
    proto.set_msgtext(ustring_to_utf8(exception.GetUnicodeMessageTxt()));
    proto.set_functionname(exception.getFunctionName());
    for (const auto& frame : exception.getStackFrames()) {
        wire::StackFrame& added = *proto.add_frames();
        added.set_file(ustring_to_utf8(frame.file));
        added.set_func(frame.func);
        added.set_line(frame.line);
    }
    for (const auto& cause : exception.getCauses()) {
        fill(*proto.add_causes(), cause);
    }
}

RuntimeException made(const wire::RuntimeException& proto) {
    std::vector<StackFrame> frames;
    frames.reserve(static_cast<std::size_t>(proto.frames_size()));
    for (const auto& frame : proto.frames()) {
        frames.push_back({utf8_to_ustring(frame.file()), frame.func(), frame.line()});
    }
    std::vector<RuntimeException> causes;
    causes.reserve(static_cast<std::size_t>(proto.causes_size()));
    for (const auto& cause : proto.causes()) {
        causes.push_back(made(cause));
    }
    return {static_cast<krutil::cmddistributor::inExecutionStatus>(proto.status()),
            utf8_to_ustring(proto.msgtext()),
            proto.msgid(),
            proto.functionname(),
            std::move(frames),
            std::move(causes),
            false};
}

void writeBare(const IIPReply& reply, const TakeBytes& take) {
    wire::IIPResult result;
    fill(*result.mutable_id(), reply.getResult()->id);
    fill(*result.mutable_exception(), *reply.getResult()->getException());
    write(result, take);

    wire::IIPReply proto;
    fill(*proto.mutable_id(), reply.getID());
    proto.set_resultid(1);
    write(proto, take);
}

boost::shared_ptr<const Reply> readReplyBare(const transport::Message& message) {
    const auto result = parsed<wire::IIPResult>(message, 1);
    const auto proto = parsed<wire::IIPReply>(message, 2);
    return boost::make_shared<const IIPReply>(made(proto.id()),
                                              std::make_unique<IIPResult>(made(result.id()), made(result.exception())));
}

// ---- A warning ------------------------------------------------------------------------------------------------------

using korvel::lang::PrintfArgument;
using korvel::lang::diagnostic::IssuedWarningEvent;
using korvel::lang::diagnostic::Warning;

boost::shared_ptr<const IssuedWarningEvent> issuedWarning() {
    std::vector<PrintfArgument> arguments;
    arguments.emplace_back(42);
    arguments.emplace_back(99UL);
    arguments.emplace_back(0.5);
    arguments.emplace_back(std::u16string(u"DeprecationWarning"));
    const std::u16string function = u"evaluate_expression";
    std::vector<korvel::lang::StackFrame> stack;
    for (unsigned int i = 0; i < 5; ++i) {
        stack.push_back({fileName(static_cast<int>(i)), function, 10 * i});
    }
    return boost::make_shared<const IssuedWarningEvent>(
        requestID, Warning("python:DeprecationWarning", u"line %d of %lu: %g (%s)", std::move(arguments),
                           u"line 42 of 99: 0.5 (DeprecationWarning)", std::move(stack), false, 739942.25));
}

struct FillArgument : boost::static_visitor<> {
    explicit FillArgument(wire::PrintfArgument& message) : proto(message) {}
    void operator()(int value) const { proto.set_i32(value); }
    void operator()(unsigned int value) const { proto.set_u32(value); }
    void operator()(long value) const { proto.set_i64(value); }
    void operator()(unsigned long value) const { proto.set_u64(value); }
    void operator()(double value) const { proto.set_dbl(value); }
    void operator()(const std::u16string& value) const { proto.set_str(ustring_to_utf8(value)); }
    wire::PrintfArgument& proto;
};

PrintfArgument made(const wire::PrintfArgument& proto) {
    switch (proto.Value_case()) {
        case wire::PrintfArgument::kI32:
            return PrintfArgument(static_cast<int>(proto.i32()));
        case wire::PrintfArgument::kU32:
            return PrintfArgument(static_cast<unsigned int>(proto.u32()));
        case wire::PrintfArgument::kI64:
            return PrintfArgument(static_cast<long>(proto.i64()));
        case wire::PrintfArgument::kU64:
            return PrintfArgument(static_cast<unsigned long>(proto.u64()));
        case wire::PrintfArgument::kDbl:
            return PrintfArgument(proto.dbl());
        case wire::PrintfArgument::kStr:
            return PrintfArgument(utf8_to_ustring(proto.str()));
        case wire::PrintfArgument::VALUE_NOT_SET:
            break;
    }
    return {};
}

void writeBare(const IssuedWarningEvent& event, const TakeBytes& take) {
    wire::IssuedWarningEvent proto;
    fill(*proto.mutable_id(), event.getRequestId());
    const Warning& warning = event.getWarning();
    wire::Warning& filled = *proto.mutable_warning();
    filled.set_identifier(warning.getIdentifier());
    filled.set_format(ustring_to_utf8(warning.getFormat()));
    for (const auto& argument : warning.getArguments()) {
        boost::apply_visitor(FillArgument(*filled.add_arguments()), argument.getValue());
    }
    filled.set_message(ustring_to_utf8(warning.getMessage()));
    for (const auto& frame : warning.getStack()) {
        wire::WarningStackFrame& added = *filled.add_stack();
        added.set_file(ustring_to_utf8(frame.file));
        added.set_name(ustring_to_utf8(frame.name));
        added.set_line(frame.line);
    }
    filled.set_wasdisabled(warning.getWasDisabled());
    filled.set_datenum(warning.getTime());
    write(proto, take);
}

boost::shared_ptr<const BaseEvent> readWarningBare(const transport::Message& message) {
    const auto proto = parsed<wire::IssuedWarningEvent>(message, 1);
    const wire::Warning& warning = proto.warning();
    std::vector<PrintfArgument> arguments;
    arguments.reserve(static_cast<std::size_t>(warning.arguments_size()));
    for (const auto& argument : warning.arguments()) {
        arguments.push_back(made(argument));
    }
    std::vector<korvel::lang::StackFrame> stack;
    stack.reserve(static_cast<std::size_t>(warning.stack_size()));
    for (const auto& frame : warning.stack()) {
        stack.emplace_back(utf8_to_ustring(frame.file()), utf8_to_ustring(frame.name()), frame.line());
    }
    return boost::make_shared<const IssuedWarningEvent>(
        made(proto.id()),
        Warning(warning.identifier(), utf8_to_ustring(warning.format()), std::move(arguments),
                utf8_to_ustring(warning.message()), std::move(stack), warning.wasdisabled(), warning.datenum()));
}

// ---- The product's ways ---------------------------------------------------------------------------------------------

const std::shared_ptr<const transport::Registry>& registry() {
    static const std::shared_ptr<const transport::Registry> filled = transport::sessionRegistry();
    return filled;
}

template <class Base>
using RootSerializer = transport::SerializerAPI<Base, boost::shared_ptr<const Base>, boost::shared_ptr<const Base>>;

template <class Base>
void serialize(const boost::shared_ptr<const Base>& object, const std::shared_ptr<transport::MessageStream>& stream) {
    const Base& referenced = *object;
    const auto* const serializer = asFamily<RootSerializer<Base>>(*registry()->find(typeid(referenced)));
    serializer->serialize(object, 7, 1, stream, registry(), transport::SerializationContext());
}

template <class Base>
boost::shared_ptr<const Base> deserialize(const std::unique_ptr<transport::Message>& message) {
    const transport::FrameIndex root = message->size() - 1;
    const auto& frame = dynamic_cast<const transport::TaggedFrame&>(*message->frame(root));
    const auto* const serializer = asFamily<RootSerializer<Base>>(*registry()->find(frame.tag()));
    return serializer->deserialize(root, message, registry(), transport::SerializationContext());
}

void check(const CodecSample& sample, const samples::Object& object) {
    const auto require = [&sample](bool condition, const std::string& what) {
        if (!condition) {
            throw std::logic_error("codec sample \"" + sample.name + "\": expected the bare way to " + what);
        }
    };
    std::vector<std::string> bytes;
    sample.serializeBare([&](const char* begin, std::size_t size) { bytes.emplace_back(begin, size); });
    require(bytes.size() == sample.frames.size(), "write as many messages as the product has frames");
    for (std::size_t i = 0; i < bytes.size(); ++i) {
        require(bytes[i] == sample.frames[i].bytes, "write the bytes of frame " + std::to_string(i + 1));
    }
    const auto& set = samples::sampleSet(sample.frames.back().tag);
    const std::string expected = set.describe(object, samples::View::AfterTrip);
    require(
        set.describe(sample.deserializeBare(*transport::makeMessage(sample.frames)), samples::View::AsIs) == expected,
        "read the object that was written");
    require(set.describe(sample.deserialize(transport::makeMessage(sample.frames)), samples::View::AsIs) == expected,
            "read what the product reads");
}

template <class Base, class Object>
CodecSample makeSample(const char* name, const boost::shared_ptr<const Object>& concrete,
                       boost::shared_ptr<const Base> (*readBare)(const transport::Message&)) {
    const boost::shared_ptr<const Base> object = concrete;
    const auto stream = std::make_shared<transport::RecordingStream>();
    serialize<Base>(object, stream);
    CodecSample sample{
        name,
        [object](const std::shared_ptr<transport::MessageStream>& target) { serialize<Base>(object, target); },
        [concrete](const TakeBytes& take) { writeBare(*concrete, take); },
        [](const std::unique_ptr<transport::Message>& message) { return deserialize<Base>(message); },
        readBare,
        transport::contentOf(stream->frames),
    };
    check(sample, object);
    return sample;
}

}  // namespace

const std::vector<CodecSample>& codecSamples() {
    static const std::vector<CodecSample> all = [] {
        std::vector<CodecSample> made;
        made.push_back(makeSample<BaseEvent>("text event, 80 characters", lineOfText(), readTextBare));
        made.push_back(makeSample<ExchangeMessage>("command, 2 KiB", command(), readCommandBare));
        made.push_back(makeSample<Reply>("exception, 40 frames in 4 levels", failedReply(), readReplyBare));
        made.push_back(makeSample<BaseEvent>("warning, 4 arguments and 5 frames", issuedWarning(), readWarningBare));
        return made;
    }();
    return all;
}

}  // namespace bench
