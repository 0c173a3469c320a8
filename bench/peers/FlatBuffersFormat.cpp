// FlatBuffers: a builder, and a verified view of the bytes.

#include <boost/make_shared.hpp>
#include <cstdint>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "Messages_generated.h"
#include "msg_svc/protobuf/ustring.hpp"
#include "peers/SmallMessages.hpp"

namespace bench {
namespace {

using msg_svc::protobuf::ustring_to_utf8;
using msg_svc::protobuf::utf8_to_ustring;

template <class Root>
const Root& verified(const char* bytes, std::size_t size) {
    const auto* const begin = reinterpret_cast<const std::uint8_t*>(bytes);
    flatbuffers::Verifier verifier(begin, size);
    if (!verifier.VerifyBuffer<Root>()) {
        throw std::runtime_error("FlatBuffers: expected a buffer that can be verified");
    }
    return *flatbuffers::GetRoot<Root>(begin);
}

void take(const flatbuffers::FlatBufferBuilder& builder, const TakeBytes& takeBytes) {
    takeBytes(reinterpret_cast<const char*>(builder.GetBufferPointer()), builder.GetSize());
}

flatbuffers::Offset<flat::Error> built(flatbuffers::FlatBufferBuilder& builder, const Error& error) {
    std::vector<flatbuffers::Offset<flat::Frame>> frames;
    frames.reserve(error.getStackFrames().size());
    for (const auto& frame : error.getStackFrames()) {
        const auto file = builder.CreateString(ustring_to_utf8(frame.file));
        frames.push_back(flat::CreateFrame(builder, file, builder.CreateString(frame.func), frame.line));
    }
    std::vector<flatbuffers::Offset<flat::Error>> causes;
    causes.reserve(error.getCauses().size());
    for (const Error& cause : error.getCauses()) {
        causes.push_back(built(builder, cause));
    }
    const auto identifier = builder.CreateString(error.GetID());
    const auto text = builder.CreateString(ustring_to_utf8(error.GetUnicodeMessageTxt()));
    const auto function = builder.CreateString(error.getFunctionName());
    const auto frameVector = builder.CreateVector(frames);
    const auto causeVector = builder.CreateVector(causes);
    return flat::CreateError(builder, error.getExecutionStatus(), identifier, text, function, frameVector, causeVector);
}

Error errorOf(const flat::Error& view) {
    std::vector<cmddistributor::StackFrame> frames;
    frames.reserve(view.frames()->size());
    for (const auto* frame : *view.frames()) {
        frames.push_back({utf8_to_ustring(frame->file()->str()), frame->function()->str(), frame->line()});
    }
    std::vector<Error> causes;
    causes.reserve(view.causes()->size());
    for (const auto* cause : *view.causes()) {
        causes.push_back(errorOf(*cause));
    }
    return {static_cast<krutil::cmddistributor::inExecutionStatus>(view.status()),
            utf8_to_ustring(view.text()->str()),
            view.identifier()->str(),
            view.function()->str(),
            std::move(frames),
            std::move(causes),
            false};
}

void writeLine(const Line& line, const TakeBytes& takeBytes) {
    flatbuffers::FlatBufferBuilder builder;
    const flat::Id id(line.getRequestId().hi(), line.getRequestId().lo());
    builder.Finish(flat::CreateLine(builder, &id, static_cast<int>(line.getStreamType()),
                                    builder.CreateString(ustring_to_utf8(line.getText()))));
    take(builder, takeBytes);
}

boost::shared_ptr<const Line> readLine(const char* bytes, std::size_t size) {
    const auto& view = verified<flat::Line>(bytes, size);
    return boost::make_shared<const Line>(foundation::msg_svc::exchange::IDType(view.id()->hi(), view.id()->lo()),
                                          static_cast<krutil::io::StreamTypeEnum>(view.stream()),
                                          utf8_to_ustring(view.text()->str()));
}

void writeError(const Error& error, const TakeBytes& takeBytes) {
    flatbuffers::FlatBufferBuilder builder;
    builder.Finish(built(builder, error));
    take(builder, takeBytes);
}

Error readError(const char* bytes, std::size_t size) {
    return errorOf(verified<flat::Error>(bytes, size));
}

}  // namespace

SmallFormat flatBuffersFormat() {
    return {"FlatBuffers", writeLine, readLine, writeError, readError};
}

}  // namespace bench
