#include "foundation/msg_svc/transport/layers/session/MessageReader.hpp"

#include <algorithm>
#include <new>
#include <utility>

#include "foundation/msg_svc/transport/layers/session/PrintableText.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionError.hpp"
#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"
#include "foundation/vantor/carrier/framing/DataFrame.hpp"
#include "foundation/vantor/carrier/framing/TaggedFrame.hpp"
#include "foundation/vantor/carrier/shared_memory/ReceivedMemory.hpp"

namespace foundation::msg_svc::transport::layers::session {
namespace {

[[noreturn]] void refuse(const std::string& what, const std::string& expected, const std::string& got) {
    throw ProtocolViolation(what + ": expected " + expected + ", got " + got);
}

[[noreturn]] void refuseSize(const char* limit, std::uint64_t accepted, const char* unit, const std::string& where,
                             std::uint64_t got) {
    refuse(where + " exceeds the limit \"" + limit + "\"", "at most " + std::to_string(accepted) + " " + unit,
           std::to_string(got));
}

[[noreturn]] void refuseForMemory(framing::FrameIndex index, std::uint64_t size) {
    throw ProtocolViolation("there is no memory for the content of " + frameName(index) + ", " + std::to_string(size) +
                            " bytes");
}

}  // namespace

MessageReader::MessageReader(const Limits& limits, std::string arrayTag, lending::LentContents* borrower,
                             SessionRecorder* recorder, bool keepAlive)
    : limits_(limits),
      arrayTag_(std::move(arrayTag)),
      borrower_(borrower),
      recorder_(recorder),
      keepAlive_(keepAlive),
      ahead_(new char[mostAhead]) {}

std::span<const iovec> MessageReader::buffers() noexcept {
    std::size_t count = 0;
    if (straight()) {
        const std::size_t missing = content_.second - contentHave_;
        buffers_[count++] = {content_.first.get() + contentHave_, missing};
        if (missing >= mostAhead) {
            // Another large content may follow, which is better read straight to its place.
            aheadWanted_ = usualAhead;
        }
    }
    buffers_[count++] = {ahead_.get(), aheadWanted_};
    return {buffers_.data(), count};
}

void MessageReader::commit(std::size_t count) noexcept {
    if (straight()) {
        const std::size_t taken = std::min(count, content_.second - contentHave_);
        contentHave_ += taken;
        count -= taken;
    }
    aheadBegin_ = 0;
    aheadEnd_ = count;
    // Whoever sends more than is usually there at once gets fewer reads.
    aheadWanted_ = count == aheadWanted_ ? mostAhead : usualAhead;
}

// Gives a part of a frame what is there of it.
void MessageReader::take(char* target, std::size_t& have, std::size_t size) noexcept {
    const std::size_t taken = std::min(size - have, aheadEnd_ - aheadBegin_);
    std::copy_n(ahead_.get() + aheadBegin_, taken, target + have);
    aheadBegin_ += taken;
    have += taken;
}

std::optional<MessageReader::Item> MessageReader::next() {
    for (;;) {
        if (!header_) {
            take(headerBytes_.data(), headerHave_, headerBytes_.size());
            if (headerHave_ < headerBytes_.size()) {
                return std::nullopt;
            }
            acceptHeader();
        }
        take(tag_.data(), tagHave_, tag_.size());
        if (tagHave_ < tag_.size()) {
            return std::nullopt;
        }
        if (!content_.first) {
            allocateContent();
        }
        take(content_.first.get(), contentHave_, content_.second);
        if (contentHave_ < content_.second) {
            return std::nullopt;
        }
        if (auto item = completeFrame()) {
            return item;
        }
    }
}

void MessageReader::acceptHeader() {
    header_ = decode(headerBytes_);
    const bool shared = borrower_ != nullptr && header_->is(FrameKind::SharedData);
    if (shared || header_->is(FrameKind::Tagged) || header_->is(FrameKind::Data)) {
        checkMessageHeader();
    } else if (borrower_ != nullptr && header_->is(FrameKind::Return)) {
        checkReturnHeader();
    } else {
        checkControlHeader();
    }
    tag_.resize(header_->tagSize);
    // The tag decides between two limits; only a content that keeps to both need not wait for it.
    if (!header_->is(FrameKind::Tagged) ||
        header_->contentSize <= std::min(limits_.taggedFrame, limits_.arrayMessage)) {
        allocateContent();
    }
}

std::string MessageReader::expectedKinds() const {
    std::vector<std::string> kinds{"1 (tagged)", "2 (data)", "3 (goodbye)", "4 (abort)"};
    if (borrower_ != nullptr) {
        kinds.insert(kinds.end(), {"5 (shared data)", "6 (return)"});
    }
    if (keepAlive_) {
        kinds.emplace_back("7 (keep-alive)");
    }
    std::string text = kinds.front();
    for (std::size_t i = 1; i < kinds.size(); ++i) {
        text += (i + 1 < kinds.size() ? ", " : " or ") + kinds[i];
    }
    return text;
}

void MessageReader::checkControlHeader() const {
    const bool abort = header_->is(FrameKind::Abort);
    const bool keepAlive = keepAlive_ && header_->is(FrameKind::KeepAlive);
    if (!abort && !keepAlive && !header_->is(FrameKind::Goodbye)) {
        refuse("frame kind", expectedKinds(), std::to_string(header_->kind));
    }
    const std::string name = abort ? "abort frame" : keepAlive ? "keep-alive frame" : "goodbye frame";
    if (header_->last || header_->type != framing::FrameType::Unspecified || header_->tagSize != 0 ||
        header_->stream != 0 || header_->index != 0) {
        throw ProtocolViolation(name + ": expected last bit, frame type, tag size, stream ID and index 0");
    }
    if (!abort && header_->contentSize != 0) {
        refuse(name, "no content", std::to_string(header_->contentSize) + " bytes");
    }
    if (!abort && !frames_.empty()) {
        throw ProtocolViolation(name + " in the middle of a message: expected " + frameName(frames_.size() + 1));
    }
    if (header_->contentSize > longestReason) {
        refuse(name, "a reason of at most " + std::to_string(longestReason) + " bytes",
               std::to_string(header_->contentSize));
    }
}

void MessageReader::checkReturnHeader() const {
    if (header_->last || static_cast<std::uint8_t>(header_->type) > 1 || header_->tagSize != 0 ||
        header_->stream != 0 || header_->contentSize != 0) {
        throw ProtocolViolation(
            "return frame: expected frame type 0 or 1, and last bit, tag size, stream ID and content size 0");
    }
    if (!frames_.empty()) {
        throw ProtocolViolation("return frame in the middle of a message: expected " + frameName(frames_.size() + 1));
    }
}

void MessageReader::checkMessageHeader() const {
    const FrameHeader& header = *header_;
    const framing::FrameIndex expected = frames_.size() + 1;
    if (header.index != expected) {
        refuse("frame index", std::to_string(expected), std::to_string(header.index));
    }
    if (!frames_.empty() && header.stream != frames_.front()->streamID()) {
        refuse("stream ID of " + frameName(expected),
               std::to_string(frames_.front()->streamID()) + " as in the frames before it in its message",
               std::to_string(header.stream));
    }
    if (expected > limits_.frames) {
        refuseSize("frames", limits_.frames, "frames", "number of frames of a message", expected);
    }
    // For what is wrong only: well-formed frames cost no text.
    const auto frame = [&] { return frameName(expected) + " on stream " + std::to_string(header.stream); };
    if (!header.is(FrameKind::Tagged)) {
        if (header.tagSize != 0) {
            refuse("tag of a data frame (" + frame() + ")", "none", std::to_string(header.tagSize) + " bytes");
        }
        if (header.is(FrameKind::SharedData) && header.contentSize != lending::SharedContent::bytes) {
            refuse("content of a shared data frame (" + frame() + ")",
                   std::to_string(lending::SharedContent::bytes) + " bytes", std::to_string(header.contentSize));
        }
    } else {
        if (header.tagSize == 0) {
            refuse("tag of a tagged frame (" + frame() + ")", "at least 1 byte", "none");
        }
        if (header.tagSize > limits_.tag) {
            refuseSize("tag", limits_.tag, "bytes", "tag of " + frame(), header.tagSize);
        }
        const bool array = limits_.arrayMessage > limits_.taggedFrame;
        const std::uint64_t accepted = array ? limits_.arrayMessage : limits_.taggedFrame;
        if (header.contentSize > accepted) {
            refuseSize(array ? "arrayMessage" : "taggedFrame", accepted, "bytes", "content of " + frame(),
                       header.contentSize);
        }
    }
    checkMessageSize(header.contentSize);
}

// With a content of that size in the frame that is arriving.
void MessageReader::checkMessageSize(std::uint64_t contentSize) const {
    const FrameHeader& header = *header_;
    // Written as a difference, so that no claim can make a sum wrap around.
    const std::uint64_t room = limits_.message - std::min(limits_.message, messageBytes_ + header.tagSize);
    if (contentSize > room || messageBytes_ + header.tagSize > limits_.message) {
        refuse(
            "message with " + frameName(header.index) + " on stream " + std::to_string(header.stream) +
                " exceeds the limit \"message\"",
            "at most " + std::to_string(limits_.message) + " bytes",
            std::to_string(messageBytes_ + header.tagSize) + " bytes and a content of " + std::to_string(contentSize));
    }
}

void MessageReader::allocateContent() {
    const std::uint64_t size = header_->contentSize;
    try {
        if (header_->is(FrameKind::Data)) {
            content_ = framing::BufferAllocator::makeFrameBuffer(size);
            return;
        }
        if (header_->is(FrameKind::Tagged) && tagHave_ == tag_.size()) {
            const bool array = tag_ == arrayTag_;
            const std::uint64_t accepted = array ? limits_.arrayMessage : limits_.taggedFrame;
            if (size > accepted) {
                refuseSize(array ? "arrayMessage" : "taggedFrame", accepted, "bytes",
                           "content of " + frameName(header_->index) + " with tag " + quoted(tag_), size);
            }
        }
        content_ = {std::unique_ptr<char[], std::function<void(char*)>>(new char[size], std::default_delete<char[]>()),
                    size};
    } catch (const std::bad_alloc&) {
        refuseForMemory(header_->index, size);
    }
}

// The content says where the frame's bytes are, which are its content from now on.
void MessageReader::borrowContent() {
    const lending::SharedContent shared = lending::decodeSharedContent(content_.first.get());
    checkMessageSize(shared.size);
    framing::FrameBuffer borrowed;
    try {
        borrowed = borrower_->borrow(shared);
    } catch (const vantor::carrier::shared_memory::MemoryRefused& refused) {
        throw ProtocolViolation("shared content of " + frameName(header_->index) + " on stream " +
                                std::to_string(header_->stream) + ": " + refused.what());
    } catch (const std::bad_alloc&) {
        refuseForMemory(header_->index, shared.size);
    }
    if (recorder_ != nullptr) {
        recordFrame({borrowed.first.get(), borrowed.second});
    }
    content_ = std::move(borrowed);
}

// What is there of the frame that is arriving, and the content that it lends.
void MessageReader::recordFrame(iovec lent) const {
    const std::array<iovec, 4> unit{iovec{const_cast<char*>(headerBytes_.data()), headerHave_},
                                    iovec{const_cast<char*>(tag_.data()), tagHave_},
                                    iovec{content_.first.get(), contentHave_}, lent};
    recorder_->record(SessionRecorder::Direction::Received, SessionRecorder::Part::Frame, unit);
}

void MessageReader::recordUnfinished() const {
    if (recorder_ != nullptr && headerHave_ != 0) {
        recordFrame({});
    }
}

std::unique_ptr<framing::Frame> MessageReader::takeFrame() {
    if (header_->is(FrameKind::SharedData)) {
        borrowContent();
    }
    if (!header_->is(FrameKind::Tagged)) {
        return std::make_unique<framing::DataFrame>(header_->type, header_->stream, std::move(content_), true,
                                                    header_->index);
    }
    return std::make_unique<framing::TaggedFrame>(header_->type, header_->stream, tag_, std::move(content_),
                                                  header_->index);
}

std::optional<MessageReader::Item> MessageReader::completeFrame() {
    if (recorder_ != nullptr && !header_->is(FrameKind::SharedData)) {
        recordFrame({});
    }
    std::optional<Item> item;
    if (header_->is(FrameKind::Goodbye)) {
        item = Goodbye{};
    } else if (header_->is(FrameKind::KeepAlive)) {
        item = KeepAlive{};
    } else if (header_->is(FrameKind::Abort)) {
        item = Abort{std::string(content_.first.get(), content_.second)};
    } else if (header_->is(FrameKind::Return)) {
        item = Returned{header_->index, header_->type != framing::FrameType::Unspecified};
    } else {
        frames_.push_back(takeFrame());
        messageBytes_ += header_->tagSize + frames_.back()->size();
        if (header_->last) {
            item = Frames{std::exchange(frames_, {})};
            messageBytes_ = 0;
        }
    }
    header_.reset();
    headerHave_ = 0;
    tag_.clear();
    tagHave_ = 0;
    content_ = {};
    contentHave_ = 0;
    return item;
}

bool MessageReader::atBoundary() const noexcept {
    return !header_ && headerHave_ == 0 && frames_.empty();
}

std::string MessageReader::position() const {
    if (atBoundary()) {
        return "between two messages";
    }
    const std::string frame = frameName(frames_.size() + 1);
    if (!header_) {
        return "in the middle of a message: " + std::to_string(headerHave_) + " of " +
               std::to_string(FrameHeader::size) + " header bytes of " + frame + " had arrived";
    }
    if (tagHave_ < tag_.size()) {
        return "in the middle of a message: " + std::to_string(tagHave_) + " of " + std::to_string(tag_.size()) +
               " tag bytes of " + frame + " had arrived";
    }
    return "in the middle of a message: " + std::to_string(contentHave_) + " of " +
           std::to_string(header_->contentSize) + " content bytes of " + frame +
           (tag_.empty() ? std::string() : ", tag " + quoted(tag_) + ",") + " had arrived";
}

}  // namespace foundation::msg_svc::transport::layers::session
