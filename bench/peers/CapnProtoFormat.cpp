// Cap'n Proto: a message builder, one flat array of words, and a reader over it.

#include <capnp/message.h>
#include <capnp/serialize.h>

#include <boost/make_shared.hpp>
#include <string>
#include <utility>
#include <vector>

#include "Messages.capnp.h"
#include "msg_svc/protobuf/ustring.hpp"
#include "peers/SmallMessages.hpp"

namespace bench {
namespace {

using msg_svc::protobuf::ustring_to_utf8;
using msg_svc::protobuf::utf8_to_ustring;

std::u16string textOf(capnp::Text::Reader text) {
    return utf8_to_ustring(std::string(text.begin(), text.size()));
}

void take(capnp::MessageBuilder& message, const TakeBytes& takeBytes) {
    const kj::Array<capnp::word> words = capnp::messageToFlatArray(message);
    const auto bytes = words.asChars();
    takeBytes(bytes.begin(), bytes.size());
}

// The bytes are where an allocation begins, so they are aligned as words must be.
capnp::FlatArrayMessageReader readerOf(const char* bytes, std::size_t size) {
    return capnp::FlatArrayMessageReader(
        kj::arrayPtr(reinterpret_cast<const capnp::word*>(bytes), size / sizeof(capnp::word)));
}

void fill(CapnProtoMessages::Error::Builder builder, const Error& error) {
    builder.setStatus(error.getExecutionStatus());
    builder.setIdentifier(error.GetID());
    builder.setText(ustring_to_utf8(error.GetUnicodeMessageTxt()));
    builder.setFunction(error.getFunctionName());
    auto frames = builder.initFrames(static_cast<unsigned int>(error.getStackFrames().size()));
    unsigned int index = 0;
    for (const auto& frame : error.getStackFrames()) {
        auto filled = frames[index++];
        filled.setFile(ustring_to_utf8(frame.file));
        filled.setFunction(frame.func);
        filled.setLine(frame.line);
    }
    auto causes = builder.initCauses(static_cast<unsigned int>(error.getCauses().size()));
    index = 0;
    for (const Error& cause : error.getCauses()) {
        fill(causes[index++], cause);
    }
}

Error errorOf(CapnProtoMessages::Error::Reader reader) {
    std::vector<cmddistributor::StackFrame> frames;
    frames.reserve(reader.getFrames().size());
    for (const auto frame : reader.getFrames()) {
        frames.push_back({textOf(frame.getFile()), frame.getFunction().cStr(), frame.getLine()});
    }
    std::vector<Error> causes;
    causes.reserve(reader.getCauses().size());
    for (const auto cause : reader.getCauses()) {
        causes.push_back(errorOf(cause));
    }
    return {static_cast<krutil::cmddistributor::inExecutionStatus>(reader.getStatus()),
            textOf(reader.getText()),
            reader.getIdentifier().cStr(),
            reader.getFunction().cStr(),
            std::move(frames),
            std::move(causes),
            false};
}

void writeLine(const Line& line, const TakeBytes& takeBytes) {
    capnp::MallocMessageBuilder message;
    auto builder = message.initRoot<CapnProtoMessages::Line>();
    builder.initId().setHi(line.getRequestId().hi());
    builder.getId().setLo(line.getRequestId().lo());
    builder.setStream(static_cast<int>(line.getStreamType()));
    builder.setText(ustring_to_utf8(line.getText()));
    take(message, takeBytes);
}

boost::shared_ptr<const Line> readLine(const char* bytes, std::size_t size) {
    auto message = readerOf(bytes, size);
    const auto reader = message.getRoot<CapnProtoMessages::Line>();
    return boost::make_shared<const Line>(
        foundation::msg_svc::exchange::IDType(reader.getId().getHi(), reader.getId().getLo()),
        static_cast<krutil::io::StreamTypeEnum>(reader.getStream()), textOf(reader.getText()));
}

void writeError(const Error& error, const TakeBytes& takeBytes) {
    capnp::MallocMessageBuilder message;
    fill(message.initRoot<CapnProtoMessages::Error>(), error);
    take(message, takeBytes);
}

Error readError(const char* bytes, std::size_t size) {
    auto message = readerOf(bytes, size);
    return errorOf(message.getRoot<CapnProtoMessages::Error>());
}

}  // namespace

SmallFormat capnProtoFormat() {
    return {"Cap'n Proto", writeLine, readLine, writeError, readError};
}

}  // namespace bench
