#include "krutil/session/Tracer.hpp"

#include <google/protobuf/descriptor.h>
#include <google/protobuf/io/zero_copy_stream_impl_lite.h>
#include <google/protobuf/message.h>
#include <google/protobuf/text_format.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <iostream>
#include <memory>
#include <stdexcept>

#include "common/MessageNames.hpp"
#include "common/OwnFile.hpp"
#include "foundation/core/posix/writeFully.hpp"
#include "foundation/vantor/carrier/framing/TaggedFrame.hpp"
#include "krutil/base/ExitCode.hpp"

namespace krutil_client {
namespace {

namespace posix = foundation::core::posix;

namespace framing = foundation::vantor::carrier::framing;

constexpr std::size_t shownCharacters = 2'000;
constexpr std::size_t shownBytes = 32;
// Decoding a message takes several times its size in memory, for a line that shows its beginning.
constexpr unsigned long largestDecoded = 1UL << 20;

std::string hexPrefix(const framing::Frame& frame) {
    constexpr const char* digits = "0123456789abcdef";
    std::string text;
    const auto length = std::min<std::size_t>(frame.size(), shownBytes);
    for (std::size_t i = 0; i < length; ++i) {
        const auto byte = static_cast<unsigned char>(frame.data()[i]);
        text += digits[byte >> 4U];
        text += digits[byte & 0xFU];
    }
    return frame.size() > length ? text + "..." : text;
}

std::string printableTag(std::string_view tag) {
    std::string text(tag);
    std::replace_if(
        text.begin(), text.end(), [](char c) { return c <= ' ' || c > '~'; }, '?');
    return text;
}

std::string decoded(const framing::TaggedFrame& frame) {
    const auto* descriptor =
        google::protobuf::DescriptorPool::generated_pool()->FindMessageTypeByName(apps::messageNameOfTag(frame.tag()));
    if (descriptor == nullptr || frame.size() > largestDecoded) {
        return hexPrefix(frame);
    }
    const std::unique_ptr<google::protobuf::Message> message(
        google::protobuf::MessageFactory::generated_factory()->GetPrototype(descriptor)->New());
    const bool whole = message->ParsePartialFromArray(frame.data(), static_cast<int>(frame.size()));
    std::string text(shownCharacters + 1, '\0');
    google::protobuf::io::ArrayOutputStream out(text.data(), static_cast<int>(text.size()));
    google::protobuf::TextFormat::Printer printer;
    printer.SetSingleLineMode(true);
    printer.Print(*message, &out);
    text.resize(static_cast<std::size_t>(out.ByteCount()));
    if (text.size() > shownCharacters) {
        text.resize(shownCharacters);
        text += "...";
    } else if (!text.empty() && text.back() == ' ') {
        text.pop_back();
    }
    return whole ? text : text + " (malformed)";
}

}  // namespace

std::string traceLine(const foundation::msg_svc::transport::layers::session::FrameTrace& trace) {
    std::string text = trace.outgoing ? "--> " : "<-- ";
    text += "stream " + std::to_string(trace.frame.streamID()) + " frame " + std::to_string(trace.frame.index());
    if (trace.last) {
        text += " last";
    }
    text += " type " + std::to_string(static_cast<unsigned>(trace.frame.type()));
    const auto* tagged = dynamic_cast<const framing::TaggedFrame*>(&trace.frame);
    text += " " + (tagged != nullptr ? printableTag(tagged->tag()) : std::string("data"));
    text += " " + std::to_string(trace.frame.size()) + " bytes";
    const std::string content = tagged != nullptr ? decoded(*tagged) : hexPrefix(trace.frame);
    return content.empty() ? text : text + ": " + content;
}

Tracer::Tracer(bool toStandardError, const std::optional<std::string>& file)
    : toStandardError_(toStandardError), fileName_(file.value_or(std::string())) {
    if (!file) {
        return;
    }
    try {
        file_ = apps::openOwnFile(fileName_, apps::Begin::Empty, "cannot open '" + fileName_ + "' for the trace")
                    .descriptor;
    } catch (const std::runtime_error& error) {
        throw Failure(ExitCode::Usage, error.what());
    }
}

void Tracer::operator()(const foundation::msg_svc::transport::layers::session::FrameTrace& trace) {
    const std::string line = traceLine(trace) + '\n';
    const std::lock_guard lock(mutex_);
    if (toStandardError_) {
        // A trace that nobody can read holds up nothing.
        static_cast<void>(posix::writeFully(STDERR_FILENO, line));
    }
    if (file_.get() >= 0 && !posix::writeFully(file_.get(), line)) {
        const std::string reason = std::strerror(errno);
        file_.reset();
        complete_ = false;
        std::cerr << "krutil: cannot write to '" + fileName_ + "': " + reason + "; the trace ends here\n" << std::flush;
    }
}

bool Tracer::isComplete() {
    const std::lock_guard lock(mutex_);
    return complete_;
}

}  // namespace krutil_client
