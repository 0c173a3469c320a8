#include "foundation/msg_svc/transport/layers/session/OutgoingQueue.hpp"

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "foundation/msg_svc/transport/layers/session/StreamDescriptors.hpp"
#include "foundation/vantor/carrier/framing/DataFrame.hpp"
#include "foundation/vantor/carrier/framing/TaggedFrame.hpp"

namespace foundation::msg_svc::transport::layers::session {
namespace {

// Bounds of one gathered write. The bytes are bounded because writes happen under the session's lock, and a peer that
// reads as fast as this end writes would otherwise keep it locked for the whole of a large message.
constexpr std::size_t mostBytes = 1U << 20;
constexpr std::size_t mostPieces = 64;

}  // namespace

OutgoingPieces::OutgoingPieces(std::vector<std::unique_ptr<framing::Frame>> frames, bool answer)
    : frames_(std::move(frames)), answer_(answer) {
    headers_.reserve(frames_.size());
    pieces_.reserve(3 * frames_.size());
    for (const auto& frame : frames_) {
        const auto* const tagged = dynamic_cast<const framing::TaggedFrame*>(frame.get());
        FrameHeader header;
        header.kind = static_cast<std::uint8_t>(tagged != nullptr ? FrameKind::Tagged : FrameKind::Data);
        header.last = frame == frames_.back();
        header.type = frame->type();
        header.tagSize = static_cast<std::uint16_t>(tagged != nullptr ? tagged->tag().size() : 0);
        header.stream = frame->streamID();
        header.index = frame->index();
        header.contentSize = frame->size();
        headers_.push_back(encode(header));
        add(headers_.back().data(), FrameHeader::size);
        if (tagged != nullptr) {
            add(tagged->tag().data(), tagged->tag().size());
        }
        add(frame->data(), frame->size());
    }
}

OutgoingPieces::OutgoingPieces(FrameKind kind, const std::string& content) {
    FrameHeader header;
    header.kind = static_cast<std::uint8_t>(kind);
    header.contentSize = content.size();
    headers_.push_back(encode(header));
    add(headers_.back().data(), FrameHeader::size);
    copies_.push_back(std::make_unique<char[]>(content.size()));
    std::copy(content.begin(), content.end(), copies_.back().get());
    add(copies_.back().get(), content.size());
}

void OutgoingPieces::add(const void* begin, std::size_t size) {
    if (size != 0) {
        pieces_.push_back({const_cast<void*>(begin), size});
        bytes_ += size;
    }
}

void OutgoingPieces::gather(std::vector<iovec>& gathered, std::size_t& room, std::size_t most) const {
    for (std::size_t i = next_; i < pieces_.size() && room != 0 && gathered.size() < most; ++i) {
        gathered.push_back({pieces_[i].iov_base, std::min(pieces_[i].iov_len, room)});
        room -= gathered.back().iov_len;
    }
}

void OutgoingPieces::consume(std::size_t& written) {
    begun_ = begun_ || written != 0;
    while (next_ < pieces_.size() && written != 0) {
        iovec& piece = pieces_[next_];
        const std::size_t taken = std::min(written, piece.iov_len);
        piece.iov_base = static_cast<char*>(piece.iov_base) + taken;
        piece.iov_len -= taken;
        written -= taken;
        if (piece.iov_len == 0) {
            ++next_;
        }
    }
}

void OutgoingPieces::detachUnshareable() {
    for (const auto& frame : frames_) {
        const auto* const data = dynamic_cast<const framing::DataFrame*>(frame.get());
        if (data == nullptr || data->shareable()) {
            continue;
        }
        for (std::size_t i = next_; i < pieces_.size(); ++i) {
            // Only the end of a piece stays where it was.
            const auto* const end = static_cast<const char*>(pieces_[i].iov_base) + pieces_[i].iov_len;
            if (end == data->data() + data->size()) {
                copies_.push_back(std::make_unique<char[]>(pieces_[i].iov_len));
                std::memcpy(copies_.back().get(), pieces_[i].iov_base, pieces_[i].iov_len);
                pieces_[i].iov_base = copies_.back().get();
            }
        }
    }
}

int OutgoingQueue::writeOnce(int descriptor, std::vector<OutgoingPieces>& written) {
    gathered_.clear();
    std::size_t room = mostBytes;
    for (const OutgoingPieces& message : messages_) {
        if (room == 0 || gathered_.size() == mostPieces) {
            break;
        }
        message.gather(gathered_, room, mostPieces);
    }
    const ssize_t count = writeSome(descriptor, gathered_);
    if (count < 0) {
        return errno == EWOULDBLOCK ? EAGAIN : errno;
    }
    auto left = static_cast<std::size_t>(count);
    written_ += left;
    while (!messages_.empty()) {
        messages_.front().consume(left);
        if (!messages_.front().done()) {
            break;
        }
        written.push_back(std::move(messages_.front()));
        messages_.pop_front();
    }
    return 0;
}

std::vector<OutgoingPieces> OutgoingQueue::takeAll(bool keepBegun) {
    std::vector<OutgoingPieces> taken;
    const std::size_t kept = keepBegun && !messages_.empty() && messages_.front().begun() ? 1 : 0;
    while (messages_.size() > kept) {
        taken.push_back(std::move(messages_.back()));
        messages_.pop_back();
    }
    return taken;
}

}  // namespace foundation::msg_svc::transport::layers::session
