// MessagePack and JSON: plain records, and the code that their libraries make of a list of members.

#include <boost/make_shared.hpp>
#include <cstdint>
#include <msgpack.hpp>
#include <nlohmann/json.hpp>
#include <string>
#include <utility>
#include <vector>

#include "msg_svc/protobuf/ustring.hpp"
#include "peers/SmallMessages.hpp"

namespace bench {
namespace {

using msg_svc::protobuf::ustring_to_utf8;
using msg_svc::protobuf::utf8_to_ustring;

struct LineRecord {
    std::uint64_t hi = 0;
    std::uint64_t lo = 0;
    int stream = 0;
    std::string text;
    MSGPACK_DEFINE(hi, lo, stream, text)
};
NLOHMANN_DEFINE_TYPE_NON_INTRUSIVE(LineRecord, hi, lo, stream, text)

struct FrameRecord {
    std::string file;
    std::string function;
    double line = 0;
    MSGPACK_DEFINE(file, function, line)
};
NLOHMANN_DEFINE_TYPE_NON_INTRUSIVE(FrameRecord, file, function, line)

struct ErrorRecord {
    int status = 0;
    std::string identifier;
    std::string text;
    std::string function;
    std::vector<FrameRecord> frames;
    std::vector<ErrorRecord> causes;
    MSGPACK_DEFINE(status, identifier, text, function, frames, causes)
};
NLOHMANN_DEFINE_TYPE_NON_INTRUSIVE(ErrorRecord, status, identifier, text, function, frames, causes)

LineRecord recordOf(const Line& line) {
    return {line.getRequestId().hi(), line.getRequestId().lo(), static_cast<int>(line.getStreamType()),
            ustring_to_utf8(line.getText())};
}

boost::shared_ptr<const Line> lineOf(const LineRecord& record) {
    return boost::make_shared<const Line>(foundation::msg_svc::exchange::IDType(record.hi, record.lo),
                                          static_cast<krutil::io::StreamTypeEnum>(record.stream),
                                          utf8_to_ustring(record.text));
}

ErrorRecord recordOf(const Error& error) {
    ErrorRecord record{static_cast<int>(error.getExecutionStatus()),
                       error.GetID(),
                       ustring_to_utf8(error.GetUnicodeMessageTxt()),
                       error.getFunctionName(),
                       {},
                       {}};
    record.frames.reserve(error.getStackFrames().size());
    for (const auto& frame : error.getStackFrames()) {
        record.frames.push_back({ustring_to_utf8(frame.file), frame.func, frame.line});
    }
    for (const Error& cause : error.getCauses()) {
        record.causes.push_back(recordOf(cause));
    }
    return record;
}

Error errorOf(ErrorRecord&& record) {
    std::vector<cmddistributor::StackFrame> frames;
    frames.reserve(record.frames.size());
    for (FrameRecord& frame : record.frames) {
        frames.push_back({utf8_to_ustring(frame.file), std::move(frame.function), frame.line});
    }
    std::vector<Error> causes;
    causes.reserve(record.causes.size());
    for (ErrorRecord& cause : record.causes) {
        causes.push_back(errorOf(std::move(cause)));
    }
    return {static_cast<krutil::cmddistributor::inExecutionStatus>(record.status),
            utf8_to_ustring(record.text),
            std::move(record.identifier),
            std::move(record.function),
            std::move(frames),
            std::move(causes),
            false};
}

template <class Record>
void pack(const Record& record, const TakeBytes& take) {
    msgpack::sbuffer buffer;
    msgpack::pack(buffer, record);
    take(buffer.data(), buffer.size());
}

template <class Record>
Record unpacked(const char* bytes, std::size_t size) {
    return msgpack::unpack(bytes, size).get().as<Record>();
}

template <class Record>
void dump(const Record& record, const TakeBytes& take) {
    const std::string text = nlohmann::json(record).dump();
    take(text.data(), text.size());
}

template <class Record>
Record parsed(const char* bytes, std::size_t size) {
    return nlohmann::json::parse(bytes, bytes + size).get<Record>();
}

}  // namespace

SmallFormat messagePackFormat() {
    return {"MessagePack", [](const Line& line, const TakeBytes& take) { pack(recordOf(line), take); },
            [](const char* bytes, std::size_t size) { return lineOf(unpacked<LineRecord>(bytes, size)); },
            [](const Error& error, const TakeBytes& take) { pack(recordOf(error), take); },
            [](const char* bytes, std::size_t size) { return errorOf(unpacked<ErrorRecord>(bytes, size)); }};
}

SmallFormat jsonFormat() {
    return {"JSON", [](const Line& line, const TakeBytes& take) { dump(recordOf(line), take); },
            [](const char* bytes, std::size_t size) { return lineOf(parsed<LineRecord>(bytes, size)); },
            [](const Error& error, const TakeBytes& take) { dump(recordOf(error), take); },
            [](const char* bytes, std::size_t size) { return errorOf(parsed<ErrorRecord>(bytes, size)); }};
}

}  // namespace bench
