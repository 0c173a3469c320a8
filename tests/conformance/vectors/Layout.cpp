#include "conformance/vectors/Layout.hpp"

#include <utility>

#include "common/Precheck.hpp"
#include "foundation/msg_svc/transport/layers/session/FrameHeader.hpp"
#include "foundation/msg_svc/transport/layers/session/FrameNotes.hpp"
#include "foundation/msg_svc/transport/layers/session/MessageReader.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionError.hpp"

namespace conformance {
namespace {

namespace session = foundation::msg_svc::transport::layers::session;

constexpr const char* arrayTag = "krutil:QDA";

}  // namespace

std::string bytesOf(const std::vector<transport::FrameContent>& frames) {
    static_assert(headerSize == session::FrameHeader::size);
    std::string bytes;
    for (const transport::FrameContent& frame : frames) {
        session::FrameHeader header;
        header.kind = static_cast<std::uint8_t>(frame.tagged ? session::FrameKind::Tagged : session::FrameKind::Data);
        header.last = &frame == &frames.back();
        header.type = frame.type;
        header.tagSize = static_cast<std::uint16_t>(frame.tag.size());
        header.stream = frame.streamID;
        header.index = frame.index;
        header.contentSize = frame.bytes.size();
        const auto encoded = encode(header);
        bytes.append(encoded.data(), encoded.size()).append(frame.tag).append(frame.bytes);
    }
    return bytes;
}

struct StreamOfMessages::Parts {
    std::shared_ptr<transport::Registry> registry = transport::sessionRegistry();
    session::MessageReader reader{session::Limits(), arrayTag};
    session::FrameNotes notes;

    Reading read(transport::Frames frames) {
        Reading reading;
        reading.stream = frames.back()->streamID();
        reading.type = transport::contentOf(*frames.back()).tag;
        notes.take(frames);
        const auto index = frames.size();
        try {
            for (const auto& frame : frames) {
                if (const auto* const tagged = dynamic_cast<const transport::TaggedFrame*>(frame.get())) {
                    apps::precheck(true)->check(*tagged);
                }
            }
            // Indexes of a message start at 1.
            frames.insert(frames.begin(), nullptr);
            const auto message = std::make_unique<transport::Message>(std::move(frames));
            reading.object = samples::read(*registry->find(reading.type), index, message, registry,
                                           transport::SerializationContext());
            reading.description = samples::sampleSet(reading.type).describe(reading.object, samples::View::AsIs);
            reading.accepted = true;
        } catch (const session::ProtocolViolation& violation) {
            reading.refusal = violation.what();
        } catch (const std::exception& error) {
            reading.refusal = notes.explain(error, *registry, arrayTag);
        }
        return reading;
    }
};

StreamOfMessages::StreamOfMessages() : parts_(std::make_unique<Parts>()) {}

StreamOfMessages::~StreamOfMessages() = default;

void StreamOfMessages::feed(std::string_view bytes, const std::function<void(Reading)>& take) {
    while (!bytes.empty()) {
        std::size_t taken = 0;
        for (const iovec& part : parts_->reader.buffers()) {
            taken += bytes.copy(static_cast<char*>(part.iov_base), part.iov_len, taken);
        }
        bytes.remove_prefix(taken);
        parts_->reader.commit(taken);
        while (auto item = parts_->reader.next()) {
            if (auto* const message = std::get_if<session::MessageReader::Frames>(&*item)) {
                take(parts_->read(std::move(message->frames)));
            }
        }
    }
}

bool StreamOfMessages::atBoundary() const {
    return parts_->reader.atBoundary();
}

const std::shared_ptr<transport::Registry>& StreamOfMessages::registry() const {
    return parts_->registry;
}

}  // namespace conformance
