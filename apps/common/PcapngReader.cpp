#include "common/PcapngReader.hpp"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <limits>
#include <system_error>
#include <utility>

#include "common/Pcapng.hpp"

namespace apps {
namespace {

constexpr std::size_t readSize = 65'536;

// Type, length, and the length once more.
constexpr std::size_t blockFrame = 12;

// Of blocks that are read; far more than any of a recording has. Others can have any size.
constexpr std::uint32_t longestBlock = 16U << 20U;

// In front of what varies in size, type and length included.
constexpr std::size_t sectionFixed = 24;
constexpr std::size_t interfaceFixed = 16;
constexpr std::size_t packetFixed = 28;

std::string hexOf(std::string_view bytes) {
    constexpr std::string_view digits = "0123456789abcdef";
    std::string text;
    for (const char c : bytes) {
        const auto byte = static_cast<unsigned char>(c);
        text += text.empty() ? "" : " ";
        text += {digits[byte >> 4U], digits[byte & 0xFU]};
    }
    return text;
}

std::size_t padded(std::size_t size) {
    return (size + 3) / 4 * 4;
}

std::uint16_t bigEndian16(std::string_view bytes, std::size_t offset) {
    return static_cast<std::uint16_t>(static_cast<unsigned char>(bytes[offset]) << 8U |
                                      static_cast<unsigned char>(bytes[offset + 1]));
}

// What is behind the tags, if they name this system's dissector.
std::optional<std::string_view> withoutTags(std::string_view data) {
    constexpr std::uint16_t dissectorName = 12;
    bool ours = false;
    while (data.size() >= 4) {
        const std::uint16_t tag = bigEndian16(data, 0);
        const std::uint16_t length = bigEndian16(data, 2);
        data.remove_prefix(4);
        if (tag == 0) {
            return ours ? std::optional(data) : std::nullopt;
        }
        if (length > data.size()) {
            return std::nullopt;
        }
        const std::string_view value = data.substr(0, length);
        ours = ours || (tag == dissectorName && value.substr(0, value.find('\0')) == "krutil");
        data.remove_prefix(length);
    }
    return std::nullopt;
}

}  // namespace

PcapngReader::PcapngReader(const std::string& file, std::function<void(int)> wait)
    : name_(file == "-" ? "standard input" : "'" + file + "'"), wait_(std::move(wait)) {
    if (file != "-") {
        owned_.reset(::open(file.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY));
        if (!owned_) {
            throw std::system_error(errno, std::generic_category(), "cannot read " + name_);
        }
        descriptor_ = owned_.get();
    }
}

void PcapngReader::fail(std::uint64_t offset, const std::string& what, const std::string& expected,
                        const std::string& got) const {
    throw RecordingError(name_ + ", byte " + std::to_string(offset) + ": " + what + ": expected " + expected +
                         ", got " + got);
}

// Bytes.

// Whether so many bytes of the block are there.
bool PcapngReader::fill(std::size_t count) {
    while (buffer_.size() - begin_ < count) {
        buffer_.erase(0, std::exchange(begin_, 0));
        const std::size_t have = buffer_.size();
        if (wait_) {
            wait_(descriptor_);
        }
        buffer_.resize(have + readSize);
        const ssize_t got = ::read(descriptor_, buffer_.data() + have, readSize);
        const int error = errno;
        buffer_.resize(have + (got > 0 ? static_cast<std::size_t>(got) : 0));
        if (got == 0) {
            return false;
        }
        if (got < 0 && error != EINTR) {
            throw std::system_error(error, std::generic_category(), "cannot read " + name_);
        }
    }
    return true;
}

template <class Number>
Number PcapngReader::number(std::string_view bytes, std::size_t offset) const {
    Number value = 0;
    for (std::size_t i = 0; i < sizeof(Number); ++i) {
        const auto byte = static_cast<unsigned char>(bytes[offset + i]);
        const std::size_t place = swapped_ ? sizeof(Number) - 1 - i : i;
        value = static_cast<Number>(value | static_cast<Number>(static_cast<Number>(byte) << (8 * place)));
    }
    return value;
}

// Blocks.

// Whether a block that was to be skipped is behind us.
bool PcapngReader::skip() {
    while (skipping_ && skipping_->left > 0) {
        if (begin_ == buffer_.size() && !fill(1)) {
            return false;
        }
        const auto taken = std::min<std::uint64_t>(skipping_->left, buffer_.size() - begin_);
        begin_ += taken;
        position_ += taken;
        skipping_->left -= taken;
    }
    if (skipping_) {
        if (!fill(4)) {
            return false;
        }
        if (const auto second = number<std::uint32_t>(buffer_, begin_); second != skipping_->length) {
            fail(position_, "length at the end of a block", std::to_string(skipping_->length), std::to_string(second));
        }
        begin_ += 4;
        position_ += 4;
        skipping_.reset();
    }
    return true;
}

// Takes the next block of a known type whole: block() has it then.
bool PcapngReader::nextBlock() {
    for (;;) {
        begin_ += consumed_;
        position_ += std::exchange(consumed_, 0);
        if (!skip() || !fill(blockFrame)) {
            return false;
        }
        const std::string_view head = std::string_view(buffer_).substr(begin_);
        // The same in both byte orders.
        const bool section = number<std::uint32_t>(head, 0) == pcapng::sectionHeader;
        if (section) {
            swapped_ = false;
            swapped_ = number<std::uint32_t>(head, 8) != pcapng::byteOrderMagic;
            if (number<std::uint32_t>(head, 8) != pcapng::byteOrderMagic) {
                fail(position_ + 8, "byte order of a section", "1a 2b 3c 4d or 4d 3c 2b 1a", hexOf(head.substr(8, 4)));
            }
        } else if (position_ == 0) {
            fail(0, "first bytes", "0a 0d 0d 0a, with which a file of the format pcapng begins",
                 hexOf(head.substr(0, 4)));
        }
        const auto type = number<std::uint32_t>(head, 0);
        const auto length = number<std::uint32_t>(head, 4);
        if (length < blockFrame || length % 4 != 0) {
            fail(position_ + 4, "length of a block", "a multiple of 4 from 12 on", std::to_string(length));
        }
        if (!section && type != pcapng::interfaceDescription && type != pcapng::enhancedPacket) {
            begin_ += 8;
            position_ += 8;
            skipping_ = Skipping{length - blockFrame, length};
            continue;
        }
        if (length > longestBlock) {
            fail(position_ + 4, "length of a block", "at most " + std::to_string(longestBlock), std::to_string(length));
        }
        if (!fill(length)) {
            return false;
        }
        if (const auto second = number<std::uint32_t>(buffer_, begin_ + length - 4); second != length) {
            fail(position_ + length - 4, "length at the end of a block", std::to_string(length),
                 std::to_string(second));
        }
        consumed_ = length;
        return true;
    }
}

void PcapngReader::checkLength(std::size_t least, const char* where) const {
    if (consumed_ < least + 4) {
        fail(position_ + 4, std::string("length of ") + where, "at least " + std::to_string(least + 4),
             std::to_string(consumed_));
    }
}

void PcapngReader::forEachOption(std::string_view options,
                                 const std::function<void(std::uint16_t, std::string_view)>& take) const {
    const std::size_t end = consumed_ - 4;
    while (options.size() >= 4) {
        const auto code = number<std::uint16_t>(options, 0);
        const std::size_t length = number<std::uint16_t>(options, 2);
        if (code == pcapng::endOfOptions) {
            return;
        }
        if (options.size() - 4 < padded(length)) {
            fail(position_ + end - options.size(), "length of an option",
                 "at most the " + std::to_string(options.size() - 4) + " bytes that are left of its block",
                 std::to_string(length));
        }
        take(code, options.substr(4, length));
        options.remove_prefix(4 + padded(length));
    }
}

void PcapngReader::beginSection() {
    checkLength(sectionFixed, "a section header");
    if (const auto version = number<std::uint16_t>(block(), 12); version != 1) {
        fail(position_ + 12, "version of the format", "1", std::to_string(version));
    }
    section_.clear();
    program_.clear();
    comment_.clear();
    forEachOption(block().substr(sectionFixed, consumed_ - sectionFixed - 4),
                  [this](std::uint16_t code, std::string_view value) {
                      if (code == pcapng::userApplication) {
                          program_ = value;
                      } else if (code == pcapng::comment) {
                          comment_ = value;
                      }
                  });
}

void PcapngReader::addInterface() {
    checkLength(interfaceFixed, "the description of an interface");
    Interface described{{}, program_, comment_};
    unsigned resolution = 6;
    forEachOption(block().substr(interfaceFixed, consumed_ - interfaceFixed - 4),
                  [&](std::uint16_t code, std::string_view value) {
                      if (code == pcapng::interfaceName) {
                          described.name = value;
                      } else if (code == pcapng::timeResolution && !value.empty()) {
                          resolution = static_cast<unsigned char>(value[0]);
                      }
                  });
    if (resolution > 9) {
        fail(position_, "time resolution of an interface", "from 0 to 9, the negative power of ten of a second",
             std::to_string(resolution));
    }
    std::uint64_t nanosecondsPerUnit = 1;
    for (unsigned i = resolution; i < 9; ++i) {
        nanosecondsPerUnit *= 10;
    }
    section_.push_back({interfaces_.size(), number<std::uint16_t>(block(), 8), nanosecondsPerUnit});
    interfaces_.push_back(std::move(described));
}

// Packets.

// Empty for one that is no packet of a recording.
std::optional<PcapngReader::Packet> PcapngReader::packet() {
    checkLength(packetFixed, "a packet");
    const std::string_view bytes = block();
    const auto interface = number<std::uint32_t>(bytes, 8);
    const auto captured = number<std::uint32_t>(bytes, 20);
    const auto original = number<std::uint32_t>(bytes, 24);
    if (interface >= section_.size()) {
        fail(position_ + 8, "interface of a packet",
             "one of the " + std::to_string(section_.size()) + " that are described before it in its section",
             std::to_string(interface));
    }
    const std::size_t room = consumed_ - 4 - packetFixed;
    if (captured > room || padded(captured) > room) {
        fail(position_ + 20, "captured length of a packet",
             "at most the " + std::to_string(room) + " bytes of its block", std::to_string(captured));
    }
    const Description& description = section_[interface];
    const auto data = withoutTags(bytes.substr(packetFixed, captured));
    if (description.linkType != pcapng::upperPdu || !data) {
        return std::nullopt;
    }
    Packet packet;
    packet.offset = position_;
    packet.interface = description.number;
    packet.nanoseconds = (std::uint64_t{number<std::uint32_t>(bytes, 12)} << 32U | number<std::uint32_t>(bytes, 16)) *
                         description.nanosecondsPerUnit;
    packet.missing = original > captured ? original - captured : 0;
    packet.data = *data;
    std::uint32_t flags = 0;
    forEachOption(bytes.substr(packetFixed + padded(captured), room - padded(captured)),
                  [&](std::uint16_t code, std::string_view value) {
                      if (code == pcapng::packetFlags && value.size() == 4) {
                          flags = number<std::uint32_t>(value, 0);
                      } else if (code == pcapng::comment) {
                          packet.comments.emplace_back(value);
                      }
                  });
    const std::uint32_t direction = flags & (pcapng::inbound | pcapng::outbound);
    if (direction != pcapng::inbound && direction != pcapng::outbound) {
        fail(position_, "direction in the flags of a packet", "1 (inbound) or 2 (outbound)", std::to_string(direction));
    }
    packet.outbound = direction == pcapng::outbound;
    return packet;
}

std::optional<PcapngReader::Packet> PcapngReader::next() {
    while (nextBlock()) {
        const auto type = number<std::uint32_t>(block(), 0);
        if (type == pcapng::sectionHeader) {
            beginSection();
        } else if (type == pcapng::interfaceDescription) {
            addInterface();
        } else if (auto found = packet()) {
            return found;
        }
    }
    return std::nullopt;
}

}  // namespace apps
