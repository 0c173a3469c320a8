#include "foundation/msg_svc/transport/layers/session/SessionChecker.hpp"

#include <algorithm>
#include <cstring>
#include <optional>
#include <unordered_set>
#include <utility>
#include <variant>

#include "foundation/korveldata/Array.hpp"
#include "foundation/msg_svc/transport/layers/session/FrameHeader.hpp"
#include "foundation/msg_svc/transport/layers/session/Intake.hpp"
#include "foundation/msg_svc/transport/layers/session/MessageReader.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionError.hpp"
#include "foundation/msg_svc/transport/layers/session/lending/LentContents.hpp"
#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"
#include "foundation/vantor/carrier/shared_memory/ReceivedMemory.hpp"

namespace foundation::msg_svc::transport::layers::session {
namespace {

using vantor::carrier::shared_memory::MemoryRefused;

// Rules that only a recording can break: a stream has no frames of another size than their headers say.
ProtocolViolation unlike(const std::string& what, const std::string& expected, const std::string& got) {
    return ProtocolViolation(what + ": expected " + expected + ", got " + got);
}

// What is received is not used.
class Nobody final : public SessionHandler {
  public:
    void onEnd(const SessionEnd&) override {}
};

// Contents that lie behind their frames.
class RecordedContents final : public lending::LentContents {
  public:
    framing::FrameBuffer borrow(const lending::SharedContent& content) override {
        if (content.size < lending::SharedContent::leastSize) {
            throw MemoryRefused("expected " + std::to_string(lending::SharedContent::leastSize) +
                                " bytes or more, got " + std::to_string(content.size));
        }
        framing::FrameBuffer buffer = framing::BufferAllocator::makeFrameBuffer(bytes.size());
        std::copy(bytes.begin(), bytes.end(), buffer.first.get());
        lent.insert(content.number);
        return buffer;
    }

    std::string_view bytes;                  // of the frame that is being taken
    std::unordered_set<std::uint64_t> lent;  // that were not returned
};

// The tag of the frames that have a limit of their own.
std::string arrayTagOf(const serialization::Registry& registry) {
    try {
        return registry.find(std::type_index(typeid(korveldata::Array)))->name();
    } catch (const std::out_of_range&) {
        return {};
    }
}

std::shared_ptr<const serialization::Registry> registryOf(const SessionConfig& config,
                                                          const SessionChecker::Settled& settled) {
    auto registry = std::make_shared<serialization::Registry>();
    ProtocolRegistry::getRegistry()->find(config.protocol).initialize(registry, config.version, settled.features);
    return registry;
}

SessionConfig receiving(SessionConfig config, Role role, const Limits& limits) {
    config.role = role;
    config.limits = limits;
    config.trace = nullptr;
    return config;
}

}  // namespace

class SessionChecker::Impl {
  public:
    Impl(const SessionConfig& config, const Settled& settled)
        : exchanges_(config.role),
          registry_(registryOf(config, settled)),
          fromClient_(receiving(config, Role::Engine, settled.engineLimits), *this, settled),
          fromEngine_(receiving(config, Role::Client, settled.clientLimits), *this, settled) {}

    void take(Role sender, std::string_view frame);
    bool atBoundary(Role sender) const noexcept {
        return (sender == Role::Client ? fromClient_ : fromEngine_).reader.atBoundary();
    }

  private:
    struct Direction {
        Direction(SessionConfig receiver, Impl& impl, const Settled& settled)
            : config(std::move(receiver)),
              reader(config.limits, arrayTagOf(*impl.registry_), settled.sharedMemory ? &contents : nullptr, nullptr,
                     settled.keepAlive),
              intake(config, impl.registry_, arrayTagOf(*impl.registry_), impl.exchanges_) {}

        const SessionConfig config;
        RecordedContents contents;
        MessageReader reader;
        Intake intake;
        bool aborted = false;
    };

    void feed(Direction& direction, std::string_view bytes);
    void takeItem(Direction& direction, MessageReader::Item item);

    SharedExchanges exchanges_;
    const std::shared_ptr<const serialization::Registry> registry_;
    Direction fromClient_;
    Direction fromEngine_;
    Nobody nobody_;
};

void SessionChecker::Impl::take(Role sender, std::string_view frame) {
    Direction& direction = sender == Role::Client ? fromClient_ : fromEngine_;
    if (direction.aborted) {
        throw unlike("frame behind an abort", "none", "one more");
    }
    if (frame.size() < FrameHeader::size) {
        throw unlike("size of a frame", "at least " + std::to_string(FrameHeader::size) + " bytes",
                     std::to_string(frame.size()));
    }
    FrameHeader::Bytes bytes;
    std::copy_n(frame.begin(), bytes.size(), bytes.begin());
    const FrameHeader header = decode(bytes);
    // Throws for a header or a tag that is not allowed, which says more than a size that does not fit.
    feed(direction, frame.substr(0, bytes.size()));
    frame.remove_prefix(bytes.size());
    const std::size_t tagSize = std::min<std::size_t>(header.tagSize, frame.size());
    feed(direction, frame.substr(0, tagSize));
    // Each size is less than the limit of its kind now, so the sum does not wrap around.
    const std::uint64_t onStream = header.tagSize + header.contentSize;
    std::uint64_t expected = onStream;
    if (header.is(FrameKind::SharedData) && frame.size() >= onStream) {
        expected += lending::decodeSharedContent(frame.data()).size;
    }
    if (frame.size() != expected || expected < onStream) {
        throw unlike("size of frame " + std::to_string(header.index) + " on stream " + std::to_string(header.stream),
                     std::to_string(expected) + " bytes behind its header", std::to_string(frame.size()));
    }
    direction.contents.bytes = frame.substr(onStream);
    feed(direction, frame.substr(tagSize, onStream - tagSize));
}

void SessionChecker::Impl::feed(Direction& direction, std::string_view bytes) {
    while (!bytes.empty()) {
        std::size_t count = 0;
        for (const iovec& piece : direction.reader.buffers()) {
            const std::size_t taken = std::min(piece.iov_len, bytes.size());
            std::memcpy(piece.iov_base, bytes.data(), taken);
            bytes.remove_prefix(taken);
            count += taken;
        }
        direction.reader.commit(count);
        while (auto item = direction.reader.next()) {
            takeItem(direction, std::move(*item));
        }
    }
}

void SessionChecker::Impl::takeItem(Direction& direction, MessageReader::Item item) {
    if (const auto* const returned = std::get_if<MessageReader::Returned>(&item)) {
        RecordedContents& lender = (&direction == &fromClient_ ? fromEngine_ : fromClient_).contents;
        if (lender.lent.erase(returned->number) == 0) {
            throw unlike("return frame", "the number of a content that is lent", std::to_string(returned->number));
        }
    } else if (std::holds_alternative<MessageReader::Abort>(item)) {
        direction.aborted = true;
    } else if (std::holds_alternative<MessageReader::KeepAlive>(item)) {
        direction.intake.takeKeepAlive();
    } else if (std::holds_alternative<MessageReader::Goodbye>(item)) {
        direction.intake.takeGoodbye(nobody_);
    } else {
        direction.intake.takeMessage(std::move(std::get<MessageReader::Frames>(item).frames), nobody_);
    }
}

SessionChecker::SessionChecker(const SessionConfig& config, const Settled& settled)
    : impl_(std::make_unique<Impl>(config, settled)) {}

SessionChecker::~SessionChecker() = default;

void SessionChecker::take(Role sender, std::string_view frame) {
    impl_->take(sender, frame);
}

bool SessionChecker::atBoundary(Role sender) const noexcept {
    return impl_->atBoundary(sender);
}

}  // namespace foundation::msg_svc::transport::layers::session
