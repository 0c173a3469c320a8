#include "foundation/msg_svc/transport/layers/session/OutgoingQueue.hpp"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <utility>

#include "foundation/msg_svc/transport/layers/session/FrameKinds.hpp"
#include "foundation/msg_svc/transport/layers/session/StreamDescriptors.hpp"
#include "foundation/vantor/carrier/framing/DataFrame.hpp"

namespace foundation::msg_svc::transport::layers::session {
namespace {

// Bounds of one gathered write. The bytes are bounded because writes happen under the session's lock, and a peer that
// reads as fast as this end writes would otherwise keep it locked for the whole of a large message.
constexpr std::size_t mostBytes = 1U << 20;
constexpr std::size_t mostPieces = 1024;  // IOV_MAX

}  // namespace

OutgoingPieces::OutgoingPieces(std::vector<std::unique_ptr<framing::Frame>> frames, bool answer,
                               lending::Lender* lender)
    : frames_(std::move(frames)), answer_(answer) {
    headers_.reserve(frames_.size());
    pieces_.reserve(3 * frames_.size());
    for (const auto& frame : frames_) {
        auto* const data =
            lender == nullptr || asTagged(*frame) != nullptr ? nullptr : dynamic_cast<framing::DataFrame*>(frame.get());
        addFrame(*frame, frame == frames_.back(), data != nullptr ? lender->lend(*data) : std::nullopt);
    }
}

void OutgoingPieces::addFrame(const framing::Frame& frame, bool last, std::optional<lending::Loan> loan) {
    const auto* const tagged = asTagged(frame);
    FrameHeader header;
    header.kind = static_cast<std::uint8_t>(tagged != nullptr ? FrameKind::Tagged
                                            : loan            ? FrameKind::SharedData
                                                              : FrameKind::Data);
    header.last = last;
    header.type = frame.type();
    header.tagSize = static_cast<std::uint16_t>(tagged != nullptr ? tagged->tag().size() : 0);
    header.stream = frame.streamID();
    header.index = frame.index();
    header.contentSize = loan ? lending::SharedContent::bytes : frame.size();
    headers_.push_back(encode(header));
    add(headers_.back().data(), FrameHeader::size);
    if (tagged != nullptr) {
        add(tagged->tag().data(), tagged->tag().size());
    }
    if (loan) {
        lent_.push_back({pieces_.size() - 1, *std::move(loan)});
        const auto content = encode(lent_.back().loan.content());
        addCopy(content.data(), content.size());
    } else {
        add(frame.data(), frame.size());
    }
}

OutgoingPieces::OutgoingPieces(FrameKind kind, const std::string& content, bool answer) : answer_(answer) {
    FrameHeader header;
    header.kind = static_cast<std::uint8_t>(kind);
    header.contentSize = content.size();
    headers_.push_back(encode(header));
    add(headers_.back().data(), FrameHeader::size);
    addCopy(content.data(), content.size());
}

OutgoingPieces OutgoingPieces::giveBack(std::uint64_t number, bool kept) {
    FrameHeader header;
    header.kind = static_cast<std::uint8_t>(FrameKind::Return);
    header.type = static_cast<framing::FrameType>(kept ? 1 : 0);
    header.index = number;
    OutgoingPieces pieces;
    pieces.headers_.push_back(encode(header));
    pieces.add(pieces.headers_.back().data(), FrameHeader::size);
    // Nobody waits for room before it gives something back, so these are counted as answers are.
    pieces.answer_ = true;
    return pieces;
}

void OutgoingPieces::addCopy(const char* begin, std::size_t size) {
    copies_.push_back(std::make_unique<char[]>(size));
    std::copy_n(begin, size, copies_.back().get());
    add(copies_.back().get(), size);
}

void OutgoingPieces::add(const void* begin, std::size_t size) {
    if (size != 0) {
        pieces_.push_back({const_cast<void*>(begin), size});
        bytes_ += size;
    }
}

void OutgoingPieces::record(SessionRecorder& recorder) const {
    const auto give = [&recorder](std::span<const iovec> unit) {
        recorder.record(SessionRecorder::Direction::Sent, SessionRecorder::Part::Frame, unit);
    };
    auto lent = lent_.begin();
    auto begin = pieces_.begin();
    for (std::size_t i = 0; i < headers_.size(); ++i) {
        const void* const next = i + 1 < headers_.size() ? headers_[i + 1].data() : nullptr;
        const auto end =
            std::find_if(begin, pieces_.end(), [next](const iovec& piece) { return piece.iov_base == next; });
        std::vector<iovec> unit(begin, end);
        const bool isLent = lent != lent_.end() && pieces_.begin() + static_cast<std::ptrdiff_t>(lent->header) == begin;
        const auto giveWith = [&](iovec content) {
            unit.push_back(content);
            give(unit);
        };
        if (!isLent || !(lent++)->loan.read(giveWith)) {
            give(unit);
        }
        begin = end;
    }
}

void OutgoingPieces::gather(GatheredWrite& write) const {
    auto lent =
        std::find_if(lent_.begin(), lent_.end(), [this](const LentFrame& frame) { return frame.header >= next_; });
    for (std::size_t i = next_; i < pieces_.size() && !write.full(); ++i) {
        if (lent != lent_.end() && lent->header == i) {
            if (write.lentFramesLeft == 0) {
                // Nothing that follows can be written before this frame.
                write.piecesLeft = 0;
                return;
            }
            --write.lentFramesLeft;
            if (lent->loan.descriptor() >= 0) {
                write.descriptors.push_back(lent->loan.descriptor());
            }
            ++lent;
        }
        const std::size_t size = std::min(pieces_[i].iov_len, write.bytesLeft);
        write.pieces.push_back({pieces_[i].iov_base, size});
        write.bytesLeft -= size;
        --write.piecesLeft;
    }
}

void OutgoingPieces::consumeDescriptors(std::size_t& sent) {
    for (LentFrame& frame : lent_) {
        if (sent != 0 && frame.loan.descriptor() >= 0) {
            frame.loan.sent();
            --sent;
        }
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
        const auto* const data =
            asTagged(*frame) != nullptr ? nullptr : dynamic_cast<const framing::DataFrame*>(frame.get());
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
    pieces_.clear();
    descriptors_.clear();
    GatheredWrite write{std::move(pieces_), std::move(descriptors_), mostBytes, mostPieces};
    std::size_t gathered = 0;
    for (auto message = messages_.begin(); message != messages_.end() && !write.full(); ++message) {
        message->gather(write);
        ++gathered;
    }
    pieces_ = std::move(write.pieces);
    descriptors_ = std::move(write.descriptors);
    const ssize_t count = descriptors_.empty() ? writeSome(descriptor, pieces_)
                                               : lending::sendWithDescriptors(descriptor, pieces_, descriptors_);
    if (count < 0) {
        return errno == EWOULDBLOCK ? EAGAIN : errno;
    }
    std::size_t sent = descriptors_.size();
    for (auto message = messages_.begin(); sent != 0; ++message) {
        message->consumeDescriptors(sent);
    }
    auto left = static_cast<std::size_t>(count);
    written_ += left;
    written.reserve(gathered);
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

std::optional<OutgoingPieces> OutgoingQueue::takeLast() noexcept {
    if (messages_.empty()) {
        return std::nullopt;
    }
    std::optional<OutgoingPieces> last(std::move(messages_.back()));
    messages_.pop_back();
    return last;
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
