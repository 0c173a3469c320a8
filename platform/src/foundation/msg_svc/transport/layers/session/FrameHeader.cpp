#include "foundation/msg_svc/transport/layers/session/FrameHeader.hpp"

#include "foundation/msg_svc/transport/layers/session/LittleEndian.hpp"

namespace foundation::msg_svc::transport::layers::session {
namespace {

constexpr std::uint8_t lastBit = 0x80;

}  // namespace

FrameHeader::Bytes encode(const FrameHeader& header) noexcept {
    FrameHeader::Bytes bytes;
    bytes[0] = static_cast<char>(header.last ? header.kind | lastBit : header.kind);
    bytes[1] = static_cast<char>(header.type);
    storeLittleEndian(bytes.data() + 2, header.tagSize);
    storeLittleEndian(bytes.data() + 4, header.stream);
    storeLittleEndian(bytes.data() + 8, header.index);
    storeLittleEndian(bytes.data() + 16, header.contentSize);
    return bytes;
}

FrameHeader decode(const FrameHeader::Bytes& bytes) noexcept {
    const auto first = static_cast<std::uint8_t>(bytes[0]);
    FrameHeader header;
    header.kind = static_cast<std::uint8_t>(first & ~lastBit);
    header.last = (first & lastBit) != 0;
    header.type = static_cast<framing::FrameType>(bytes[1]);
    header.tagSize = loadLittleEndian<std::uint16_t>(bytes.data() + 2);
    header.stream = loadLittleEndian<std::uint32_t>(bytes.data() + 4);
    header.index = loadLittleEndian<std::uint64_t>(bytes.data() + 8);
    header.contentSize = loadLittleEndian<std::uint64_t>(bytes.data() + 16);
    return header;
}

}  // namespace foundation::msg_svc::transport::layers::session
